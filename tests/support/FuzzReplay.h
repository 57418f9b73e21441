#pragma once

#include "foundation/Paths.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <filesystem>
#include <functional>
#include <string>

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

// What the fuzz target starts from, and what it once found.
inline void replayFuzzTarget(const std::filesystem::path& source, const std::string& name, const FuzzCheck& check) {
    EXPECT_GE(replayInputs(source / "fuzz/corpus" / name, check), 5u) << "the seed corpus is missing";
    replayInputs(source / "fuzz/regressions" / name, check);
}

} // namespace rolvane::test
