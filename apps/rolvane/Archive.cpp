#include "Archive.h"

#include "Texts.h"

#include "foundation/CXException.h"
#include "foundation/TemporaryFiles.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fmt/format.h>
#include <memory>
#include <openssl/evp.h>
#include <optional>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane::cli {

namespace {

constexpr size_t kBlock = 512;
constexpr size_t kPiece = 1U << 20;

// The fields of a header, by their places in it.
struct Field {
    size_t offset, size;
};
constexpr Field kName{0, 100}, kMode{100, 8}, kOwner{108, 8}, kGroup{116, 8}, kSize{124, 12}, kModified{136, 12},
    kChecksum{148, 8}, kKind{156, 1}, kMagic{257, 8}, kPrefix{345, 155};
constexpr std::string_view kUstar{"ustar\00000", 8};

using Header = std::array<char, kBlock>;

void put(Header& header, const Field& field, std::string_view text) {
    std::copy_n(text.begin(), std::min(text.size(), field.size), header.begin() + static_cast<ptrdiff_t>(field.offset));
}

std::string_view get(const Header& header, const Field& field) {
    return {header.data() + field.offset, field.size};
}

std::string textOf(const Header& header, const Field& field) {
    const std::string_view all = get(header, field);
    return std::string(all.substr(0, all.find('\0')));
}

std::string octal(uint64_t number, size_t digits) {
    return fmt::format("{:0{}o}", number, digits);
}

// Nothing when the field is no number.
std::optional<uint64_t> numberOf(const Header& header, const Field& field) {
    uint64_t number = 0;
    size_t digits = 0;
    for (const char c : get(header, field)) {
        if (c == '\0' || c == ' ') {
            if (digits == 0) continue;
            break;
        }
        if (c < '0' || c > '7' || number >> 60) return std::nullopt;
        number = number * 8 + static_cast<uint64_t>(c - '0');
        digits++;
    }
    return digits == 0 ? std::nullopt : std::optional(number);
}

// The sum of all bytes, those of the field itself taken for blanks.
uint64_t checksumOf(const Header& header) {
    uint64_t sum = 0;
    for (size_t i = 0; i < header.size(); ++i) {
        const bool own = i >= kChecksum.offset && i < kChecksum.offset + kChecksum.size;
        sum += own ? static_cast<unsigned char>(' ') : static_cast<unsigned char>(header[i]);
    }
    return sum;
}

uint64_t padded(uint64_t size) {
    return (size + kBlock - 1) / kBlock * kBlock;
}

class Sha256 {
public:
    Sha256() : _context(EVP_MD_CTX_new(), EVP_MD_CTX_free) {
        if (!_context || EVP_DigestInit_ex(_context.get(), EVP_sha256(), nullptr) != 1) fail();
    }
    void add(std::string_view bytes) {
        if (EVP_DigestUpdate(_context.get(), bytes.data(), bytes.size()) != 1) fail();
    }
    std::string hexadecimal() {
        std::array<unsigned char, EVP_MAX_MD_SIZE> digest{};
        unsigned size = 0;
        if (EVP_DigestFinal_ex(_context.get(), digest.data(), &size) != 1) fail();
        std::string text;
        for (unsigned i = 0; i < size; ++i) text += fmt::format("{:02x}", digest[i]);
        return text;
    }

private:
    [[noreturn]] static void fail() {
        throw CXException(kCXFileException, translated("OpenSSL computes no SHA-256 digests here."));
    }
    std::unique_ptr<EVP_MD_CTX, void (*)(EVP_MD_CTX*)> _context;
};

enum class Doing { reading, writing };

[[noreturn]] void cannot(Doing doing, const std::string& path) {
    const char* reason = std::strerror(errno);
    throw CXException(kCXFileException, doing == Doing::reading ? tr("{} could not be read: {}.", path, reason)
                                                                : tr("{} could not be written: {}.", path, reason));
}

void writeAll(int fd, std::string_view bytes, const std::string& path) {
    while (!bytes.empty()) {
        const ssize_t count = ::write(fd, bytes.data(), bytes.size());
        if (count < 0 && errno == EINTR) continue;
        if (count < 0) cannot(Doing::writing, path);
        bytes.remove_prefix(static_cast<size_t>(count));
    }
}

int openForReading(const std::string& path) {
    const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    struct stat is {};
    if (fd < 0 || ::fstat(fd, &is) != 0) cannot(Doing::reading, path);
    if (S_ISREG(is.st_mode)) return fd;
    ::close(fd);
    throw CXException(kCXFileException, tr("{} is no plain file.", path));
}

} // namespace

// -- writing

ArchiveWriter::ArchiveWriter(std::string path, int64_t modified) : _path(std::move(path)), _modified(modified) {
    _temporary = _path + kTemporaryMark + "XXXXXX";
    _fd = ::mkostemp(_temporary.data(), O_CLOEXEC);
    if (_fd < 0) cannot(Doing::writing, _path);
    ::fchmod(_fd, 0600);
    ::flock(_fd, LOCK_EX | LOCK_NB); // says that somebody still writes it
}

ArchiveWriter::~ArchiveWriter() {
    if (_fd >= 0) ::close(_fd);
    if (!_temporary.empty()) ::unlink(_temporary.c_str());
}

void ArchiveWriter::write(std::string_view bytes) {
    writeAll(_fd, bytes, _path);
    _written += bytes.size();
}

void ArchiveWriter::pad() {
    write(std::string(padded(_written) - _written, '\0'));
}

void ArchiveWriter::begin(const std::string& name, uint64_t size) {
    if (name.size() > kName.size || size >> 33)
        throw CXException(kCXFileException, tr("{} is too large for a file of this form.", name));
    Header header{};
    put(header, kName, name);
    put(header, kMode, octal(0600, 7));
    put(header, kOwner, octal(0, 7));
    put(header, kGroup, octal(0, 7));
    put(header, kSize, octal(size, 11));
    put(header, kModified, octal(static_cast<uint64_t>(std::max<int64_t>(_modified, 0)), 11));
    put(header, kKind, "0");
    put(header, kMagic, kUstar);
    put(header, kChecksum, octal(checksumOf(header), 6) + std::string("\0 ", 2));
    write({header.data(), header.size()});
}

ArchivedFile ArchiveWriter::addText(const std::string& name, std::string_view text) {
    begin(name, text.size());
    ArchivedFile added{_written, text.size(), {}};
    Sha256 digest;
    digest.add(text);
    added.sha256 = digest.hexadecimal();
    write(text);
    pad();
    return added;
}

ArchivedFile ArchiveWriter::addFile(const std::string& name, const std::string& path) {
    const int fd = openForReading(path);
    const std::unique_ptr<const int, void (*)(const int*)> closing(&fd, [](const int* each) { ::close(*each); });
    struct stat is {};
    if (::fstat(fd, &is) != 0) cannot(Doing::reading, path);
    const auto size = static_cast<uint64_t>(is.st_size);
    begin(name, size);
    ArchivedFile added{_written, size, {}};
    Sha256 digest;
    std::string piece(kPiece, '\0');
    uint64_t left = size;
    while (left > 0) {
        const ssize_t count = ::read(fd, piece.data(), std::min<uint64_t>(left, piece.size()));
        if (count < 0 && errno == EINTR) continue;
        if (count < 0) cannot(Doing::reading, path);
        if (count == 0) throw CXException(kCXFileException, tr("{} became shorter while it was read.", path));
        digest.add({piece.data(), static_cast<size_t>(count)});
        write({piece.data(), static_cast<size_t>(count)});
        left -= static_cast<uint64_t>(count);
    }
    added.sha256 = digest.hexadecimal();
    pad();
    return added;
}

void ArchiveWriter::finish() {
    write(std::string(2 * kBlock, '\0'));
    if (::fsync(_fd) != 0) cannot(Doing::writing, _path);
}

void ArchiveWriter::publish() {
    if (::rename(_temporary.c_str(), _path.c_str()) != 0) cannot(Doing::writing, _path);
    _temporary.clear();
    const std::string parent = std::filesystem::absolute(_path).parent_path();
    const int directory = ::open(parent.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (directory < 0) return; // the name is there; that it outlives a crash is not promised then
    ::fsync(directory);
    ::close(directory);
}

// -- reading

ArchiveReader::ArchiveReader(std::string path) : _path(std::move(path)), _fd(openForReading(_path)) {
    try {
        readMembers();
    } catch (...) {
        ::close(_fd);
        throw;
    }
}

ArchiveReader::~ArchiveReader() {
    ::close(_fd);
}

void ArchiveReader::refuse(const std::string& why) const {
    throw CXException(kCXFileException, _path + " " + why);
}

void ArchiveReader::readAt(uint64_t offset, char* into, size_t size) const {
    while (size > 0) {
        const ssize_t count = ::pread(_fd, into, size, static_cast<off_t>(offset));
        if (count < 0 && errno == EINTR) continue;
        if (count < 0) cannot(Doing::reading, _path);
        if (count == 0) refuse(translated("is not whole: its end is missing."));
        into += count;
        offset += static_cast<uint64_t>(count);
        size -= static_cast<size_t>(count);
    }
}

void ArchiveReader::forEachPiece(const ArchivedFile& member, const std::function<void(std::string_view)>& call) const {
    std::string piece(std::min<uint64_t>(member.size, kPiece), '\0');
    for (uint64_t done = 0; done < member.size;) {
        const auto size = static_cast<size_t>(std::min<uint64_t>(member.size - done, piece.size()));
        readAt(member.offset + done, piece.data(), size);
        call({piece.data(), size});
        done += size;
    }
}

void ArchiveReader::readMembers() {
    struct stat is {};
    if (::fstat(_fd, &is) != 0) cannot(Doing::reading, _path);
    const auto end = static_cast<uint64_t>(is.st_size);
    for (uint64_t at = 0;;) {
        if (end < at + kBlock)
            refuse(at == 0 ? translated("is no backup.") : translated("is not whole: its end is missing."));
        Header header{};
        readAt(at, header.data(), header.size());
        at += kBlock;
        if (std::all_of(header.begin(), header.end(), [](char c) { return c == '\0'; })) return;
        if (get(header, kMagic) != kUstar)
            refuse(at == kBlock ? translated("is no backup.") : translated("is damaged."));
        const auto size = numberOf(header, kSize);
        if (numberOf(header, kChecksum) != checksumOf(header) || !size) refuse(translated("is damaged."));
        const std::string name = textOf(header, kName);
        if (get(header, kKind) != "0" || !textOf(header, kPrefix).empty())
            refuse(tr("holds \"{}\", which is no plain file.", name));
        if (*size > end - at) refuse(translated("is not whole: its end is missing."));
        ArchivedFile member{at, *size, {}};
        Sha256 digest;
        forEachPiece(member, [&](std::string_view piece) { digest.add(piece); });
        member.sha256 = digest.hexadecimal();
        if (!_members.emplace(name, member).second) refuse(tr("holds \"{}\" twice.", name));
        at += padded(*size);
    }
}

std::string ArchiveReader::text(const std::string& name, size_t most) const {
    const ArchivedFile& member = _members.at(name);
    if (member.size > most) refuse(tr("holds a \"{}\" that is too long.", name));
    std::string all;
    forEachPiece(member, [&](std::string_view piece) { all += piece; });
    return all;
}

void ArchiveReader::extract(const std::string& name, const std::string& to) const {
    const int fd = ::open(to.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0600);
    if (fd < 0) cannot(Doing::writing, to);
    const std::unique_ptr<const int, void (*)(const int*)> closing(&fd, [](const int* each) { ::close(*each); });
    ::fchmod(fd, 0600);
    forEachPiece(_members.at(name), [&](std::string_view piece) { writeAll(fd, piece, to); });
    if (::fsync(fd) != 0) cannot(Doing::writing, to);
}

} // namespace rolvane::cli
