#include "server/mod_davacl/DirectoryIndex.h"

#include "server/mod_davacl/DiskMembers.h"

#include <array>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <string_view>
#include <unistd.h>

namespace rolvane::davacl {
namespace {

constexpr uint64_t kMagic = 0x31584449'4c564e52; // says version 1, too
using Words = std::array<uint64_t, 10>;
enum Word { kMagicWord, kFirstSum, kSecondSum, kCount, kSince, kLast, kRecords, kLength, kRecordsSum, kHeadSum };
constexpr size_t kFixed = 4 * 8 + 1 + 2; // of a record, without the name

uint64_t sumOf(const Words& words) {
    return textHash({reinterpret_cast<const char*>(words.data()), sizeof(uint64_t) * kHeadSum}, 2);
}

class File {
public:
    File(const std::string& path, int flags) : _file(open(path.c_str(), flags | O_CLOEXEC | O_NOFOLLOW, 0600)) {}
    ~File() {
        if (_file >= 0) close(_file);
    }
    File(const File&) = delete;
    explicit operator bool() const { return _file >= 0; }
    bool read(void* to, size_t size) const {
        for (size_t done = 0; done < size;) {
            const ssize_t got = ::read(_file, static_cast<char*>(to) + done, size - done);
            if (got < 0 && errno == EINTR) continue;
            if (got <= 0) return false;
            done += static_cast<size_t>(got);
        }
        return true;
    }
    bool write(std::string_view text) const {
        while (!text.empty()) {
            const ssize_t put = ::write(_file, text.data(), text.size());
            if (put < 0 && errno != EINTR) return false;
            if (put > 0) text.remove_prefix(static_cast<size_t>(put));
        }
        return true;
    }

private:
    int _file;
};

DirectoryIndex::State readWords(const File& file, DirectoryIndex::Head& head, Words& words) {
    if (!file)
        return errno == ENOENT || errno == ENOTDIR ? DirectoryIndex::State::absent : DirectoryIndex::State::damaged;
    if (!file.read(words.data(), sizeof words) || words[kMagicWord] != kMagic || words[kHeadSum] != sumOf(words))
        return DirectoryIndex::State::damaged;
    head = {{words[kFirstSum], words[kSecondSum]},
            words[kCount],
            static_cast<int64_t>(words[kSince]),
            static_cast<int64_t>(words[kLast])};
    return DirectoryIndex::State::whole;
}

template <class Number>
void put(std::string& text, Number number) {
    text.append(reinterpret_cast<const char*>(&number), sizeof number);
}

template <class Number>
Number take(const char*& at) {
    Number number;
    std::memcpy(&number, at, sizeof number);
    at += sizeof number;
    return number;
}

bool unpack(std::string_view text, uint64_t number, std::vector<DirectoryIndex::Record>& out) {
    const char* at = text.data();
    const char* const end = at + text.size();
    out.reserve(std::min<uint64_t>(number, text.size() / kFixed));
    while (at < end) {
        if (static_cast<size_t>(end - at) < kFixed) return false;
        DirectoryIndex::Record record;
        record.signature = take<uint64_t>(at);
        record.identity = take<uint64_t>(at);
        record.number = take<int64_t>(at);
        record.appeared = take<int64_t>(at);
        const auto kind = take<uint8_t>(at);
        const auto size = take<uint16_t>(at);
        if (kind > static_cast<uint8_t>(DirectoryIndex::Kind::collection) || size > end - at) return false;
        record.kind = static_cast<DirectoryIndex::Kind>(kind);
        record.name.assign(at, size);
        at += size;
        out.push_back(std::move(record));
    }
    return out.size() == number;
}

} // namespace

DirectoryIndex::State DirectoryIndex::readHead(const std::string& path, Head& head) {
    Words words;
    return readWords(File(path, O_RDONLY), head, words);
}

DirectoryIndex::State DirectoryIndex::read(const std::string& path, DirectoryIndex& index) {
    const File file(path, O_RDONLY);
    Words words;
    const State state = readWords(file, index.head, words);
    if (state != State::whole) return state;
    std::string text(words[kLength], '\0');
    index.records.clear();
    if (!file.read(text.data(), text.size()) || textHash(text, 2) != words[kRecordsSum] ||
        !unpack(text, words[kRecords], index.records))
        return State::damaged;
    return State::whole;
}

bool DirectoryIndex::write(const std::string& path) const {
    std::string text;
    for (const Record& record : records) {
        put(text, record.signature);
        put(text, record.identity);
        put(text, record.number);
        put(text, record.appeared);
        put(text, static_cast<uint8_t>(record.kind));
        put(text, static_cast<uint16_t>(record.name.size()));
        text += record.name;
    }
    Words words{kMagic,
                head.sums[0],
                head.sums[1],
                head.count,
                static_cast<uint64_t>(head.since),
                static_cast<uint64_t>(head.last),
                records.size(),
                text.size(),
                textHash(text, 2),
                0};
    words[kHeadSum] = sumOf(words);
    const std::string fresh = path + ".new"; // one writer at a time
    {
        const File file(fresh, O_WRONLY | O_CREAT | O_TRUNC);
        if (!file || !file.write({reinterpret_cast<const char*>(words.data()), sizeof words}) || !file.write(text))
            return false;
    }
    return rename(fresh.c_str(), path.c_str()) == 0;
}

} // namespace rolvane::davacl
