#include "Neighbour.h"
#include "support/DebianHttpd.h"

#include <filesystem>
#include <functional>
#include <unistd.h>

// Two people with the programs, on a store that an administrator has set up with Debian's httpd as it is shipped and
// the lines of the module's page.

namespace rolvane::test {
namespace {

class DebianStore : public testing::Test {
protected:
    DebianStore() {
        for (const char* name : {"alice", "bob"}) httpd.addUser(name, UserWorld::kPassword);
        httpd.useTLS();
        httpd.start();
        world.bus();
        const std::vector<std::string> account = {"--endpoint", httpd.endpoint(), "--ca-file", httpd.caFile()};
        alice = std::make_unique<Neighbour>(world, "alice", account);
        bob = std::make_unique<Neighbour>(world, "bob", account);
    }
    // What the daemons do by themselves a moment later.
    static testing::AssertionResult comesTrue(const std::function<bool()>& test) {
        constexpr int kTries = 600;
        constexpr useconds_t kPause = 50'000;
        for (int i = 0; i < kTries; ++i) {
            if (test()) return testing::AssertionSuccess();
            usleep(kPause);
        }
        return testing::AssertionFailure() << "it did not within half a minute";
    }
    static std::string nickname(Neighbour& person, const std::string& name) {
        const Ran ran = person.rolvane({"show", name, "--json"});
        if (ran.status != kDone) return {};
        return nlohmann::json::parse(ran.output)["properties"].value("Nickname", "");
    }
    static void expectDone(const Ran& ran) { EXPECT_EQ(ran.status, kDone) << ran; }
    std::string tree() const { return httpd.trees() + "/alice/Contacts"; }

    DebianHttpd httpd;
    CommandWorld world;
    std::unique_ptr<Neighbour> alice, bob;
};

TEST_F(DebianStore, CarriesEverythingFromThePublicationToItsEnd) {
    expectDone(alice->rolvane({"add", "--first", "Ada"}));
    expectDone(alice->rolvane({"add", "--first", "Bea"}));
    expectDone(alice->rolvane({"group", "create", "Family"}));
    expectDone(alice->rolvane({"publish"}));
    EXPECT_TRUE(std::filesystem::exists(tree() + "/dateFile"));
    EXPECT_NE(bob->rolvane({"subscribe", "alice"}).status, kDone) << "nothing is shared yet";
    expectDone(alice->rolvane({"share", "bob", "--write"}));
    expectDone(bob->rolvane({"subscribe", "alice"}));
    EXPECT_NE(bob->rolvane({"list"}).output.find("Ada"), std::string::npos);

    expectDone(alice->rolvane({"edit", "Ada", "--nickname", "Countess"}));
    expectDone(alice->rolvane({"sync"}));
    expectDone(bob->rolvane({"sync"}));
    EXPECT_EQ(nickname(*bob, "Ada"), "Countess");
    expectDone(bob->rolvane({"edit", "Bea", "--nickname", "Busy"}));
    expectDone(bob->rolvane({"sync"}));
    EXPECT_TRUE(comesTrue([&] {
        expectDone(alice->rolvane({"sync"}));
        return nickname(*alice, "Bea") == "Busy";
    }));

    expectDone(alice->rolvane({"unshare", "bob"}));
    expectDone(alice->rolvane({"edit", "Ada", "--nickname", "Lady"}));
    expectDone(alice->rolvane({"sync"}));
    EXPECT_NE(nickname(*bob, "Ada"), "Lady") << "the right is gone";
    expectDone(alice->rolvane({"unpublish", "--yes"}));
    EXPECT_TRUE(comesTrue([&] { return !std::filesystem::exists(tree() + "/dateFile"); }));
}

} // namespace
} // namespace rolvane::test
