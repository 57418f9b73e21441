// Replays what the fuzz targets start from and what they once found.
#include "../../fuzz/KeyedArchiveTarget.h"
#include "../../fuzz/PropertyListTarget.h"

#include "foundation/Paths.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <functional>
#include <string>

namespace rolvane {
namespace {

using Check = std::function<void(const uint8_t*, size_t)>;

size_t replay(const std::filesystem::path& directory, const Check& check) {
    size_t inputs = 0;
    if (!std::filesystem::exists(directory)) return inputs;
    for (const auto& entry : std::filesystem::directory_iterator(directory)) {
        const std::string input = readFile(entry.path());
        EXPECT_NO_THROW(check(reinterpret_cast<const uint8_t*>(input.data()), input.size())) << entry.path();
        ++inputs;
    }
    return inputs;
}

void replayTarget(const std::string& name, const Check& check) {
    const std::filesystem::path root = std::filesystem::path(ROLVANE_SOURCE_DIR) / "fuzz";
    EXPECT_GE(replay(root / "corpus" / name, check), 5u) << "the seed corpus is missing";
    replay(root / "regressions" / name, check);
}

TEST(FuzzCorpusTest, EveryPropertyListInputHolds) {
    replayTarget("property_list", fuzz::checkPropertyList);
}

TEST(FuzzCorpusTest, EveryKeyedArchiveInputHolds) {
    replayTarget("keyed_archive", fuzz::checkKeyedArchive);
}

} // namespace
} // namespace rolvane
