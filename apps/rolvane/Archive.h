#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <string_view>

namespace rolvane::cli {

// A member of an archive, as it is known.
struct ArchivedFile {
    uint64_t offset = 0, size = 0; // bytes
    std::string sha256;            // hexadecimal, small letters
};

// Writes several files into one, in the form that tar(1) reads (POSIX.1-1988 ustar). The file gets its name when it is
// whole and on the disk: until then it is a temporary one beside it, which goes with this object. Mode 0600. One
// thread. CXException names the file and the reason.
class ArchiveWriter {
public:
    explicit ArchiveWriter(std::string path, int64_t modified); // seconds since 1970, of all members
    ~ArchiveWriter();
    ArchiveWriter(const ArchiveWriter&) = delete;
    ArchiveWriter& operator=(const ArchiveWriter&) = delete;

    // The name has 100 bytes at most. Gives the size and the digest of the written content.
    ArchivedFile addText(const std::string& name, std::string_view text);
    ArchivedFile addFile(const std::string& name, const std::string& path);
    void finish();  // the end mark; the bytes are on the disk then, still under the temporary name
    void publish(); // replaces what the path names
    const std::string& temporaryPath() const { return _temporary; }

private:
    void begin(const std::string& name, uint64_t size);
    void write(std::string_view bytes);
    void pad();

    const std::string _path;
    std::string _temporary;
    const int64_t _modified;
    int _fd = -1;
    uint64_t _written = 0;
};

// Reads such a file. Nothing but plain files is taken, and no name decides where anything is written. One thread.
class ArchiveReader {
public:
    // Looks through the whole file. CXException where it is none, is not whole, or has a name twice.
    explicit ArchiveReader(std::string path);
    ~ArchiveReader();
    ArchiveReader(const ArchiveReader&) = delete;
    ArchiveReader& operator=(const ArchiveReader&) = delete;

    const std::map<std::string, ArchivedFile>& members() const { return _members; } // with digests of their contents
    bool has(const std::string& name) const { return _members.contains(name); }
    std::string text(const std::string& name, size_t most = 16U << 20) const;
    void extract(const std::string& name, const std::string& to) const; // a new file of mode 0600, on the disk then

private:
    void readMembers();
    void readAt(uint64_t offset, char* into, size_t size) const;
    void forEachPiece(const ArchivedFile& member, const std::function<void(std::string_view)>& call) const;
    [[noreturn]] void refuse(const std::string& why) const;

    const std::string _path;
    int _fd = -1;
    std::map<std::string, ArchivedFile> _members;
};

} // namespace rolvane::cli
