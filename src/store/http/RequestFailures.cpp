#include "store/http/RequestFailures.h"

#include "foundation/Date.h"
#include "foundation/Mutex.h"
#include "foundation/Utf8.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <string_view>
#include <strings.h>
#include <utility>

namespace rolvane {

namespace {

constexpr size_t kMostBytes = 200;         // of the words
constexpr size_t kLookedAt = 64u << 10;    // of a body
constexpr size_t kTreeComponents = 3;      // "/", user, "Contacts"
constexpr std::string_view kOverflow = ""; // no kind's key

bool startsWithNoCase(std::string_view text, std::string_view start) {
    return text.size() >= start.size() && strncasecmp(text.data(), start.data(), start.size()) == 0;
}

size_t findNoCase(std::string_view text, std::string_view wanted, size_t from) {
    for (size_t at = from; at + wanted.size() <= text.size(); ++at)
        if (startsWithNoCase(text.substr(at), wanted)) return at;
    return std::string_view::npos;
}

// Characters that turn the direction of writing, or that nobody sees.
bool isUnseen(char32_t c) {
    return c == 0xAD || c == 0x61C || c == 0x180E || (c >= 0x200B && c <= 0x200F) || (c >= 0x202A && c <= 0x202E) ||
           (c >= 0x2060 && c <= 0x206F) || c == 0xFEFF || (c >= 0xFFF9 && c <= 0xFFFB) ||
           (c >= 0xE0000 && c <= 0xE0FFF);
}

bool isSpace(char32_t c) {
    return c <= 0x20 || (c >= 0x7F && c <= 0xA0) || c == 0x2028 || c == 0x2029 || c == 0x3000;
}

// One line of at most kMostBytes: white space and control characters become single spaces, unseen characters go.
std::string cleaned(std::string_view text) {
    constexpr std::string_view kMore = "...";
    std::string out;
    size_t whole = 0; // how much is kept when the text turns out to be too long
    bool gap = false;
    while (!text.empty()) {
        auto c = takeCodePoint(text);
        if (!c) {
            text.remove_prefix(1);
            c = U'\uFFFD';
        }
        if (isUnseen(*c)) continue;
        if (isSpace(*c)) {
            gap = !out.empty();
            continue;
        }
        std::string next = gap ? " " : "";
        appendUtf8(*c, next);
        gap = false;
        if (out.size() + next.size() > kMostBytes) return out.substr(0, whole) + std::string(kMore);
        out += next;
        if (out.size() + kMore.size() <= kMostBytes) whole = out.size();
    }
    return out;
}

// Takes an entity off the front of the text, which begins with '&'.
void takeEntity(std::string_view& text, std::string& out) {
    static constexpr std::array<std::pair<std::string_view, std::string_view>, 6> kNamed{
        {{"&amp;", "&"}, {"&quot;", "\""}, {"&apos;", "'"}, {"&nbsp;", " "}, {"&lt;", " "}, {"&gt;", " "}}};
    for (const auto& [entity, meaning] : kNamed)
        if (text.starts_with(entity)) {
            out += meaning;
            return text.remove_prefix(entity.size());
        }
    const size_t end = text.substr(0, 12).find(';');
    if (text.starts_with("&#") && end != std::string_view::npos) {
        const bool hex = text[2] == 'x' || text[2] == 'X';
        const std::string_view digits = text.substr(hex ? 3 : 2, end - (hex ? 3 : 2));
        uint32_t c = 0;
        const auto [stop, fault] = std::from_chars(digits.data(), digits.data() + digits.size(), c, hex ? 16 : 10);
        const bool isCharacter = c > 0x20 && c != '<' && c != '>' && c < 0x110000 && (c < 0xD800 || c > 0xDFFF);
        if (fault == std::errc() && stop == digits.data() + digits.size()) {
            if (isCharacter)
                appendUtf8(c, out);
            else
                out += ' ';
            return text.remove_prefix(end + 1);
        }
    }
    out += '&';
    text.remove_prefix(1);
}

// The name of the element that a tag begins, without its prefix; "" for an end, a comment or a declaration.
std::string_view elementIn(std::string_view tag) {
    const size_t end = tag.find_first_of(" \t\r\n/>", 1);
    std::string_view name = tag.substr(1, end == std::string_view::npos ? end : end - 1);
    if (name.empty() || name.front() == '/' || name.front() == '!' || name.front() == '?') return {};
    if (const size_t colon = name.find(':'); colon != std::string_view::npos) name.remove_prefix(colon + 1);
    return name;
}

// The text of a document with markup, without its scripts and its head. `innermost`: the last element that begins
// before the first one ends.
std::string withoutMarkup(std::string_view text, std::string_view& innermost) {
    std::string out;
    bool ended = false;
    while (!text.empty()) {
        if (text.front() == '&') {
            takeEntity(text, out);
        } else if (text.front() != '<') {
            const size_t end = std::min(text.find_first_of("<&"), text.size());
            out += text.substr(0, end);
            text.remove_prefix(end);
        } else {
            size_t end = text.find('>');
            if (text.starts_with("<!--"))
                if (end = text.find("-->"); end != std::string_view::npos) end += 2;
            const std::string_view name = elementIn(text.substr(0, end));
            ended = ended || text.starts_with("</");
            if (!ended && !name.empty()) innermost = name;
            ended = ended || (end != std::string_view::npos && end > 0 && text[end - 1] == '/' && !name.empty());
            for (const std::string_view left : {"script", "style", "head"})
                if (name.size() == left.size() && startsWithNoCase(name, left))
                    if (const size_t close = findNoCase(text, "</" + std::string(left), 0);
                        close != std::string_view::npos)
                        end = text.find('>', close);
            out += ' ';
            text.remove_prefix(end == std::string_view::npos ? text.size() : end + 1);
        }
    }
    return out;
}

std::string titleIn(std::string_view html) {
    const size_t from = findNoCase(html, "<title", 0);
    const size_t begin = from == std::string_view::npos ? from : html.find('>', from);
    const size_t end = begin == std::string_view::npos ? begin : findNoCase(html, "</title", begin);
    if (end == std::string_view::npos) return {};
    std::string_view unused;
    return withoutMarkup(html.substr(begin + 1, end - begin - 1), unused);
}

std::string treeOf(const Url& name) {
    Url tree = name;
    while (tree.pathComponents().size() > kTreeComponents) tree = tree.cxURLByDeletingLastComponent();
    return tree.absoluteString();
}

} // namespace

std::string serverWords(const HttpResponse& answer) {
    if (!answer.complete()) return cleaned(answer.detail.empty() ? description(answer.error) : answer.detail);
    const std::string* target = answer.status >= 300 && answer.status < 400 ? answer.header("location") : nullptr;
    if (target && !target->empty()) return cleaned("sends to " + *target);
    const std::string* type = answer.header("content-type");
    const std::string_view kind = type ? std::string_view(*type) : std::string_view();
    const std::string_view body = std::string_view(answer.body).substr(0, kLookedAt);
    if (startsWithNoCase(kind, "text/plain")) return cleaned(body);
    const bool isHtml = findNoCase(kind, "html", 0) != std::string_view::npos;
    if (!isHtml && findNoCase(kind, "xml", 0) == std::string_view::npos) return {};
    std::string_view innermost;
    std::string words = cleaned(withoutMarkup(body, innermost));
    if (words.empty()) words = isHtml ? cleaned(titleIn(body)) : cleaned(innermost);
    return words;
}

void RequestFailures::note(std::string method, Url name, const HttpResponse& answer) {
    note({std::move(method), std::move(name), answer.complete() ? answer.status : 0, answer.error, serverWords(answer),
          retryAfterSeconds(answer, Clock::system().now())});
}

void RequestFailures::note(RequestFailure failure) {
    std::string kind = treeOf(failure.name) + " " + failure.method + " " + std::to_string(failure.status) + " " +
                       std::to_string(static_cast<int>(failure.error));
    const Lock guard(_mutex);
    if (_kinds.size() >= kKinds && !_kinds.contains(kind)) kind = kOverflow;
    Kept& kept = _kinds[kind];
    Numbered numbered{++_noted, std::move(failure)};
    if (kept.first.size() < kFirst) return kept.first.push_back(std::move(numbered));
    if (kept.last.size() == kLast) kept.last.pop_front();
    kept.last.push_back(std::move(numbered));
}

std::vector<RequestFailure> RequestFailures::take() {
    std::map<std::string, Kept> kinds;
    {
        const Lock guard(_mutex);
        kinds.swap(_kinds);
    }
    std::vector<Numbered> all;
    for (auto& [kind, kept] : kinds) {
        std::move(kept.first.begin(), kept.first.end(), std::back_inserter(all));
        std::move(kept.last.begin(), kept.last.end(), std::back_inserter(all));
    }
    std::sort(all.begin(), all.end(), [](const Numbered& a, const Numbered& b) { return a.number < b.number; });
    std::vector<RequestFailure> failures;
    failures.reserve(all.size());
    for (Numbered& one : all) failures.push_back(std::move(one.failure));
    return failures;
}

std::optional<RequestFailure> RequestFailures::latestBelow(const Url& baseName) const {
    const std::string& base = baseName.absoluteString();
    const auto isBelow = [&base](const Url& name) {
        const std::string& text = name.absoluteString();
        return text.starts_with(base) &&
               (text.size() == base.size() || base.ends_with('/') || text[base.size()] == '/');
    };
    const Numbered* latest = nullptr;
    const auto look = [&](const Numbered& one) {
        if ((!latest || one.number > latest->number) && isBelow(one.failure.name)) latest = &one;
    };
    const Lock guard(_mutex);
    for (const auto& [kind, kept] : _kinds) {
        for (const Numbered& one : kept.first) look(one);
        for (const Numbered& one : kept.last) look(one);
    }
    return latest ? std::optional(latest->failure) : std::nullopt;
}

} // namespace rolvane
