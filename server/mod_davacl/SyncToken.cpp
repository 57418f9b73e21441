#include "server/mod_davacl/SyncToken.h"

#include <charconv>
#include <vector>

namespace rolvane::davacl {
namespace {

constexpr std::string_view kStart = "urn:x-rolvane:tree:";

void put(std::string& text, uint64_t number) {
    char digits[16];
    const auto end = std::to_chars(digits, digits + sizeof digits, number, 16).ptr;
    text.append(":").append(digits, end);
}

std::optional<uint64_t> numberIn(std::string_view part) {
    uint64_t number = 0;
    const auto [end, error] = std::from_chars(part.data(), part.data() + part.size(), number, 16);
    return error == std::errc() && end == part.data() + part.size() ? std::optional(number) : std::nullopt;
}

} // namespace

std::string SyncToken::text() const {
    std::string out = std::string(kStart) + (isDeep ? "d" : "s");
    for (const uint64_t part : {epoch, scope, static_cast<uint64_t>(number), static_cast<uint64_t>(time)})
        put(out, part);
    if (cut)
        for (const uint64_t part :
             {cut->hash, static_cast<uint64_t>(cut->base), static_cast<uint64_t>(cut->time), uint64_t{cut->isFirst}})
            put(out, part);
    return out;
}

std::optional<SyncToken> SyncToken::parse(std::string_view text) {
    if (!text.starts_with(kStart)) return std::nullopt;
    text.remove_prefix(kStart.size());
    if (!text.starts_with("d:") && !text.starts_with("s:")) return std::nullopt;
    SyncToken token;
    token.isDeep = text.front() == 'd';
    text.remove_prefix(2);
    std::vector<uint64_t> parts;
    for (size_t end = 0; end != std::string_view::npos; text.remove_prefix(end + 1)) {
        end = text.find(':');
        const auto number = numberIn(text.substr(0, end));
        if (!number || parts.size() == 8) return std::nullopt;
        parts.push_back(*number);
        if (end == std::string_view::npos) break;
    }
    if (parts.size() != 4 && parts.size() != 8) return std::nullopt;
    token.epoch = parts[0];
    token.scope = parts[1];
    token.number = static_cast<int64_t>(parts[2]);
    token.time = static_cast<int64_t>(parts[3]);
    if (parts.size() == 8)
        token.cut = Cut{parts[4], static_cast<int64_t>(parts[5]), static_cast<int64_t>(parts[6]), parts[7] != 0};
    return token;
}

} // namespace rolvane::davacl
