#include "conduits/local/CXDLocalConduit.h"

#include "EngineWorld.h"

#include <filesystem>
#include <gtest/gtest.h>

using namespace rolvane;
using namespace rolvane::test;
namespace fs = std::filesystem;

namespace {

using Strings = std::vector<std::string>;

// An engine with real lock files, and the conduit of a folder that it shares with another user's engine.
class SharedFolder : public testing::Test {
protected:
    SharedFolder() {
        fs::create_directory(folder);
        world.start();
        conduit = conduitFor(world, "annlogin");
    }
    std::unique_ptr<CXDLocalConduit> conduitFor(World& whose, const char* login) {
        EngineCollaborators parts = whose.collaborators();
        parts.makeLock = [&whose](const Url& url) { return makeFileLock(url, whose.clock); };
        whose.engine = std::make_unique<CXDSyncEngine>(parts);
        return std::make_unique<CXDLocalConduit>(
            *whose.engine,
            CXDLocalConduit::Collaborators{*whose.rolvane, whose.preferences, whose.clock, UserName(login), folder});
    }
    bool isEmpty() const { return fs::is_empty(folder); }

    TempDirectory directory;
    const std::string folder = directory / "shared";
    World world;
    std::unique_ptr<CXDLocalConduit> conduit;
};

} // namespace

TEST_F(SharedFolder, APassLeavesItsRecordsPendingAndWritesNothingThere) {
    for (int pass = 0; pass < 3; ++pass) {
        world.engine->applyChangeRecords(pass == 0 ? CXDChangeRecords{update("P1", 2), update("P2", 6)}
                                                   : CXDChangeRecords{});
        Strings pending = world.pending();
        std::sort(pending.begin(), pending.end());
        EXPECT_EQ(pending, (Strings{"P1:2", "P2:2"})) << pass;
        EXPECT_EQ(world.vaultra->applied(), Strings{"P2"}) << pass;
    }
    EXPECT_TRUE(isEmpty());
    EXPECT_EQ(world.engine->conduitForSyncSource(CXDSyncSourceLocal), nullptr);
}

// Nothing would ever end the waiting.
TEST_F(SharedFolder, WhatWaitsForItHoldsNothingBackThatComesFromTheStore) {
    const auto fromStore = [](CXDChangeType type, const char* person, const char* group) {
        return makeRecord(type, person, group, {CXDSyncSourceVaultra, CXDSyncSourceCX, "<self>"},
                          type == CXDUpdateRecord ? Value(Dictionary{{"First", "theirs"}}) : Value());
    };
    const auto ours = [](CXDChangeType type, const char* person, const char* group, int32_t sources) {
        return makeRecord(type, person, group, {CXDSyncSourceCX, sources, "<self>"},
                          type == CXDUpdateRecord ? Value(Dictionary{{"First", "ours"}}) : Value());
    };
    // P1 and P2 have been written to the store, and P3 and G1 are gone from it.
    world.engine->applyChangeRecords(
        {ours(CXDUpdateRecord, "P1:CXPerson", nullptr, 6), ours(CXDUpdateRecord, "P2:CXPerson", nullptr, 2),
         ours(CXDDeleteRecord, "P3:CXPerson", nullptr, 6), ours(CXDDeleteGroup, nullptr, "G1:CXGroup", 6)});
    const Strings waiting = world.pending();
    ASSERT_EQ(waiting.size(), 4u);
    for (int pass = 0; pass < 2; ++pass) {
        const CXDChangeRecords news{fromStore(CXDUpdateRecord, "P1:CXPerson", nullptr),
                                    fromStore(CXDUpdateRecord, "P2:CXPerson", nullptr),
                                    fromStore(CXDUpdateRecord, "P3:CXPerson", nullptr),
                                    fromStore(CXDAddRecordToGroup, "P3:CXPerson", "G1:CXGroup")};
        std::multiset<std::string> expected = world.cx->appliedWithTypes();
        for (const CXDChangeRecordPtr& record : news)
            expected.insert(record->person()->str() + " " + std::to_string(record->type()));
        world.engine->applyChangeRecords(news);
        EXPECT_EQ(world.cx->appliedWithTypes(), expected);
        EXPECT_EQ(world.pending().size(), waiting.size());
    }
}

// The conduit itself is whole: whoever hands it the pending records has them done.
TEST_F(SharedFolder, WhatStaysPendingCanBeAppliedByTheConduit) {
    world.engine->applyChangeRecords({update("P1", 2)});
    conduit->open();
    for (const CXDChangeRecordPtr& record : world.engine->getPendingChanges())
        EXPECT_TRUE(conduit->applyChangeRecordIfNeeded(record));
    conduit->close();
    EXPECT_TRUE(fs::exists(folder + "/annlogin/People/P1"));
}

TEST_F(SharedFolder, IsLockedFromOpeningUntilTheEngineLetsGo) {
    conduit->open();
    EXPECT_TRUE(fs::exists(conduit->lockPath()));

    World others;
    const auto another = conduitFor(others, "boblogin");
    EXPECT_FALSE(others.engine->lockURL(Url::fileURL(another->lockPath())));
    another->open();
    EXPECT_TRUE(another->lastSyncDate()) << "it opens without the lock";

    others.engine->unlockAllURLs();
    EXPECT_TRUE(fs::exists(conduit->lockPath())) << "nobody lets go of another's lock";
    conduit->close();
    world.engine->unlockAllURLs();
    EXPECT_TRUE(isEmpty());
    EXPECT_TRUE(others.engine->lockURL(Url::fileURL(another->lockPath())));
    others.engine->unlockAllURLs();
}

TEST_F(SharedFolder, IsLockedOnceForAllItsLocations) {
    conduit->open();
    conduit->open();
    EXPECT_TRUE(world.engine->lockURL(Url::fileURL(conduit->lockPath())));
    EXPECT_EQ(std::distance(fs::directory_iterator(folder), fs::directory_iterator()), 1);
    world.engine->unlockAllURLs();
}
