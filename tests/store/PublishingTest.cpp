#include "StoreWorld.h"
#include "support/TempHome.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <set>
#include <thread>

namespace rolvane {
namespace {

using namespace test;

constexpr const char* kGroup = "5D1C0A52-9F3B-4C2E-8B1D-0A3C5E7F9B11:CXGroup";
const Dictionary kState{{"memberUIDState", Array{"A:CXPerson"}}};
const Dictionary kOther{{"memberUIDState", Array{"A:CXPerson", "B:CXPerson"}}};

class Publishing : public testing::Test {
protected:
    StoreWorld world;
    Client alice{world};
};

TEST_F(Publishing, TheStructureIsMadeOnceAndThenToldByOneRequest) {
    EXPECT_FALSE(alice.manager.sanityCheckPublishStructureCreate(false));
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    std::set<std::string> names;
    for (const auto& e : std::filesystem::directory_iterator(world.file("People"))) names.insert(e.path().filename());
    std::set<std::string> expected;
    for (int i = 0; i < 32; ++i) expected.insert(std::to_string(i));
    names.erase(".DAV");
    EXPECT_EQ(names, expected);
    EXPECT_EQ(world.contents("dateFile"), "why");
    const std::string serial = PropertyList::fromXML(world.contents("info")).dictionary()["SerialNumber"].string();
    EXPECT_EQ(serial.size(), 36u);

    alice.wire->clear();
    Client second(world);
    EXPECT_TRUE(second.manager.sanityCheckPublishStructureCreate(true));
    EXPECT_EQ(second.wire->methods(), "PROPFIND");
    EXPECT_EQ(PropertyList::fromXML(world.contents("info")).dictionary()["SerialNumber"].string(), serial);
}

TEST_F(Publishing, AHalfMadeStructureIsCompletedAndWhatIsThereStays) {
    for (const char* folder : {"", "People", "People/7"})
        ASSERT_TRUE(alice.manager.createDirectoryAtAURL(alice.at(folder)));
    ASSERT_EQ(alice.write("People/7/x", "kept"), 201);
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    EXPECT_EQ(world.contents("People/7/x"), "kept");
    EXPECT_TRUE(std::filesystem::is_directory(world.file("People/31")));
    EXPECT_TRUE(std::filesystem::exists(world.file("info")));
}

TEST_F(Publishing, ALostSerialNumberIsMadeAnewAndNothingElseIsWritten) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    std::filesystem::remove(world.file("info"));
    alice.wire->clear();
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    EXPECT_EQ(alice.wire->count("PUT"), 1u);
    EXPECT_EQ(alice.wire->count("MKCOL"), 0u);
    EXPECT_TRUE(std::filesystem::exists(world.file("info")));
}

TEST_F(Publishing, TwoClientsMayMakeTheStructureAtTheSameTime) {
    Client second(world);
    bool first = false, other = false;
    std::thread a([&] { first = alice.manager.sanityCheckPublishStructureCreate(true); });
    std::thread b([&] { other = second.manager.sanityCheckPublishStructureCreate(true); });
    a.join();
    b.join();
    EXPECT_TRUE(first);
    EXPECT_TRUE(other);
    EXPECT_TRUE(std::filesystem::is_directory(world.file("People/0")));
}

// Servers answer variously to one of two that make a collection at the same time; here, the other one has made it all.
TEST_F(Publishing, ARefusalDoesNotCountWhenTheOtherClientHasMadeTheStructureMeanwhile) {
    Client second(world);
    bool other = false;
    std::string serial;
    alice.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        if (request.method != "MKCOL" || !request.url.encodedPath().ends_with("/People/") || other) return std::nullopt;
        other = second.manager.sanityCheckPublishStructureCreate(true);
        serial = world.contents("info");
        return answerOf(403);
    });
    EXPECT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    EXPECT_TRUE(other);
    EXPECT_EQ(world.contents("info"), serial) << "the tree keeps its number";
    EXPECT_EQ(alice.wire->count("PUT"), 0u) << "nothing was left to make";
}

TEST_F(Publishing, WhatTheOtherClientHadNoTimeForIsMadeAfterARefusal) {
    Client second(world);
    alice.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        if (request.method != "MKCOL" || !request.url.encodedPath().ends_with("/People/9/")) return std::nullopt;
        alice.wire->intercept({}); // once
        EXPECT_TRUE(second.manager.createDirectoryAtAURL(second.at("People/9")));
        return answerOf(403);
    });
    EXPECT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    for (int i = 0; i < 32; ++i)
        EXPECT_TRUE(std::filesystem::is_directory(world.file("People/" + std::to_string(i)))) << i;
    EXPECT_TRUE(std::filesystem::exists(world.file("info")));
}

TEST_F(Publishing, AStoreThatRefusesTheStructureForGoodHasNone) {
    alice.wire->intercept([](const HttpRequest& request) {
        return request.method == "MKCOL" ? std::optional(answerOf(403)) : std::nullopt;
    });
    EXPECT_FALSE(alice.manager.sanityCheckPublishStructureCreate(true));
    EXPECT_FALSE(std::filesystem::exists(world.file("info")));
}

TEST_F(Publishing, ABucketThatVanishedIsMadeAgainByTheWriteThatMissesIt) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    std::filesystem::remove_all(world.file("People/4"));
    EXPECT_EQ(alice.write("People/4/A:CXPerson", kState), 201);
    EXPECT_TRUE(std::filesystem::exists(world.file("People/4/A:CXPerson")));
}

TEST_F(Publishing, AContactCostsOneRequest) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    alice.wire->clear();
    EXPECT_EQ(alice.write("People/4/A:CXPerson", kState), 201);
    EXPECT_EQ(alice.wire->methods(), "PUT");
    EXPECT_EQ(PropertyList::fromXML(world.contents("People/4/A:CXPerson")).dictionary(), kState);
}

TEST_F(Publishing, AGroupsStateSurvivesTheMakingOfItsFolder) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    ASSERT_EQ(alice.write(kGroup, kState), 201);
    ASSERT_TRUE(alice.manager.createDirectoryAtAURL(alice.at(kGroup)));
    EXPECT_TRUE(std::filesystem::is_directory(world.file(kGroup)));
    ASSERT_EQ(alice.write(std::string(kGroup) + "/info", Dictionary{{"name", "Friends"}}), 201);
    EXPECT_EQ(alice.read(kGroup).second, kState);
    Client fresh(world);
    EXPECT_EQ(fresh.read(kGroup).second, kState);
    EXPECT_EQ(fresh.read(std::string(kGroup) + "/info").second, (Dictionary{{"name", "Friends"}}));
}

TEST_F(Publishing, AStateThatIsWrittenWhileItsFolderIsMadeIsNotLost) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    ASSERT_EQ(alice.write(kGroup, kState), 201);
    Client other(world);
    alice.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        if (request.method == "MOVE") {
            EXPECT_EQ(other.write(kGroup, kOther), 204);
        }
        return std::nullopt;
    });
    EXPECT_FALSE(alice.manager.createDirectoryAtAURL(alice.at(kGroup)));
    EXPECT_EQ(other.read(kGroup).second, kOther) << alice.wire->text();
    alice.wire->intercept(nullptr);
    EXPECT_TRUE(alice.manager.createDirectoryAtAURL(alice.at(kGroup))) << alice.wire->text();
    EXPECT_EQ(other.read(kGroup).second, kOther);
}

TEST_F(Publishing, AGroupsStateIsWrittenIntoItsFolderWhenThatCameFirst) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    ASSERT_TRUE(alice.manager.createDirectoryAtAURL(alice.at(kGroup)));
    Client fresh(world); // knows nothing of the folder
    EXPECT_EQ(fresh.read(kGroup).first, 404);
    EXPECT_EQ(fresh.write(kGroup, kState), 201);
    EXPECT_EQ(alice.read(kGroup).second, kState);
    Client third(world);
    EXPECT_EQ(third.write(kGroup, kOther), 204) << "without a read before it";
    EXPECT_EQ(alice.read(kGroup).second, kOther);
}

TEST_F(Publishing, AFolderThatWasDeletedElsewhereGivesWayToAFile) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    ASSERT_TRUE(alice.manager.createDirectoryAtAURL(alice.at(kGroup)));
    Client other(world);
    int code = 0;
    ASSERT_TRUE(other.manager.removeFileAtURL(other.at(kGroup), &code));
    EXPECT_EQ(code, 204);
    EXPECT_EQ(alice.write(kGroup, kState), 201);
    EXPECT_EQ(alice.read(kGroup).second, kState);
}

TEST_F(Publishing, MakingAFolderTwiceSucceeds) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    EXPECT_TRUE(alice.manager.createDirectoryAtAURL(alice.at(kGroup)));
    EXPECT_TRUE(alice.manager.createDirectoryAtAURL(alice.at(kGroup)));
    Client fresh(world);
    EXPECT_TRUE(fresh.manager.createDirectoryAtAURL(fresh.at(kGroup)));
}

TEST_F(Publishing, AWriteAfterAReadFailsWhenSomebodyElseWroteMeanwhile) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    ASSERT_EQ(alice.write(kGroup, kState), 201);
    Client other(world);
    ASSERT_EQ(alice.read(kGroup).first, 200);
    ASSERT_EQ(other.write(kGroup, kOther), 204);
    EXPECT_EQ(alice.write(kGroup, kState), 412) << alice.wire->text();
    EXPECT_EQ(other.read(kGroup).second, kOther);
    EXPECT_EQ(alice.write(kGroup, kState), 204) << "the condition holds for one write only";
}

TEST_F(Publishing, TwoEditsWithinASecondDoNotFailEachOther) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    for (int i = 0; i < 5; ++i) {
        alice.read(kGroup);
        EXPECT_THAT(alice.write(kGroup, Dictionary{{"n", i}}), testing::AnyOf(201, 204)) << i;
    }
}

TEST_F(Publishing, AWriteAfterTheReadOfAnAbsentFileDoesNotReplaceOneThatAppeared) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    Client other(world);
    EXPECT_EQ(alice.read(kGroup).first, 404);
    ASSERT_EQ(other.write(kGroup, kOther), 201);
    EXPECT_EQ(alice.write(kGroup, kState), 412) << alice.wire->text();
    EXPECT_EQ(other.read(kGroup).second, kOther);
}

TEST_F(Publishing, AWriteAfterAFailedReadIsNotSent) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    ASSERT_EQ(alice.write(kGroup, kState), 201);
    alice.wire->intercept([](const HttpRequest& r) -> std::optional<HttpResponse> {
        return r.method == "GET" ? std::optional(answerOf(500)) : std::nullopt;
    });
    EXPECT_EQ(alice.read(kGroup).first, 500);
    alice.wire->clear();
    EXPECT_EQ(alice.write(kGroup, kOther), 0);
    EXPECT_EQ(alice.wire->methods(), "");
    alice.wire->intercept(nullptr);
    EXPECT_EQ(alice.read(kGroup).second, kState);
}

// httpd's own race: a file that goes while it is being opened is answered with 403.
TEST_F(Publishing, AFileThatIsReplacedWhileItIsOpenedIsNotForbidden) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    const auto refuseOnce = [this] {
        alice.wire->intercept([left = std::make_shared<int>(1)](const HttpRequest& r) {
            return r.method == "GET" && (*left)-- > 0 ? std::optional(answerOf(403)) : std::nullopt;
        });
    };
    refuseOnce();
    EXPECT_EQ(alice.read("info").first, 200);

    ASSERT_EQ(alice.write(kGroup, kState), 201);
    refuseOnce();
    EXPECT_EQ(alice.read(kGroup).second, kState);
    EXPECT_EQ(alice.write(kGroup, kOther), 204) << "what was read is known";

    alice.wire->intercept(nullptr);
    ASSERT_TRUE(alice.manager.removeFileAtURL(alice.at(kGroup), nullptr));
    refuseOnce();
    EXPECT_EQ(alice.read(kGroup).first, 404) << alice.wire->text();
    EXPECT_EQ(alice.write(kGroup, kState), 201);
}

TEST_F(Publishing, RemovingWhatIsAbsentSucceedsWithTheServersCode) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    int code = 0;
    EXPECT_TRUE(alice.manager.removeFileAtURL(alice.at("People/4/A:CXPerson"), &code));
    EXPECT_EQ(code, 404);
}

TEST_F(Publishing, TheClockFilesDateIsTheServers) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    const double before = Clock::system().now().secondsSince1970();
    ASSERT_TRUE(alice.manager.write("why", alice.at("dateFile"), false));
    const auto date = alice.manager.modDateForURL(alice.at("dateFile"));
    ASSERT_TRUE(date);
    EXPECT_NEAR(date->secondsSince1970(), before, 2.0);
    EXPECT_FALSE(alice.manager.modDateForURL(alice.at("nothing")));
}

TEST_F(Publishing, AForeignTreeIsForbiddenAndSaysSo) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    Client bob(world, "bob"); // at() names alice's tree
    EXPECT_EQ(bob.write("People/4/A:CXPerson", kState), 403);
    EXPECT_EQ(bob.read("info").first, 403);
}

TEST_F(Publishing, AWrongPasswordIsToldFromAStoreThatCannotBeReached) {
    Client wrong(world, "alice", "no");
    CXDAVError error;
    EXPECT_FALSE(wrong.manager.canReach(error));
    EXPECT_EQ(error.code, kCXDAVErrorAuthentication);
    EXPECT_TRUE(alice.manager.canReach(error)) << error.reason;
    EXPECT_EQ(error.code, 0);
    world.store.stop();
    EXPECT_FALSE(alice.manager.canReach(error));
    EXPECT_EQ(error.code, kCXDAVErrorCannotConnect);
}

TEST_F(Publishing, TwentyThreadsWriteAtOnceOverFewConnections) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    std::atomic<int> good{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 20; ++t)
        threads.emplace_back([&, t] {
            for (int i = 0; i < 10; ++i)
                good +=
                    alice.write("People/" + std::to_string(t) + "/" + std::to_string(i) + ":CXPerson", kState) == 201;
        });
    for (auto& t : threads) t.join();
    EXPECT_EQ(good, 200);
}

// A pass that could not be saved has read what its database does not have.
TEST(VersionsOfFiles, AreKnownToTheNextRunWhenTheyWereSavedAndNotBecauseTheClientEnds) {
    StoreWorld world;
    Client alice(world);
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    ASSERT_EQ(alice.write("Friends", Dictionary{{"name", "Friends"}}), 201);
    const TempDirectory directory;
    const auto run = [&] {
        return std::make_unique<CXDAVManager>(world.account("alice"), alice.wire,
                                              CXDAVManager::VersionsFile{directory / "versions"});
    };
    for (const bool isSaved : {false, true}) {
        auto client = run();
        EXPECT_TRUE(client->dictionaryAtURL(alice.at("Friends"), nullptr, false));
        ASSERT_TRUE(client->remembersVersion(alice.at("Friends")));
        if (isSaved) client->saveVersionMemory("database", 1);
        client.reset();
        EXPECT_EQ(run()->remembersVersion(alice.at("Friends")), isSaved);
    }
}

} // namespace
} // namespace rolvane
