#include "server/mod_davacl/SignInBrake.h"
#include "AccessWorld.h"
#include "server/mod_davacl/LastUse.h"

#include <fcntl.h>
#include <filesystem>
#include <gtest/gtest.h>
#include <memory>
#include <sys/stat.h>

namespace rolvane {
namespace {

using davacl::LastUse;
using davacl::SignInBrake;
using namespace std::chrono_literals;

struct Unmapped {
    void operator()(SignInBrake* brake) const { brake->unmap(); }
};
using Brake = std::unique_ptr<SignInBrake, Unmapped>;

TEST(SignInBrake, PausesAfterFiveWrongOnesAndEachPauseIsTwiceAsLong) {
    const Brake brake(SignInBrake::map());
    ASSERT_TRUE(brake);
    const uint64_t place = SignInBrake::place("phone", "abcd");
    int64_t now = 1'000'000;
    for (int i = 0; i < 4; ++i) EXPECT_EQ(brake->wrong(place, now), 0);
    EXPECT_TRUE(brake->looks(place, now));
    for (const int64_t pause : {1000, 2000, 4000, 8000, 16000, 32000, 60000, 60000}) {
        EXPECT_EQ(brake->wrong(place, now), pause);
        EXPECT_FALSE(brake->looks(place, now + pause - 1));
        now += pause;
        EXPECT_TRUE(brake->looks(place, now));
    }
}

// Many guesses at the same moment count as many, not as one.
TEST(SignInBrake, LooksAtFiveAtATimeAndAtOneBehindAPause) {
    const Brake brake(SignInBrake::map());
    const uint64_t place = SignInBrake::place("phone", "abcd");
    int looked = 0;
    for (int i = 0; i < 100; ++i) looked += brake->looks(place, 5000);
    EXPECT_EQ(looked, 5);
    for (int i = 0; i < looked; ++i) brake->wrong(place, 5000);
    const int64_t later = 5000 + SignInBrake::kFirstPause;
    looked = 0;
    for (int i = 0; i < 100; ++i) looked += brake->looks(place, later);
    EXPECT_EQ(looked, 1);
    EXPECT_TRUE(brake->looks(place, later + SignInBrake::kLongestLook)) << "whoever looked has died";
}

// Wrong passwords for other names do not make it forget, whatever they are.
TEST(SignInBrake, IsNotLedToForgetByNamesThatNobodyHas) {
    const Brake brake(SignInBrake::map());
    const uint64_t place = SignInBrake::place("phone", "abcd");
    constexpr uint64_t kSlots = 4096, kNames = 100;
    for (int i = 0; i < 5; ++i) brake->wrong(place, 5000);
    for (uint64_t i = 1; i < kNames; ++i)
        brake->wrong(place + i * kSlots, 5000); // one slot in a table by the remainder
    EXPECT_FALSE(brake->looks(place, 5001));
    EXPECT_EQ(brake->wrong(place, 5001), 2 * SignInBrake::kFirstPause);
}

TEST(SignInBrake, HoldsUpNobodyElse) {
    const Brake brake(SignInBrake::map());
    const uint64_t place = SignInBrake::place("phone", "abcd");
    for (int i = 0; i < 6; ++i) brake->wrong(place, 5000);
    ASSERT_FALSE(brake->looks(place, 5001));
    EXPECT_TRUE(brake->looks(SignInBrake::place("phone", "abce"), 5001)) << "another address";
    EXPECT_TRUE(brake->looks(SignInBrake::place("laptop", "abcd"), 5001)) << "another user";
}

TEST(SignInBrake, TakesAnIPv6NetworkForOnePlace) {
    const std::string one("network1host0001"), other("network1host0002"), third("network2host0001");
    EXPECT_EQ(SignInBrake::place("phone", one), SignInBrake::place("phone", other));
    EXPECT_NE(SignInBrake::place("phone", one), SignInBrake::place("phone", third));
}

TEST(SignInBrake, ForgetsAfterARightOneAndAfterTenMinutes) {
    const Brake brake(SignInBrake::map());
    const uint64_t place = SignInBrake::place("phone", "abcd");
    for (int i = 0; i < 6; ++i) brake->wrong(place, 5000);
    brake->right(place);
    EXPECT_TRUE(brake->looks(place, 5001));
    EXPECT_EQ(brake->wrong(place, 5001), 0);
    for (int i = 0; i < 6; ++i) brake->wrong(place, 5000);
    EXPECT_EQ(brake->wrong(place, 5000 + SignInBrake::kForgotten), 0);
}

TEST(LastUse, IsTheDateOfTheUsersFileAndWrittenOnceAMinute) {
    const StoreDirectory directory;
    LastUse uses;
    const auto start = std::chrono::steady_clock::time_point(100h);
    const auto dateOf = [&](const char* user) {
        struct stat info {};
        return stat(directory.path(user).c_str(), &info) == 0 ? info.st_mtim.tv_sec : 0;
    };
    const auto setOld = [&] {
        const timespec old[2] = {{1000, 0}, {1000, 0}};
        utimensat(AT_FDCWD, directory.path("phone").c_str(), old, 0);
    };
    uses.note(directory.path(), "phone", start);
    EXPECT_GT(dateOf("phone"), 1000);
    setOld();
    uses.note(directory.path(), "phone", start + 59s);
    EXPECT_EQ(dateOf("phone"), 1000);
    uses.note(directory.path(), "phone", start + 60s);
    EXPECT_GT(dateOf("phone"), 1000);
    uses.note(directory.path(), "../phone", start);
    uses.note(directory.path(), ".hidden", start);
    uses.note(directory.path("nowhere"), "phone", start);
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(directory.path()), {}), 1);
}

PrivateStoreOptions thatBrakes(const std::string& directory) {
    PrivateStoreOptions options;
    options.extraConfiguration = {"DavAclSlowGuesses On", "DavAclLastUse \"" + directory + "\""};
    return options;
}

TEST(SigningInSlowly, AGuessInAPauseIsRefusedEvenIfRightAndARememberedSignInGoesOn) {
    AccessWorld world(thatBrakes("run"));
    world.store.addUser("alice", "her word");
    world.store.addUser("newcomer", "right");
    const auto signIn = [&](const std::string& user, const std::string& password) {
        return std::atoi(runCommand({"curl", "-q", "-sS", "--noproxy", "*", "-o", "/dev/null", "-w", "%{http_code}",
                                     "-X", "OPTIONS", "-u", user + ":" + password,
                                     "http://localhost:" + std::to_string(world.port()) + "/dav/" + user + "/"})
                             .output.c_str());
    };
    EXPECT_EQ(signIn("alice", "her word"), 200);
    for (int i = 0; i < 7; ++i) EXPECT_EQ(signIn("newcomer", "wrong" + std::to_string(i)), 401);
    EXPECT_EQ(signIn("newcomer", "right"), 401) << "a pause has just begun";
    for (int i = 0; i < 7; ++i) EXPECT_EQ(signIn("alice", "wrong" + std::to_string(i)), 401);
    EXPECT_EQ(signIn("alice", "her word"), 200) << "who was let in before stays in";
    EXPECT_EQ(signIn("rita", rawPasswordOf("rita")), 200) << "nobody else waits";
    const std::string used = world.store.stateDirectory() + "/run/";
    EXPECT_TRUE(std::filesystem::exists(used + "alice"));
    EXPECT_FALSE(std::filesystem::exists(used + "newcomer"));
}

} // namespace
} // namespace rolvane
