#pragma once

#include <atomic>
#include <cstdint>

namespace rolvane::board {

// A page that the board shares with the processes that it harms: the board says which operation meets a fault, and the
// library that is loaded into those processes (shim/Shim.cpp) counts their operations. Its file is named by the
// variable kControlVariable. An operation is a call that changes a file below `root`, or with `network` one that sends
// bytes to a server; the moment after the server has answered counts as one more.
struct FaultControl {
    enum Kind : int32_t { none, kill, fullDisk, failingDisk, readOnlyDisk };
    char root[256];
    std::atomic<int64_t> at;     // the first operation that meets the fault, from 0; -1: none does
    std::atomic<int64_t> length; // how many do
    std::atomic<int32_t> kind;
    std::atomic<int32_t> network;
    std::atomic<int64_t> clock; // seconds that the process lives behind the others
    std::atomic<int64_t> count; // operations so far
    std::atomic<int64_t> met;   // of which met the fault
    char where[256];            // the last one that did
    char record[256];           // a file that every change of a file is written to, with its bytes; "": none
};

inline constexpr const char* kControlVariable = "ROLVANE_BOARD_CONTROL";

// One entry of such a record, followed by the path, the other path and the bytes.
struct RecordedChange {
    enum What : int32_t { write, truncate, sync, create, unlink, rename, makeDirectory, syncDirectory };
    int32_t what;
    int32_t pathLength, otherLength;
    int64_t offset; // of a write; the length of a truncation
    int64_t size;   // of the bytes
};

} // namespace rolvane::board
