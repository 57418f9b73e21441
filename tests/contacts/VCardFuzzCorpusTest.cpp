#include "../../fuzz/VCardTarget.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <iterator>

namespace rolvane {
namespace {

TEST(VCardFuzzCorpus, EveryInputIsReadAndWhatIsGoodComesBack) {
    size_t inputs = 0;
    for (const char* directory : {"/fuzz/corpus/vcard", "/fuzz/regressions/vcard"}) {
        std::filesystem::path path = std::string(ROLVANE_SOURCE_DIR) + directory;
        if (!std::filesystem::exists(path)) continue; // nothing has broken yet
        for (const auto& entry : std::filesystem::directory_iterator(path)) {
            std::ifstream in(entry.path(), std::ios::binary);
            std::string bytes((std::istreambuf_iterator<char>(in)), {});
            EXPECT_NO_THROW(fuzz::checkVCard(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size()))
                << entry.path();
            inputs++;
        }
    }
    EXPECT_GT(inputs, 20u);
}

} // namespace
} // namespace rolvane
