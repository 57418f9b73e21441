#include "store/reads/ListingMemory.h"

#include "foundation/Mutex.h"
#include "store/reads/CacheText.h"

#include <algorithm>
#include <cstring>
#include <numeric>
#include <utility>

namespace rolvane {

namespace {

constexpr size_t kFewChanges = 200; // that a start may ask for

bool isBelow(std::string_view container, std::string_view tree) {
    return container.starts_with(tree) && (container.size() == tree.size() || container[tree.size()] == '/');
}

} // namespace

ListingMemory::Container ListingMemory::packed(const Entries& entries) {
    Container out;
    out.rows.reserve(entries.size());
    for (const auto& [url, entry] : entries) {
        const std::string& whole = url.absoluteString();
        out.rows.push_back(rowOf(out.text, std::string_view(whole).substr(whole.rfind('/') + 1), entry));
    }
    return out;
}

ListingMemory::Row ListingMemory::rowOf(std::string& text, std::string_view encodedName,
                                        const MultistatusEntry& entry) {
    const std::string& tag = entry.etag.str();
    const Row row{static_cast<uint32_t>(text.size()),
                  static_cast<uint32_t>(encodedName.size()),
                  static_cast<uint32_t>(tag.size()),
                  entry.isCollection,
                  entry.lastModified.has_value(),
                  entry.length.has_value(),
                  entry.lastModified ? entry.lastModified->secondsSince1970() : 0,
                  entry.length.value_or(0)};
    text.append(encodedName).append(tag);
    return row;
}

std::string_view ListingMemory::nameOf(const Container& container, const Row& row) {
    return std::string_view(container.text).substr(row.at, row.nameLength);
}

void ListingMemory::compact(Container& container) {
    std::string text;
    text.reserve(container.text.size() - container.unused);
    for (Row& row : container.rows) {
        const size_t at = text.size();
        text.append(container.text, row.at, row.nameLength + row.tagLength);
        row.at = static_cast<uint32_t>(at);
    }
    container.text = std::move(text);
    container.unused = 0;
}

std::span<const uint32_t> ListingMemory::rowsNamed(Container& container, std::string_view encodedName) {
    std::vector<uint32_t>& order = container.order;
    const auto name = [&](uint32_t row) { return nameOf(container, container.rows[row]); };
    if (order.size() != container.rows.size()) {
        order.resize(container.rows.size());
        std::iota(order.begin(), order.end(), uint32_t{0});
        std::stable_sort(order.begin(), order.end(), [&](uint32_t a, uint32_t b) { return name(a) < name(b); });
    }
    const auto first = std::lower_bound(order.begin(), order.end(), encodedName,
                                        [&](uint32_t row, std::string_view wanted) { return name(row) < wanted; });
    auto last = first;
    while (last != order.end() && name(*last) == encodedName) ++last;
    return {first, last};
}

void ListingMemory::takeOut(Container& container, std::vector<size_t> places) {
    if (places.empty()) return;
    std::sort(places.begin(), places.end());
    size_t rows = 0, next = 0;
    for (size_t i = 0; i < container.rows.size(); ++i) {
        const Row& row = container.rows[i];
        if (next < places.size() && places[next] == i) {
            container.unused += row.nameLength + row.tagLength;
            ++next;
        } else {
            container.rows[rows++] = row;
        }
    }
    container.rows.resize(rows);
    container.order.clear();
}

bool ListingMemory::edit(const Url& container, const std::string& tag, const Edits& edits, const Told& told) {
    const Lock guard(_mutex);
    const auto found = _containers.find(container.absoluteString());
    if (tag.empty() || found == _containers.end() || found->second.tag != tag) return false;
    Container& kept = found->second;
    _bytes -= kept.bytes();
    std::vector<size_t> gone;
    std::vector<Edits::const_pointer> come;
    for (const auto& edit : edits) {
        const auto& [name, now] = edit;
        const std::span<const uint32_t> places = rowsNamed(kept, name);
        if (places.empty()) {
            told(name, std::nullopt, now);
            if (now) come.push_back(&edit);
            continue;
        }
        Row& row = kept.rows[places.front()];
        told(name, unpacked(kept, row).entry, now);
        gone.insert(gone.end(), places.begin() + (now ? 1 : 0), places.end());
        if (!now) continue;
        kept.unused += row.nameLength + row.tagLength;
        row = rowOf(kept.text, name, *now);
    }
    takeOut(kept, std::move(gone));
    for (const auto* edit : come) kept.rows.push_back(rowOf(kept.text, edit->first, *edit->second));
    if (kept.unused > kept.text.size() / 2) compact(kept);
    _bytes += kept.bytes();
    if (_bytes > kMostBytes) {
        _containers.clear();
        _tokens.clear();
        _bytes = 0;
    }
    return true;
}

std::optional<MultistatusEntry> ListingMemory::member(const Url& container, const std::string& tag,
                                                      std::string_view encodedName) const {
    const Lock guard(_mutex);
    const auto found = _containers.find(container.absoluteString());
    if (tag.empty() || found == _containers.end() || found->second.tag != tag) return std::nullopt;
    const std::span<const uint32_t> places = rowsNamed(found->second, encodedName);
    if (places.empty()) return std::nullopt;
    return unpacked(found->second, found->second.rows[places.front()]).entry;
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
    const Lock guard(_mutex);
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
    const Lock guard(_mutex);
    _containers.clear();
    _tokens.clear();
    _bytes = 0;
    _changes = 0;
}

void ListingMemory::forgetBelow(const Url& container) {
    const std::string& place = container.absoluteString();
    const Lock guard(_mutex);
    _tokens.erase(place);
    std::erase_if(_containers, [&](const auto& each) REQUIRES(_mutex) {
        const bool goes = isBelow(each.first, place);
        if (goes) _bytes -= each.second.bytes();
        return goes;
    });
}

void ListingMemory::takeOver(const Url& tree, ListingMemory&& from) {
    const std::string token = from.token(tree);
    if (token.empty() || !this->token(tree).empty()) return;
    forgetBelow(tree);
    {
        const Lock guard(_mutex), guardOfOther(from._mutex); // nobody else has the other one
        if (_bytes + from._bytes > kMostBytes) return;
        _bytes += std::exchange(from._bytes, 0);
        _containers.merge(from._containers);
    }
    keepToken(tree, token);
}

void ListingMemory::keepToken(const Url& tree, const std::string& token, const Files& files) {
    const Lock guard(_mutex);
    const auto [found, isNew] = _tokens.try_emplace(tree.absoluteString());
    Synced& synced = found->second;
    _isNew = _isNew || isNew;
    synced.token = token;
    synced.isUsed = true;
    if (files && files->empty() && synced.state != 0) return;
    synced.state = ++_lastState;
    if (files && !isNew && synced.files.size() + files->size() <= kMostFiles) {
        for (const std::string& file : *files) synced.files.emplace_back(synced.state, file);
        return;
    }
    synced.files.clear();
    synced.filesFrom = synced.state;
}

ListingMemory::Files ListingMemory::filesChangedSince(const Url& tree, uint64_t state) const {
    const Lock guard(_mutex);
    const auto found = _tokens.find(tree.absoluteString());
    if (found == _tokens.end() || state < found->second.filesFrom || state > found->second.state) return std::nullopt;
    std::vector<std::string> files;
    for (const auto& [when, file] : found->second.files)
        if (when > state) files.push_back(file);
    return files;
}

uint64_t ListingMemory::stateOf(const Url& tree) const {
    const Lock guard(_mutex);
    const auto found = _tokens.find(tree.absoluteString());
    return found == _tokens.end() ? 0 : found->second.state;
}

void ListingMemory::noteChanges(size_t members) {
    const Lock guard(_mutex);
    _changes += members;
}

size_t ListingMemory::members() const {
    size_t all = 0;
    for (const auto& [url, container] : _containers) all += container.rows.size();
    return all;
}

bool ListingMemory::isWorthSaving(bool atEnd) const {
    const Lock guard(_mutex);
    const auto isUsed = [](const auto& tree) { return tree.second.isUsed; };
    const auto used = std::count_if(_tokens.begin(), _tokens.end(), isUsed);
    const bool isLeft = used > 0 && static_cast<size_t>(used) < _tokens.size(); // by its reader
    return _isNew || (atEnd && (_changes > 0 || isLeft)) || (_changes > kFewChanges && _changes > members() / 10);
}

void ListingMemory::wasSaved() {
    const Lock guard(_mutex);
    _isNew = false;
    _changes = 0;
}

std::string ListingMemory::saved() const {
    const Lock guard(_mutex);
    std::string out;
    out.reserve(_bytes + (_bytes >> 3));
    for (const auto& [tree, synced] : _tokens) {
        if (!synced.isUsed) continue;
        std::vector<const std::pair<const std::string, Container>*> below;
        for (const auto& each : _containers)
            if (each.second.tag == kSynced && isBelow(each.first, tree)) below.push_back(&each);
        cacheAppend(out, std::string_view(tree));
        cacheAppend(out, std::string_view(synced.token));
        cacheAppend(out, uint64_t{below.size()});
        for (const auto* each : below) {
            cacheAppend(out, std::string_view(each->first));
            cacheAppend(out, std::string_view(each->second.text));
            cacheAppend(out, uint64_t{each->second.rows.size()});
            for (const Row& row : each->second.rows) {
                uint64_t modified = 0;
                std::memcpy(&modified, &row.modified, sizeof modified);
                cacheAppend(out, uint64_t{row.at} << 32 | row.nameLength);
                cacheAppend(out, uint64_t{row.tagLength} << 32 | (row.isCollection ? 1U : 0U) |
                                     (row.hasDate ? 2U : 0U) | (row.hasLength ? 4U : 0U));
                cacheAppend(out, modified);
                cacheAppend(out, row.length);
            }
        }
    }
    return out;
}

bool ListingMemory::restore(std::string_view text) {
    constexpr uint64_t kRowBytes = 32, kHalf = 0xffffffffU;
    std::unordered_map<std::string, Container> containers;
    std::unordered_map<std::string, Synced> tokens;
    size_t bytes = 0;
    for (CacheReader in(text); !in.atEnd();) {
        const std::string tree(in.text());
        tokens[tree].token = in.text();
        uint64_t count = in.number();
        for (; count > 0 && in.isWhole(); --count) {
            const std::string url(in.text());
            Container fresh;
            fresh.tag = kSynced;
            fresh.text = in.text();
            CacheReader rows(in.bytes(std::min<uint64_t>(in.number(), text.size() / kRowBytes + 1) * kRowBytes));
            size_t used = 0;
            while (!rows.atEnd()) {
                const uint64_t where = rows.number(), what = rows.number(), modified = rows.number();
                Row row{static_cast<uint32_t>(where >> 32),
                        static_cast<uint32_t>(where & kHalf),
                        static_cast<uint32_t>(what >> 32),
                        (what & 1) != 0,
                        (what & 2) != 0,
                        (what & 4) != 0,
                        0,
                        rows.number()};
                std::memcpy(&row.modified, &modified, sizeof modified);
                if (uint64_t{row.at} + row.nameLength + row.tagLength > fresh.text.size()) return false;
                fresh.rows.push_back(row);
                used += row.nameLength + row.tagLength;
            }
            fresh.unused = fresh.text.size() - std::min(used, fresh.text.size());
            bytes += fresh.bytes();
            containers.insert_or_assign(url, std::move(fresh));
        }
        if (!in.isWhole() || tokens[tree].token.empty()) return false;
    }
    const Lock guard(_mutex);
    if (!_containers.empty() || !_tokens.empty() || bytes > kMostBytes) return false;
    for (auto& [tree, synced] : tokens) synced.state = synced.filesFrom = ++_lastState;
    _containers = std::move(containers);
    _tokens = std::move(tokens);
    _bytes = bytes;
    return true;
}

std::string ListingMemory::token(const Url& tree) const {
    const Lock guard(_mutex);
    const auto found = _tokens.find(tree.absoluteString());
    return found == _tokens.end() ? std::string() : found->second.token;
}

bool ListingMemory::has(const Url& container, const std::string& tag) const {
    const Lock guard(_mutex);
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
