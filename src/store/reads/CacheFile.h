#pragma once

#include <string>
#include <string_view>
#include <utility>

namespace rolvane {

// One account's memory on the disk, which outlives the process. Losing it costs requests only: a missing, damaged or
// foreign file is an empty memory, and a failed write is logged.
//   file = "RVC1" sum:u64 owner content   owner = size:u64 bytes   the sum is of all behind it
// Numbers as the machine has them. Not locked; a reader sees a whole file.
class CacheFile {
public:
    static constexpr size_t kMostBytes = 128u << 20;

    // `path` empty: nothing is kept. `owner`: the account and the form of the content.
    CacheFile(std::string path, std::string owner) : _path(std::move(path)), _owner(std::move(owner)) {}

    std::string read() const; // "" when there is none
    void write(std::string_view content) const;

private:
    const std::string _path, _owner;
};

} // namespace rolvane
