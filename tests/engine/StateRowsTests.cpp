#include "engine/memory/StateRows.h"

#include "EngineWorld.h"

#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>

namespace rolvane {
namespace {

using test::World;

Dictionary group(const std::vector<std::string>& members) {
    Array all;
    for (const std::string& member : members) all.append(member);
    return {{"memberUIDState", all}};
}

RC_GTEST_PROP(StateRows, JoinedTheyAreWhatTheyWereMadeOf, ()) {
    Dictionary data{{"subscriptionMap", Dictionary{{"S1", "http://x/"}}}};
    for (const char* conduit : {"CXDCX", "CXDVaultra", "CXDLocal"}) {
        Dictionary of = data.dictionaryFor(conduit);
        of.set("unsettledGroups", Dictionary{{"G", true}});
        const auto users = *rc::gen::container<std::vector<std::string>>(rc::gen::string<std::string>());
        for (const std::string& user : users) {
            Dictionary groups = of.dictionaryFor("priorState").dictionaryFor(user);
            for (const auto& name : *rc::gen::container<std::vector<std::string>>(rc::gen::string<std::string>()))
                groups.set(name, group({name, user}));
        }
    }
    RC_ASSERT(Value(joinedRows(stateRows(data))) == Value(data));
}

TEST(StateRows, OneAnEarlierVersionStoredWholeIsReadAndThenStoredInRows) {
    World world;
    const Dictionary old{{"CXDCX", Dictionary{{"priorState", Dictionary{{"ann", Dictionary{{"G1", group({"P"})}}}}}}}};
    world.preferences.set(kDaemonDomain, kCXDConduitData, old);
    world.preferences.synchronize(kDaemonDomain);
    EngineState state(world.preferences);
    EXPECT_EQ(Value(state.conduitData()), Value(old));
    state.syncPrefs();
    EXPECT_EQ(world.preferences.get(kDaemonDomain, "CXDConduitData/CXDCX/ann/G1"), Value(group({"P"})));
    EXPECT_EQ(Value(EngineState(world.preferences).conduitData()), Value(old));
}

// The groups' rows that lie in the database with their bytes, as they were before.
class Written {
public:
    explicit Written(World& world) : _world(world), _before(rows()) {}
    std::vector<std::string> since() {
        std::vector<std::string> changed;
        const auto now = rows();
        for (const auto& [key, value] : now)
            if (!_before.contains(key) || _before.at(key) != value) changed.push_back(key);
        for (const auto& [key, value] : _before)
            if (!now.contains(key)) changed.push_back("-" + key);
        return changed;
    }

private:
    std::map<std::string, Value> rows() {
        std::map<std::string, Value> all;
        for (const std::string& key : _world.preferences.keys(kDaemonDomain))
            if (isStateRow(key)) all.emplace(key, _world.preferences.get(kDaemonDomain, key));
        return all;
    }
    World& _world;
    std::map<std::string, Value> _before;
};

TEST(StateRows, OnlyTheGroupsThatChangedAreSet) {
    World world;
    EngineState state(world.preferences);
    Dictionary groups = state.conduitObjectForKey("CXDCX", "priorState").dictionaryFor("ann");
    groups.set("G1", group({"P1"}));
    groups.set("G2", group({"P2"}));
    groups.set("G3", group({}));
    state.syncPrefs();
    // Somebody else's value shows that a row was not written again.
    world.preferences.set(kDaemonDomain, "CXDConduitData/CXDCX/ann/G2", "left alone");
    world.preferences.synchronize(kDaemonDomain);
    Written written(world);
    groups["G1"].dictionary().arrayFor("memberUIDState").append("P9");
    groups.remove("G3");
    state.syncPrefs();
    EXPECT_EQ(written.since(),
              (std::vector<std::string>{"CXDConduitData/CXDCX/ann/G1", "-CXDConduitData/CXDCX/ann/G3"}));
}

TEST(StateRows, WhatWasPutAndDroppedIsSetAgain) {
    World world;
    EngineState state(world.preferences);
    state.conduitObjectForKey("CXDCX", "priorState").dictionaryFor("ann").set("G1", group({"P1"}));
    {
        const Preferences::Hold hold(world.preferences);
        state.putConduitData();
    }
    state.forgetPut();
    state.syncPrefs();
    EXPECT_TRUE(EngineState(world.preferences).conduitObjectForKey("CXDCX", "priorState").contains("ann"));
    EXPECT_EQ(world.preferences.get(kDaemonDomain, "CXDConduitData/CXDCX/ann/G1"), Value(group({"P1"})));
}

} // namespace
} // namespace rolvane
