#pragma once

#include "foundation/Paths.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <random>
#include <string>
#include <vector>

namespace rolvane::test {

using FuzzCheck = std::function<void(const uint8_t*, size_t)>;

// Gives every file of the directory to the check, which throws when an input does not hold. How many there were.
inline size_t replayInputs(const std::filesystem::path& directory, const FuzzCheck& check) {
    size_t inputs = 0;
    if (!std::filesystem::exists(directory)) return inputs;
    for (const auto& entry : std::filesystem::directory_iterator(directory)) {
        const std::string input = readFile(entry.path());
        EXPECT_NO_THROW(check(reinterpret_cast<const uint8_t*>(input.data()), input.size())) << entry.path();
        ++inputs;
    }
    return inputs;
}

// Copies of the inputs with some bytes changed, removed or repeated, the same ones at each run: a short run of the
// target that any build makes, and that nothing stops but a change of what it tests.
inline void replayDamaged(const std::filesystem::path& directory, const FuzzCheck& check, int rounds) {
    if (!std::filesystem::exists(directory)) return;
    std::vector<std::filesystem::path> files;
    for (const auto& entry : std::filesystem::directory_iterator(directory)) files.push_back(entry.path());
    std::sort(files.begin(), files.end());
    std::mt19937 random(20261122);
    for (const auto& file : files) {
        const std::string whole = readFile(file);
        constexpr size_t kLongest = 16384; // what is longer takes its time
        if (whole.empty() || whole.size() > kLongest) continue;
        for (int round = 0; round < rounds; ++round) {
            std::string input = whole;
            for (auto changes = 1 + random() % 4; changes > 0 && !input.empty(); --changes) {
                const size_t at = random() % input.size(), length = 1 + random() % 8;
                switch (random() % 4) {
                case 0: input[at] = static_cast<char>(random()); break;
                case 1: input.erase(at, length); break;
                case 2: input.insert(at, input, random() % input.size(), length); break;
                default: input[at] = input[random() % input.size()]; break;
                }
            }
            EXPECT_NO_THROW(check(reinterpret_cast<const uint8_t*>(input.data()), input.size()))
                << file << ", round " << round << ", " << input;
        }
    }
}

// What the fuzz target starts from, what it once found, and both a little damaged.
inline void replayFuzzTarget(const std::filesystem::path& source, const std::string& name, const FuzzCheck& check) {
    EXPECT_GE(replayInputs(source / "fuzz/corpus" / name, check), 5u) << "the seed corpus is missing";
    replayInputs(source / "fuzz/regressions" / name, check);
    constexpr int kRounds = 200;
    for (const char* kind : {"fuzz/corpus", "fuzz/regressions"}) replayDamaged(source / kind / name, check, kRounds);
}

} // namespace rolvane::test
