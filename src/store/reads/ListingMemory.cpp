#include "store/reads/ListingMemory.h"

#include <utility>

namespace rolvane {

ListingMemory::Container ListingMemory::packed(const Entries& entries) {
    Container out;
    out.rows.reserve(entries.size());
    for (const auto& [url, entry] : entries) {
        const std::string& whole = url.absoluteString();
        const std::string_view name = std::string_view(whole).substr(whole.rfind('/') + 1);
        const std::string& tag = entry.etag.str();
        out.rows.push_back({static_cast<uint32_t>(out.text.size()), static_cast<uint32_t>(name.size()),
                            static_cast<uint32_t>(tag.size()), entry.isCollection, entry.lastModified.has_value(),
                            entry.length.has_value(), entry.lastModified ? entry.lastModified->secondsSince1970() : 0,
                            entry.length.value_or(0)});
        out.text.append(name).append(tag);
    }
    return out;
}

ListingMemory::Member ListingMemory::unpacked(const Container& container, const Row& row) {
    const std::string_view text = container.text;
    Member member{text.substr(row.at, row.nameLength), {}};
    member.entry.isCollection = row.isCollection;
    if (row.hasDate) member.entry.lastModified = Date(row.modified);
    if (row.hasLength) member.entry.length = row.length;
    member.entry.etag = EntityTag(std::string(text.substr(row.at + row.nameLength, row.tagLength)));
    return member;
}

void ListingMemory::keep(const Url& container, const std::string& tag, const Entries& entries) {
    Container fresh;
    if (!tag.empty()) fresh = packed(entries);
    fresh.tag = tag;
    const std::lock_guard guard(_mutex);
    if (const auto old = _containers.find(container.absoluteString()); old != _containers.end()) {
        _bytes -= old->second.bytes();
        _containers.erase(old);
    }
    if (tag.empty() || fresh.bytes() > kMostBytes) return;
    if (_bytes + fresh.bytes() > kMostBytes) {
        _containers.clear();
        _tokens.clear();
        _bytes = 0;
    }
    _bytes += fresh.bytes();
    _containers.emplace(container.absoluteString(), std::move(fresh));
}

void ListingMemory::forgetAll() {
    const std::lock_guard guard(_mutex);
    _containers.clear();
    _tokens.clear();
    _bytes = 0;
}

void ListingMemory::forgetBelow(const Url& container) {
    const std::string& place = container.absoluteString();
    const std::lock_guard guard(_mutex);
    _tokens.erase(place);
    std::erase_if(_containers, [&](const auto& each) {
        const bool goes =
            each.first.starts_with(place) && (each.first.size() == place.size() || each.first[place.size()] == '/');
        if (goes) _bytes -= each.second.bytes();
        return goes;
    });
}

void ListingMemory::takeOver(const Url& tree, ListingMemory&& from) {
    const std::string token = from.token(tree);
    if (token.empty() || !this->token(tree).empty()) return;
    forgetBelow(tree);
    {
        const std::scoped_lock guard(_mutex, from._mutex);
        if (_bytes + from._bytes > kMostBytes) return;
        _bytes += std::exchange(from._bytes, 0);
        _containers.merge(from._containers);
    }
    keepToken(tree, token);
}

void ListingMemory::keepToken(const Url& tree, const std::string& token, bool isAnother) {
    const std::lock_guard guard(_mutex);
    Synced& synced = _tokens[tree.absoluteString()];
    synced.token = token;
    if (isAnother || synced.state == 0) synced.state = ++_lastState;
}

uint64_t ListingMemory::stateOf(const Url& tree) const {
    const std::lock_guard guard(_mutex);
    const auto found = _tokens.find(tree.absoluteString());
    return found == _tokens.end() ? 0 : found->second.state;
}

std::string ListingMemory::token(const Url& tree) const {
    const std::lock_guard guard(_mutex);
    const auto found = _tokens.find(tree.absoluteString());
    return found == _tokens.end() ? std::string() : found->second.token;
}

bool ListingMemory::has(const Url& container, const std::string& tag) const {
    const std::lock_guard guard(_mutex);
    const auto found = _containers.find(container.absoluteString());
    return found != _containers.end() && found->second.tag == tag;
}

std::optional<ListingMemory::Entries> ListingMemory::entries(const Url& container, const std::string& tag) const {
    Entries out;
    const bool isKept = forEach(container, tag, [&](const Member& member) {
        out.emplace_back(container.cxURLByAppendingComponent(Url::percentDecode(std::string(member.encodedName))),
                         member.entry);
    });
    return isKept ? std::optional(std::move(out)) : std::nullopt;
}

} // namespace rolvane
