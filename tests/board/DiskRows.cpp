#include "DiskRows.h"

#include <array>

namespace rolvane::board {

namespace {

struct Disk {
    const char* name;
    FaultControl::Kind kind;
    int64_t length;
};
constexpr int64_t kFromThenOn = int64_t(1) << 40;
constexpr std::array kDisks{Disk{"full disk", FaultControl::fullDisk, 1},
                            Disk{"full disk from then on", FaultControl::fullDisk, kFromThenOn},
                            Disk{"failing disk", FaultControl::failingDisk, 1},
                            Disk{"failing disk from then on", FaultControl::failingDisk, kFromThenOn},
                            Disk{"read-only disk", FaultControl::readOnlyDisk, 1},
                            Disk{"read-only disk from then on", FaultControl::readOnlyDisk, kFromThenOn}};
constexpr size_t kMostOperations = 5000; // of a pass

} // namespace

bool breakDiskOnce(Work& work, const Scenario& scenario, size_t disk, size_t operation) {
    work.stage.forgetStory();
    work.stage.bringBack(scenario.name);
    Fault fault;
    fault.kind = kDisks[disk].kind;
    fault.length = kDisks[disk].length;
    fault.at = static_cast<int64_t>(operation);
    const Ending ending = work.stage.pass(scenario.role, fault);
    if (ending.met == 0) return false;
    goOn(work, scenario, operation);
    judge(work, scenario.name + ", " + kDisks[disk].name + " at " + std::to_string(operation), settlingOf(scenario),
          ending);
    return true;
}

void breakDisk(Work& work) {
    for (const Scenario& scenario : scenarios())
        for (size_t disk = 0; disk < kDisks.size(); ++disk)
            for (size_t operation = 0; operation < kMostOperations; ++operation) {
                if (!work.isMine(operation + disk)) continue;
                if (work.timeIsOver()) return;
                if (!breakDiskOnce(work, scenario, disk, operation)) break;
            }
}

} // namespace rolvane::board
