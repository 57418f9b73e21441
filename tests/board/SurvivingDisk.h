#pragma once

#include "../worlds/Chance.h"
#include "FaultControl.h"

#include <map>
#include <memory>
#include <string>
#include <vector>

namespace rolvane::board {

// What a disk may hold after a power loss, from the record of a process's changes (FaultControl.h). Of a file there is
// what it was synced with, and of later writes each or not, the last one perhaps in part. Names that were made, renamed
// or taken away are there up to some moment behind the last sync of their directory.
class SurvivingDisk {
public:
    // `before`: a copy of the directory `root` as it was, and safe, before the process began.
    SurvivingDisk(std::string root, std::string before) : _root(std::move(root)), _before(std::move(before)) {}

    void read(const std::string& record); // the file
    enum class Survives { nothing, some, everything };
    // Writes one state to the files below root, which are as they were before the process began.
    void write(Survives what, worlds::Chance& chance) const;

private:
    struct Change {
        RecordedChange::What what;
        int64_t offset;
        std::string bytes;
    };
    struct File {
        std::string safe;
        std::vector<Change> later;
    };
    using FileRef = std::shared_ptr<File>;
    using Names = std::map<std::string, FileRef>; // null: no such file
    struct NameChange {
        RecordedChange::What what;
        std::string path, other;
        FileRef file;
    };

    FileRef& at(const std::string& path);
    static void apply(const Change& change, std::string& content);
    static void apply(const NameChange& change, Names& names);
    void take(const RecordedChange& change, const std::string& path, const std::string& other, std::string bytes);
    void syncDirectory(const std::string& directory);

    const std::string _root, _before;
    Names _now, _safe;
    std::vector<NameChange> _later; // behind what is safe, in order
};

} // namespace rolvane::board
