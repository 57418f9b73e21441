#include "AccessWorld.h"

#include <gtest/gtest.h>
#include <unistd.h>

namespace rolvane {
namespace {

// An independent suite of WebDAV tests, Debian's package litmus: the module takes nothing away from mod_dav.
TEST(IndependentSuite, PassesWholeOnATreeUnderAccessLists) {
    const AccessWorld world;
    ASSERT_EQ(access("/usr/bin/litmus", X_OK), 0) << "install the packages of packaging/dependencies (litmus)";
    const StoreDirectory directory;
    const auto result =
        runCommand({"sh", "-c",
                    "cd " + directory.path() + " && exec litmus -k http://localhost:" + std::to_string(world.port()) +
                        "/dav/alice/ alice '" + rawPasswordOf("alice") + "'"});
    int passed = 0, run = 0;
    for (size_t at = result.output.find("summary for"); at != std::string::npos;
         at = result.output.find("summary for", at + 1)) {
        int total = 0, good = 0;
        ASSERT_EQ(
            std::sscanf(result.output.c_str() + at, "summary for %*[^:]: of %d tests run: %d passed", &total, &good), 2)
            << result.output.substr(at, 100);
        run += total;
        passed += good;
    }
    EXPECT_EQ(passed, run) << result.output;
    EXPECT_EQ(run, 104) << result.output << result.errors;
}

} // namespace
} // namespace rolvane
