#include "store/reads/VersionMemory.h"

#include "foundation/Base64.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/Paths.h"

#include <cstring>
#include <fcntl.h>
#include <openssl/evp.h>
#include <random>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>

namespace rolvane {

namespace {

constexpr size_t kRow = 32;          // bytes in the file
constexpr size_t kDigestLength = 28; // of a SHA-1 in base64
constexpr char kMagic[4] = {'R', 'V', 'M', '4'};
constexpr size_t kHead = 12;
constexpr char kFormerMagic[4] = {'R', 'V', 'M', '3'};
constexpr size_t kFormerHead = 28;
constexpr uint64_t kEnd = 4;                         // the kind of the row that ends a save
constexpr uint64_t kSum = 0xcbf29ce484222325u;       // the sum of nothing
constexpr std::string_view kClockFile = "/dateFile"; // which the owner of a tree touches with each pass
constexpr size_t kSmall = 64u << 10;                 // bytes; a shorter file is not worth being written anew

uint64_t summed(uint64_t sum, const uint64_t* numbers, size_t count) {
    for (size_t i = 0; i < count; ++i) {
        sum = (sum ^ numbers[i]) * 0xd6e8feb86659fd93u;
        sum ^= sum >> 32;
    }
    return sum;
}

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

void appendNumber(std::string& out, uint64_t n) {
    out.append(reinterpret_cast<const char*>(&n), sizeof n);
}

} // namespace

VersionMemory::VersionMemory(std::string path, size_t capacity) : _path(std::move(path)), _capacity(capacity) {}

void VersionMemory::need() {
    if (_isRead) return;
    _isRead = true;
    load();
    if (_judge) judge(*std::exchange(_judge, std::nullopt));
}

void VersionMemory::load() {
    std::random_device random;
    _seed = static_cast<uint64_t>(random()) << 32 | random();
    _entries.clear();
    _unsaved.clear();
    _owner = {};
    _fileNumber = _fileSize = 0;
    _isForeign = false;
    if (_path.empty() || access(_path.c_str(), R_OK) != 0) return;
    try {
        takeRows(readFile(_path));
    } catch (const CXException& e) {
        CXDLog("The memory of versions is started anew: %@", e.reason());
    }
}

// An earlier version wrote all rows at once, without an end. The next save writes the file anew.
void VersionMemory::takeFormerRows(const std::string& text) {
    if (text.size() < kFormerHead || (text.size() - kFormerHead) % kRow != 0) return;
    memcpy(&_owner.identity, text.data() + 4, 8);
    memcpy(&_owner.passes, text.data() + 12, 8);
    memcpy(&_seed, text.data() + 20, 8);
    for (size_t at = kFormerHead; at < text.size() && _entries.size() < _capacity; at += kRow) {
        uint64_t row[4];
        memcpy(row, text.data() + at, sizeof row);
        if (row[1] >= 1 && row[1] < kEnd) _entries[row[0]] = {static_cast<Kind>(row[1]), row[2], row[3]};
    }
}

void VersionMemory::takeRows(const std::string& text) {
    if (text.size() >= 4 && memcmp(text.data(), kFormerMagic, 4) == 0) return takeFormerRows(text);
    if (text.size() < kHead || memcmp(text.data(), kMagic, 4) != 0) return;
    struct stat file {};
    if (stat(_path.c_str(), &file) != 0) return;
    memcpy(&_seed, text.data() + 4, 8);
    size_t saved = kHead;
    uint64_t sum = kSum;
    for (size_t at = kHead; at + kRow <= text.size(); at += kRow) {
        uint64_t row[4];
        memcpy(row, text.data() + at, sizeof row);
        if (row[1] != kEnd) {
            sum = summed(sum, row, 4);
            continue;
        }
        if (summed(sum, row, 3) != row[3]) break;
        for (; saved < at; saved += kRow) {
            uint64_t entry[4];
            memcpy(entry, text.data() + saved, sizeof entry);
            if (entry[1] == 0)
                _entries.erase(entry[0]);
            else if (_entries.size() < _capacity || _entries.contains(entry[0]))
                _entries[entry[0]] = {static_cast<Kind>(entry[1]), entry[2], entry[3]};
        }
        saved += kRow;
        _owner = {row[0], row[2]};
        sum = kSum;
    }
    _fileNumber = file.st_ino;
    _fileSize = saved;
}

void VersionMemory::judge(const Owner& owner) {
    if (_owner.identity != owner.identity || _owner.passes > owner.passes) {
        _entries.clear();
        _unsaved.clear();
        _fileNumber = 0;
        _isForeign = true;
        // At once: this process may end without a save, and the database soon has seen as many passes as the file.
        if (!_path.empty()) unlink(_path.c_str());
        noteChangeOfMany();
    }
    _owner = owner;
}

void VersionMemory::belongTo(const Owner& owner) {
    Lock guard(_mutex);
    need();
    judge(owner);
}

void VersionMemory::revert() {
    Lock guard(_mutex);
    _isRead = false;
    _judge.reset();
    noteChangeOfMany();
}

void VersionMemory::save(const Owner& owner) {
    Lock guard(_mutex);
    if (!_isRead) {
        _judge = owner;
        return;
    }
    _owner = owner;
    if (_path.empty() || (_unsaved.empty() && !_isForeign)) return;
    try {
        if (!append(rows(false))) replace(rows(true));
        _unsaved.clear();
        _isForeign = false;
    } catch (const CXException& e) {
        CXLog("The memory of versions could not be saved: %@", e.reason());
        _fileNumber = 0;
    }
}

// With their end.
std::string VersionMemory::rows(bool all) const {
    std::string text;
    text.reserve(((all ? _entries.size() : _unsaved.size()) + 1) * kRow);
    uint64_t sum = kSum;
    const auto add = [&](uint64_t url, uint64_t kind, uint64_t value, uint64_t digest) {
        const uint64_t row[4] = {url, kind, value, digest};
        sum = summed(sum, row, 4);
        for (const uint64_t number : row) appendNumber(text, number);
    };
    if (all)
        for (const auto& [url, entry] : _entries)
            add(url, static_cast<uint64_t>(entry.kind), entry.value, entry.digest);
    else
        for (const uint64_t url : _unsaved) {
            const auto found = _entries.find(url);
            if (found == _entries.end())
                add(url, 0, 0, 0);
            else
                add(url, static_cast<uint64_t>(found->second.kind), found->second.value, found->second.digest);
        }
    const uint64_t end[3] = {_owner.identity, kEnd, _owner.passes};
    for (const uint64_t number : end) appendNumber(text, number);
    appendNumber(text, summed(sum, end, 3));
    return text;
}

// False where the file is not the one that this object knows to its end, or mostly out of date.
bool VersionMemory::append(const std::string& rows) {
    if (_fileNumber == 0 || _fileSize + rows.size() > kHead + 2 * _entries.size() * kRow + kSmall) return false;
    const int file = open(_path.c_str(), O_WRONLY | O_CLOEXEC);
    if (file < 0) return false;
    struct stat now {};
    const auto size = static_cast<ssize_t>(rows.size());
    const bool done = fstat(file, &now) == 0 && now.st_ino == _fileNumber &&
                      static_cast<uint64_t>(now.st_size) == _fileSize &&
                      pwrite(file, rows.data(), rows.size(), now.st_size) == size;
    close(file);
    if (done) _fileSize += rows.size();
    return done;
}

void VersionMemory::replace(const std::string& rows) {
    std::string text(kMagic, 4);
    appendNumber(text, _seed);
    text += rows;
    writeFileDurably(_path, text);
    struct stat file {};
    _fileNumber = stat(_path.c_str(), &file) == 0 ? file.st_ino : 0;
    _fileSize = text.size();
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
    const uint64_t key = hash(url);
    if (_entries.size() >= _capacity && !_entries.contains(key)) {
        _unsaved.insert(_entries.begin()->first);
        _entries.erase(_entries.begin());
        noteChangeOfMany(); // a URL that nobody can tell any more
    }
    const auto [held, isNew] = _entries.try_emplace(key, entry);
    if (!isNew && held->second == entry) return;
    held->second = entry;
    _unsaved.insert(key);
    if (!url.ends_with(kClockFile)) noteChange(url);
}

void VersionMemory::noteChange(std::string_view url) {
    if (_named.empty()) _named.resize(kNamed);
    _named[++_changes % kNamed] = url;
}

void VersionMemory::noteChangeOfMany() {
    _namedFrom = ++_changes;
}

void VersionMemory::erase(std::string_view url) {
    const uint64_t key = hash(url);
    if (_entries.erase(key) == 0) return;
    _unsaved.insert(key);
    noteChange(url);
}

void VersionMemory::read(std::string_view url, const FileVersion& v) {
    Lock guard(_mutex);
    need();
    if (!v.etag.empty())
        put(url, {Kind::tag, tagHash(v.etag)});
    else if (v.lastModified)
        put(url, {Kind::dated, packed(v.lastModified, v.size)});
    else
        erase(url);
}

void VersionMemory::wrote(std::string_view url, const EntityTag& etag, std::optional<Date> serverDate,
                          std::string_view content) {
    const std::string digest = etag.empty() && serverDate ? digestOf(content) : std::string();
    Lock guard(_mutex);
    need();
    if (!etag.empty())
        put(url, {Kind::tag, tagHash(etag)});
    else if (serverDate)
        put(url, {Kind::written, packed(serverDate, content.size()), hash(digest)});
    else
        erase(url);
}

void VersionMemory::forget(std::string_view url) {
    Lock guard(_mutex);
    need();
    erase(url);
}

bool VersionMemory::knows(std::string_view url, const FileVersion& v) {
    Lock guard(_mutex);
    need();
    const uint64_t key = hash(url);
    const auto found = _entries.find(key);
    if (found == _entries.end()) return false;
    Entry& entry = found->second;
    if (entry.kind == Kind::tag) return !v.etag.empty() && entry.value == tagHash(v.etag);
    if (entry.kind == Kind::dated) return v.etag.empty() && entry.value == packed(v.lastModified, v.size);
    if (isDigest(v.etag)) { // another's version may have our size and our second
        const uint64_t tag = tagHash(v.etag);
        if (tag != entry.digest) return false;
        entry = {Kind::tag, tag};
        _unsaved.insert(key);
        return true;
    }
    const uint64_t then = entry.value >> 32, now = seconds(v.lastModified);
    if ((entry.value & 0xffffffffu) != (v.size & 0xffffffffu) || now + 1 < then || now > then + 1) return false;
    if (!v.etag.empty()) { // the tag of what we wrote, told late: from now on exactly this
        entry = {Kind::tag, tagHash(v.etag)};
        _unsaved.insert(key);
    }
    return true;
}

bool VersionMemory::remembers(std::string_view url) {
    Lock guard(_mutex);
    need();
    return _entries.contains(hash(url));
}

uint64_t VersionMemory::markOf(std::string_view url) {
    Lock guard(_mutex);
    need();
    const auto found = _entries.find(hash(url));
    return found != _entries.end() && found->second.kind == Kind::tag ? found->second.value : 0;
}

uint64_t VersionMemory::changes() {
    Lock guard(_mutex);
    return _changes;
}

std::optional<std::vector<std::string>> VersionMemory::changedSince(uint64_t changes) {
    const Lock guard(_mutex);
    if (changes < _namedFrom || changes > _changes || _changes - changes > kNamed) return std::nullopt;
    std::vector<std::string> urls;
    for (uint64_t number = changes + 1; number <= _changes; ++number) urls.push_back(_named[number % kNamed]);
    return urls;
}

size_t VersionMemory::count() {
    Lock guard(_mutex);
    need();
    return _entries.size();
}

} // namespace rolvane
