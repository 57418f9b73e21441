#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace rolvane::davacl {

// How much room an owner's tree takes on the disk, and how much it may take. Nothing here knows of httpd.

// A file takes its bytes in whole units, and one at least. A collection takes one. Else a crowd of empty files, which
// no quota of bytes would notice, could fill a disk.
inline constexpr uint64_t kRoomUnit = 4096;
inline constexpr uint64_t kNoQuota = UINT64_MAX;

// "1048576", "500M", "2G" (K, M, G, T: powers of 1024), or "none" for kNoQuota; nothing when the text is no size.
std::optional<uint64_t> sizeOf(std::string_view text);
// The size in the user's line of a file with a line "name: size" for each. Nothing when there is no such line.
std::optional<uint64_t> quotaInFile(std::string_view text, std::string_view user);

uint64_t roomOfBytes(uint64_t bytes); // of a file with so many
// The room of a file or collection, with all members where `deep` says so. Links are not followed. 0: nothing is there.
uint64_t roomTaken(const std::string& path, bool deep);

// The room that one owner's tree takes, kept in a file: "<generation> <bytes>\n", 20 digits each. The tree is walked
// when an object meets a file of an older generation, which is one for each start of the server; from then on every
// change is added. An object holds the file's lock from `open` to its end, so nobody else counts meanwhile.
// One thread.
class QuotaLedger {
public:
    QuotaLedger(std::string file, uint64_t generation, std::string tree)
        : _path(std::move(file)), _generation(generation), _tree(std::move(tree)) {}
    ~QuotaLedger();
    QuotaLedger(const QuotaLedger&) = delete;
    QuotaLedger& operator=(const QuotaLedger&) = delete;

    bool open(); // waits for the lock; false with errno when the file cannot be used
    uint64_t used() const { return _used; }
    bool add(int64_t bytes); // false with errno when it cannot be written down

private:
    bool read();
    bool write();

    const std::string _path;
    uint64_t _generation; // of a file that a younger server has counted, that one's
    const std::string _tree;
    int _file = -1;
    uint64_t _used = 0;
};

} // namespace rolvane::davacl
