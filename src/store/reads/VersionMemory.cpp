#include "store/reads/VersionMemory.h"

#include "foundation/Base64.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Paths.h"

#include <cstring>
#include <openssl/evp.h>
#include <random>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr size_t kRow = 32;          // bytes in the file
constexpr size_t kDigestLength = 28; // of a SHA-1 in base64
constexpr char kMagic[4] = {'R', 'V', 'M', '3'};
constexpr size_t kHead = 28;

uint64_t seconds(std::optional<Date> date) {
    return date ? static_cast<uint64_t>(static_cast<int64_t>(date->secondsSince1970())) & 0xffffffffu : 0;
}

uint64_t packed(std::optional<Date> date, uint64_t size) {
    return seconds(date) << 32 | (size & 0xffffffffu);
}

// The text of an entity tag without the quotes and the mark of a weak one.
std::string_view opaque(std::string_view tag) {
    if (tag.starts_with("W/")) tag.remove_prefix(2);
    if (tag.size() >= 2 && tag.front() == '"' && tag.back() == '"') tag = tag.substr(1, tag.size() - 2);
    return tag;
}

bool isDigest(const EntityTag& tag) {
    const std::string_view text = opaque(tag.str());
    return text.size() == kDigestLength && text.back() == '=' && text.find('-') == std::string_view::npos;
}

// Found once: OpenSSL looks an algorithm up anew at each use of its plain name.
const EVP_MD* sha1() {
    static const EVP_MD* const fetched = EVP_MD_fetch(nullptr, "SHA1", nullptr); // for the process's life
    return fetched ? fetched : EVP_sha1();
}

std::string digestOf(std::string_view content) {
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int length = 0;
    if (EVP_Digest(content.data(), content.size(), digest, &length, sha1(), nullptr) != 1) return {};
    std::string text;
    appendBase64(digest, length, text);
    return text;
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
    if (text.size() < kHead || memcmp(text.data(), kMagic, 4) != 0 || (text.size() - kHead) % kRow != 0) return;
    memcpy(&_owner.identity, text.data() + 4, 8);
    memcpy(&_owner.passes, text.data() + 12, 8);
    memcpy(&_seed, text.data() + 20, 8);
    for (size_t at = kHead; at < text.size() && _entries.size() < _capacity; at += kRow) {
        uint64_t row[4];
        memcpy(row, text.data() + at, sizeof row);
        if (row[1] >= 1 && row[1] <= 3) _entries[row[0]] = {static_cast<Kind>(row[1]), row[2], row[3]};
    }
}

void VersionMemory::belongTo(const Owner& owner) {
    std::lock_guard guard(_mutex);
    if (_owner.identity != owner.identity || _owner.passes > owner.passes) {
        _changed |= !_entries.empty();
        _entries.clear();
    }
    _owner = owner;
}

void VersionMemory::revert() {
    std::lock_guard guard(_mutex);
    _entries.clear();
    _changed = false;
    load();
}

void VersionMemory::save(const Owner& owner) {
    std::string text;
    {
        std::lock_guard guard(_mutex);
        _owner = owner;
        if (!_changed || _path.empty()) return;
        _changed = false;
        text.reserve(kHead + _entries.size() * kRow);
        text.append(kMagic, 4);
        append(text, _owner.identity);
        append(text, _owner.passes);
        append(text, _seed);
        for (const auto& [url, entry] : _entries) {
            append(text, url);
            append(text, static_cast<uint64_t>(entry.kind));
            append(text, entry.value);
            append(text, entry.digest);
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
    return hash(opaque(tag.str()));
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

void VersionMemory::wrote(std::string_view url, const EntityTag& etag, std::optional<Date> serverDate,
                          std::string_view content) {
    if (!etag.empty())
        put(url, {Kind::tag, tagHash(etag)});
    else if (serverDate)
        put(url, {Kind::written, packed(serverDate, content.size()), hash(digestOf(content))});
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
    if (isDigest(v.etag)) { // another's version may have our size and our second
        const uint64_t tag = tagHash(v.etag);
        if (tag != entry.digest) return false;
        entry = {Kind::tag, tag};
        _changed = true;
        return true;
    }
    const uint64_t then = entry.value >> 32, now = seconds(v.lastModified);
    if ((entry.value & 0xffffffffu) != (v.size & 0xffffffffu) || now + 1 < then || now > then + 1) return false;
    if (!v.etag.empty()) { // the tag of what we wrote, told late: from now on exactly this
        entry = {Kind::tag, tagHash(v.etag)};
        _changed = true;
    }
    return true;
}

bool VersionMemory::remembers(std::string_view url) const {
    std::lock_guard guard(_mutex);
    return _entries.contains(hash(url));
}

size_t VersionMemory::count() const {
    std::lock_guard guard(_mutex);
    return _entries.size();
}

} // namespace rolvane
