#include "store/VersionMemory.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Paths.h"

#include <cstring>
#include <random>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr char kMagic[4] = {'R', 'V', 'M', '1'};

uint64_t seconds(std::optional<Date> date) {
    return date ? static_cast<uint64_t>(static_cast<int64_t>(date->secondsSince1970())) & 0xffffffffu : 0;
}

uint64_t packed(std::optional<Date> date, uint64_t size) {
    return seconds(date) << 32 | (size & 0xffffffffu);
}

void append(std::string& out, uint64_t n) {
    out.append(reinterpret_cast<const char*>(&n), sizeof n);
}

} // namespace

VersionMemory::VersionMemory(std::string path, size_t capacity) : _path(std::move(path)), _capacity(capacity) {
    std::random_device random;
    _seed = static_cast<uint64_t>(random()) << 32 | random();
    if (!_path.empty()) load();
}

void VersionMemory::load() {
    if (access(_path.c_str(), R_OK) != 0) return;
    std::string text;
    try {
        text = readFile(_path);
    } catch (const CXException& e) {
        CXDLog("The memory of versions is started anew: %@", e.reason());
        return;
    }
    if (text.size() < 12 || memcmp(text.data(), kMagic, 4) != 0 || (text.size() - 12) % 24 != 0) return;
    memcpy(&_seed, text.data() + 4, 8);
    for (size_t at = 12; at < text.size() && _entries.size() < _capacity; at += 24) {
        uint64_t row[3];
        memcpy(row, text.data() + at, sizeof row);
        if (row[1] >= 1 && row[1] <= 3) _entries[row[0]] = {static_cast<Kind>(row[1]), row[2]};
    }
}

void VersionMemory::save() {
    std::string text;
    {
        std::lock_guard guard(_mutex);
        if (!_changed || _path.empty()) return;
        _changed = false;
        text.reserve(12 + _entries.size() * 24);
        text.append(kMagic, 4);
        append(text, _seed);
        for (const auto& [url, entry] : _entries) {
            append(text, url);
            append(text, static_cast<uint64_t>(entry.kind));
            append(text, entry.value);
        }
    }
    try {
        writeFileDurably(_path, text);
    } catch (const CXException& e) {
        CXLog("The memory of versions could not be saved: %@", e.reason());
    }
}

// FNV-1a with a seed of the file's own and a final mix.
uint64_t VersionMemory::hash(std::string_view text) const {
    uint64_t h = 0xcbf29ce484222325u ^ _seed;
    for (const char c : text) h = (h ^ static_cast<unsigned char>(c)) * 0x100000001b3u;
    h = (h ^ (h >> 32)) * 0xd6e8feb86659fd93u;
    return h ^ (h >> 32);
}

uint64_t VersionMemory::tagHash(const EntityTag& tag) const {
    std::string_view text = tag.str();
    if (text.starts_with("W/")) text.remove_prefix(2);
    return hash(text);
}

void VersionMemory::put(std::string_view url, Entry entry) {
    std::lock_guard guard(_mutex);
    const uint64_t key = hash(url);
    if (_entries.size() >= _capacity && !_entries.contains(key)) _entries.erase(_entries.begin());
    _entries[key] = entry;
    _changed = true;
}

void VersionMemory::read(std::string_view url, const FileVersion& v) {
    if (!v.etag.empty())
        put(url, {Kind::tag, tagHash(v.etag)});
    else if (v.lastModified)
        put(url, {Kind::dated, packed(v.lastModified, v.size)});
    else
        forget(url);
}

void VersionMemory::wrote(std::string_view url, const EntityTag& etag, std::optional<Date> serverDate, uint64_t size) {
    if (!etag.empty())
        put(url, {Kind::tag, tagHash(etag)});
    else if (serverDate)
        put(url, {Kind::written, packed(serverDate, size)});
    else
        forget(url);
}

void VersionMemory::forget(std::string_view url) {
    std::lock_guard guard(_mutex);
    if (_entries.erase(hash(url)) != 0) _changed = true;
}

bool VersionMemory::knows(std::string_view url, const FileVersion& v) {
    std::lock_guard guard(_mutex);
    const auto found = _entries.find(hash(url));
    if (found == _entries.end()) return false;
    Entry& entry = found->second;
    if (entry.kind == Kind::tag) return !v.etag.empty() && entry.value == tagHash(v.etag);
    if (entry.kind == Kind::dated) return v.etag.empty() && entry.value == packed(v.lastModified, v.size);
    const uint64_t then = entry.value >> 32, now = seconds(v.lastModified);
    if ((entry.value & 0xffffffffu) != (v.size & 0xffffffffu) || now + 1 < then || now > then + 1) return false;
    if (!v.etag.empty()) { // the tag of what we wrote, told late: from now on exactly this
        entry = {Kind::tag, tagHash(v.etag)};
        _changed = true;
    }
    return true;
}

size_t VersionMemory::count() const {
    std::lock_guard guard(_mutex);
    return _entries.size();
}

} // namespace rolvane
