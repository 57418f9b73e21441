#include "server/mod_davacl/Quota.h"
#include "AccessWorld.h"
#include "foundation/Paths.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <random>
#include <regex>
#include <thread>

namespace rolvane {
namespace {

using davacl::kNoQuota;
using davacl::kRoomUnit;
using davacl::quotaInFile;
using davacl::roomOfBytes;
using davacl::roomTaken;
using davacl::sizeOf;
using testing::HasSubstr;
using testing::Not;

constexpr uint64_t kUnits = 64; // of the quota
constexpr const char* kTree = "/dav/alice/Contacts/";
using Headers = std::vector<std::pair<std::string, std::string>>;

// A store whose trees may take 64 units each.
class Quota : public testing::Test {
protected:
    static PrivateStoreOptions options(const std::vector<std::string>& more = {}) {
        PrivateStoreOptions o;
        o.extraConfiguration = {"DavAclQuota " + std::to_string(kUnits * kRoomUnit)};
        o.extraConfiguration.insert(o.extraConfiguration.end(), more.begin(), more.end());
        return o;
    }
    static std::string text(uint64_t units) { return std::string(units * kRoomUnit, 'x'); }
    int put(const std::string& path, uint64_t units, const std::string& user = "alice") {
        return world.status(user, "PUT", path, {}, text(units));
    }
    std::string property(const std::string& name, const std::string& path = kTree, const std::string& user = "alice") {
        const auto answer = world.ask(user, "PROPFIND", path, {{"Depth", "0"}}, AccessWorld::propfind(name));
        std::smatch found;
        const std::regex value(name + ">([0-9]+)<");
        return std::regex_search(answer.body, found, value) ? found[1].str() : "";
    }
    uint64_t used(const std::string& user = "alice") {
        const std::string text = property("quota-used-bytes", "/dav/" + user + "/", user);
        EXPECT_FALSE(text.empty());
        return text.empty() ? 0 : std::stoull(text) / kRoomUnit;
    }
    uint64_t onDisk(const std::string& user = "alice") {
        return roomTaken(world.store.userDirectory(user), true) / kRoomUnit;
    }
    void expectCounted() { EXPECT_EQ(used(), onDisk()); }
    uint64_t room() { return kUnits - used(); }

    AccessWorld world{options()};
    void SetUp() override { world.reset(); }
};

TEST_F(Quota, IsToldByTheTwoProperties) {
    expectCounted();
    EXPECT_EQ(std::stoull(property("quota-available-bytes")), (kUnits - onDisk()) * kRoomUnit);
    ASSERT_EQ(put(std::string(kTree) + "a", 3), 201);
    expectCounted();
    EXPECT_EQ(property("quota-used-bytes", std::string(kTree) + "a"), "") << "a file has none";
}

TEST_F(Quota, IsToldToWhoMayPutSomethingThereAndNobodyElse) {
    EXPECT_EQ(property("quota-used-bytes", kTree, "walter"), property("quota-used-bytes"));
    EXPECT_EQ(property("quota-available-bytes", kTree, "rita"), "");
    EXPECT_EQ(property("quota-used-bytes", kTree, "rita"), "");
}

TEST_F(Quota, AnUploadThatFitsExactlyIsTakenAndOneByteMoreIs507) {
    const uint64_t free = room();
    EXPECT_EQ(world.status("alice", "PUT", std::string(kTree) + "big", {}, text(free) + "y"), 507);
    EXPECT_EQ(world.status("alice", "GET", std::string(kTree) + "big"), 404) << "nothing of it stays";
    expectCounted();
    EXPECT_EQ(put(std::string(kTree) + "big", free), 201);
    EXPECT_EQ(put(std::string(kTree) + "one", 1), 507);
    EXPECT_EQ(property("quota-available-bytes"), "0");
    expectCounted();
}

TEST_F(Quota, TheRefusalSaysWhyAndTheOldFileStays) {
    ASSERT_EQ(world.status("alice", "PUT", std::string(kTree) + "a", {}, "old"), 201);
    const auto refused = world.ask("alice", "PUT", std::string(kTree) + "a", {}, text(kUnits));
    EXPECT_EQ(refused.status, 507);
    EXPECT_THAT(refused.body, HasSubstr("quota-not-exceeded"));
    EXPECT_EQ(world.ask("alice", "GET", std::string(kTree) + "a").body, "old");
}

TEST_F(Quota, AnUploadWithoutALengthIsStoppedAndLeavesNothing) {
    std::string chunks;
    for (uint64_t i = 0; i < kUnits + 1; ++i) chunks += "1000\r\n" + text(1) + "\r\n";
    const auto refused =
        world.ask("alice", "PUT", std::string(kTree) + "a", {{"Transfer-Encoding", "chunked"}, {"Connection", "close"}},
                  chunks); // and no end: it is refused before that
    EXPECT_EQ(refused.status, 507) << refused.headers;
    EXPECT_EQ(world.status("alice", "GET", std::string(kTree) + "a"), 404);
    expectCounted();
}

TEST_F(Quota, AFullTreeMayBecomeSmaller) {
    ASSERT_EQ(put(std::string(kTree) + "a", room()), 201);
    EXPECT_EQ(put(std::string(kTree) + "a", 1), 204) << "a smaller version";
    ASSERT_EQ(put(std::string(kTree) + "b", room()), 201);
    EXPECT_EQ(world.status("alice", "MOVE", std::string(kTree) + "b", {{"Destination", std::string(kTree) + "c"}}),
              201);
    expectCounted();
    EXPECT_EQ(world.status("alice", "DELETE", std::string(kTree) + "c"), 204);
    expectCounted();
    EXPECT_EQ(put(std::string(kTree) + "d", room()), 201);
}

TEST_F(Quota, EmptyFilesAndCollectionsCountToo) {
    ASSERT_EQ(put(std::string(kTree) + "a", room() - 2), 201);
    EXPECT_EQ(world.status("alice", "MKCOL", std::string(kTree) + "c/"), 201);
    EXPECT_EQ(put(std::string(kTree) + "empty", 0), 201);
    EXPECT_EQ(put(std::string(kTree) + "empty2", 0), 507);
    EXPECT_EQ(world.status("alice", "MKCOL", std::string(kTree) + "c2/"), 507);
    EXPECT_EQ(world.status("alice", "LOCK", std::string(kTree) + "new", {}, AccessWorld::kLock), 507);
    EXPECT_EQ(world.status("alice", "LOCK", std::string(kTree) + "empty", {}, AccessWorld::kLock), 200);
    expectCounted();
}

TEST_F(Quota, CopiesCountWithAllThatIsInThem) {
    ASSERT_EQ(world.status("alice", "MKCOL", std::string(kTree) + "c/"), 201);
    ASSERT_EQ(put(std::string(kTree) + "c/a", 10), 201);
    ASSERT_EQ(put(std::string(kTree) + "c/b", 10), 201);
    EXPECT_EQ(world.status("alice", "COPY", std::string(kTree) + "c/", {{"Destination", std::string(kTree) + "d/"}}),
              201);
    expectCounted();
    EXPECT_EQ(world.status("alice", "COPY", std::string(kTree) + "c/", {{"Destination", std::string(kTree) + "e/"}}),
              507);
    EXPECT_EQ(world.status("alice", "GET", std::string(kTree) + "e/a"), 404);
    EXPECT_EQ(world.status("alice", "COPY", std::string(kTree) + "c/",
                           {{"Destination", std::string(kTree) + "e/"}, {"Depth", "0"}}),
              201)
        << "the collection alone";
    EXPECT_EQ(world.status("alice", "COPY", std::string(kTree) + "c/", {{"Destination", std::string(kTree) + "d/"}}),
              204)
        << "in the place of as much";
    expectCounted();
    EXPECT_EQ(world.status("alice", "DELETE", std::string(kTree) + "d/"), 204);
    expectCounted();
}

TEST_F(Quota, IsTheOwnersWhoeverWrites) {
    const uint64_t free = room();
    EXPECT_EQ(put(std::string(kTree) + "w", free + 1, "walter"), 507);
    EXPECT_EQ(put(std::string(kTree) + "w", free, "walter"), 201);
    EXPECT_EQ(put("/dav/sam/s", 5, "sam"), 201) << "others have their own room";
    expectCounted();
    EXPECT_EQ(used("sam"), onDisk("sam"));
}

TEST_F(Quota, AMoveToAnotherOwnerChangesBothCounts) {
    ASSERT_EQ(world.status("walter", "MKCOL", "/dav/walter/x/"), 201) << "in a tree of one's own";
    ASSERT_EQ(put("/dav/walter/x/a", 7, "walter"), 201);
    const uint64_t before = used("walter");
    EXPECT_EQ(world.status("walter", "MOVE", "/dav/walter/x/a", {{"Destination", std::string(kTree) + "a"}}), 201);
    EXPECT_EQ(used("walter"), before - 7);
    EXPECT_EQ(used("walter"), onDisk("walter"));
    expectCounted();
    ASSERT_EQ(put(std::string(kTree) + "b", room()), 201);
    ASSERT_EQ(put("/dav/walter/x/c", 1, "walter"), 201);
    EXPECT_EQ(world.status("walter", "MOVE", "/dav/walter/x/c", {{"Destination", std::string(kTree) + "c"}}), 507);
    EXPECT_EQ(world.status("walter", "GET", "/dav/walter/x/c"), 200);
}

TEST_F(Quota, PropertiesCount) {
    ASSERT_EQ(world.status("alice", "PUT", std::string(kTree) + "a", {}, "a"), 201);
    const uint64_t before = used();
    EXPECT_EQ(world.status("alice", "PROPPATCH", std::string(kTree) + "a", {}, AccessWorld::kPatch), 207);
    EXPECT_EQ(world.status("alice", "PROPPATCH", kTree, {}, AccessWorld::kPatch), 207);
    EXPECT_GT(used(), before);
    expectCounted();
    ASSERT_EQ(put(std::string(kTree) + "b", room()), 201);
    EXPECT_EQ(world.status("alice", "PROPPATCH", std::string(kTree) + "b", {}, AccessWorld::kPatch), 507);
    expectCounted();
}

// Random changes, many at once, of the same places: no two of them may count one file twice.
TEST_F(Quota, IsExactWhateverHappensAtOnce) {
    const auto work = [&](unsigned seed) {
        std::mt19937 random(seed);
        const auto name = [&] { return std::string(kTree) + std::string(1, static_cast<char>('a' + random() % 3)); };
        for (int i = 0; i < 60; ++i) {
            const std::string user = random() % 2 ? "alice" : "walter";
            switch (random() % 4) {
            case 0: world.status(user, "DELETE", name()); break;
            case 1: world.status(user, "MOVE", name(), {{"Destination", name()}}); break;
            case 2: world.status(user, "COPY", name(), {{"Destination", name()}}); break;
            default: put(name(), random() % 30, user);
            }
        }
    };
    std::vector<std::thread> all;
    for (unsigned seed = 1; seed <= 6; ++seed) all.emplace_back(work, seed);
    for (auto& each : all) each.join();
    expectCounted();
    EXPECT_LE(used(), kUnits);
}

TEST_F(Quota, WalksTheTreeOnceForAStartAndNotForEachUpload) {
    ASSERT_EQ(put(std::string(kTree) + "a", 2), 201);
    const uint64_t counted = used();
    // Nobody counts a file that another program puts there, until the next start.
    std::ofstream(world.store.userDirectory("alice") + "/Contacts/b") << text(4);
    ASSERT_EQ(put(std::string(kTree) + "c", 1), 201);
    EXPECT_EQ(used(), counted + 1);
    world.store.stop();
    world.store.start();
    expectCounted();
    EXPECT_EQ(used(), counted + 5);
}

TEST_F(Quota, ADamagedCountIsMadeAgain) {
    ASSERT_EQ(put(std::string(kTree) + "a", 2), 201);
    const std::string file = world.store.stateDirectory() + "/lists/alice.used";
    ASSERT_TRUE(std::filesystem::exists(file));
    std::ofstream(file) << "rubbish";
    EXPECT_EQ(put(std::string(kTree) + "b", 1), 201);
    expectCounted();
}

TEST(QuotaFile, GivesUsersAQuotaOfTheirOwnAtOnce) {
    StoreDirectory directory;
    const std::string file = directory.path("quotas");
    PrivateStoreOptions options;
    options.extraConfiguration = {"DavAclQuota 40K", "DavAclQuotaFile \"" + file + "\""};
    const AccessWorld world(options);
    world.reset();
    const auto put = [&](uint64_t bytes) {
        return world.status("alice", "PUT", std::string(kTree) + "a", {}, std::string(bytes, 'x'));
    };
    EXPECT_EQ(put(100000), 507) << "no file, nobody's own quota";
    std::ofstream(file) << "# comment\nsam: 1K\nalice: 1M\n";
    EXPECT_EQ(put(100000), 201);
    std::ofstream(file) << "alice: none\n";
    EXPECT_EQ(put(2000000), 204);
    std::ofstream(file) << "alice: plenty\n";
    EXPECT_EQ(put(2100000), 507) << "a line that cannot be read allows nothing more";
    EXPECT_EQ(put(1000), 204) << "and less is always possible";
}

TEST(QuotaFile, IsReadToTheLetter) {
    EXPECT_EQ(quotaInFile("al: 1\nalice: 2K\n bob : none \n", "alice"), 2048U);
    EXPECT_EQ(quotaInFile("al: 1\nalice: 2K\n bob : none \n", "bob"), kNoQuota);
    EXPECT_EQ(quotaInFile("alice: 1\nalice: 2\n", "alice"), 2U);
    EXPECT_EQ(quotaInFile("alice: 1", "alic"), std::nullopt);
    EXPECT_EQ(quotaInFile("alice: x", "alice"), 0U);
    EXPECT_EQ(quotaInFile("", "alice"), std::nullopt);
}

TEST(QuotaSizes, AreNumbersOfBytesWithAUnit) {
    EXPECT_EQ(sizeOf("0"), 0U);
    EXPECT_EQ(sizeOf("1048576"), 1048576U);
    EXPECT_EQ(sizeOf("2K"), 2048U);
    EXPECT_EQ(sizeOf("500M"), 500U << 20);
    EXPECT_EQ(sizeOf("3T"), uint64_t{3} << 40);
    EXPECT_EQ(sizeOf("none"), kNoQuota);
    for (const char* no : {"", "K", "-1", "1X", "1KK", "1 K", "18446744073709551615", "99999999T", "None"})
        EXPECT_EQ(sizeOf(no), std::nullopt) << no;
    EXPECT_EQ(roomOfBytes(0), kRoomUnit);
    EXPECT_EQ(roomOfBytes(kRoomUnit), kRoomUnit);
    EXPECT_EQ(roomOfBytes(kRoomUnit + 1), 2 * kRoomUnit);
}

TEST(StoreWithoutQuota, HasNoPropertiesOfOneAndCountsNothing) {
    const AccessWorld world;
    world.reset();
    const auto answer =
        world.ask("alice", "PROPFIND", kTree, {{"Depth", "0"}}, AccessWorld::propfind("quota-used-bytes"));
    EXPECT_THAT(answer.body, HasSubstr("404 Not Found"));
    EXPECT_FALSE(std::filesystem::exists(world.store.stateDirectory() + "/lists/alice.used"));
}

} // namespace
} // namespace rolvane
