#include "store/reads/NewsLines.h"

#include <algorithm>
#include <charconv>
#include <sstream>

namespace rolvane {

namespace {

constexpr size_t kLongestLine = 200, kLongestPosition = 100;

bool isPosition(const std::string& text) {
    return !text.empty() && text.size() <= kLongestPosition &&
           std::all_of(text.begin(), text.end(), [](char c) { return c > ' ' && c < '\x7f' && c != '<' && c != '&'; });
}

} // namespace

std::optional<NewsLine> NewsLines::parse(std::string_view line) const {
    std::istringstream words{std::string(line)};
    std::string what, number;
    words >> what;
    NewsLine parsed;
    if (what == "begin")
        parsed.kind = NewsLine::Kind::begin;
    else if (what == "no")
        parsed.kind = NewsLine::Kind::no;
    else if (what == "news")
        parsed.kind = NewsLine::Kind::news;
    else if (what != "still")
        return std::nullopt;
    if (parsed.kind == NewsLine::Kind::no || parsed.kind == NewsLine::Kind::news) {
        words >> number;
        size_t count = 0;
        const auto [end, error] = std::from_chars(number.data(), number.data() + number.size(), count);
        if (error != std::errc() || end != number.data() + number.size() || count < 1 || count > _trees)
            return std::nullopt;
        parsed.tree = count - 1;
    }
    if (parsed.kind == NewsLine::Kind::no) return parsed;
    words >> parsed.position; // more words may follow in a later version
    return isPosition(parsed.position) ? std::optional(parsed) : std::nullopt;
}

std::optional<std::vector<NewsLine>> NewsLines::take(std::string_view bytes) {
    if (_failed) return std::nullopt;
    _failed = true; // until it has gone well
    _rest.append(bytes);
    std::vector<NewsLine> lines;
    for (size_t end = 0; (end = _rest.find('\n')) != std::string::npos; _rest.erase(0, end + 1)) {
        auto line = end <= kLongestLine ? parse(std::string_view(_rest).substr(0, end)) : std::nullopt;
        if (!line || (line->kind == NewsLine::Kind::begin) == _begun) return std::nullopt;
        _begun = true;
        lines.push_back(std::move(*line));
    }
    if (_rest.size() > kLongestLine) return std::nullopt;
    _failed = false;
    return lines;
}

} // namespace rolvane
