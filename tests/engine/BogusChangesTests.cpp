// A store that says what nobody but the owner may write, where nobody else has the right to write.

#include "TwoUsers.h"
#include "model/PayloadKeys.h"

namespace rolvane::test {

class BogusChanges : public TwoUsers {
protected:
    BogusChanges() {
        for (const char* list : {kCXReadSharingACLProperty, kCXReadWriteSharingACLProperty})
            alice.application->allGroup()->removeValueForProperty(list);
        alice.application->save();
        alice.start(); // the list of writers is looked at once
        settle();
    }
    void settle() {
        for (int i = 0; i < 3; ++i) alice.pass();
    }
    std::filesystem::path stateOf(const CXGroupRef& group) {
        const std::filesystem::path file = world->file(group->uniqueId().str());
        return std::filesystem::is_directory(file) ? file / CXDAVManager::kStateName : file;
    }
    std::set<std::string> membersOnTheStore(const CXGroupRef& group) {
        std::set<std::string> members;
        for (const Value& member : contentOf(stateOf(group))[kMemberUIDState].array()) members.insert(member.string());
        return members;
    }
    void putOnTheStore(const CXGroupRef& group, const std::vector<UniqueId>& members) {
        Dictionary state = contentOf(stateOf(group)).mutableCopy();
        Array listed;
        for (const UniqueId& member : members) listed.append(member.str());
        state.set(kMemberUIDState, listed);
        rewrite(stateOf(group), PropertyList::toXML(state));
    }
    // The list of everybody names the group from now on.
    void list(const std::string& group) {
        const std::filesystem::path place = world->file(std::string(kCXAllGroupUID));
        const std::filesystem::path file =
            std::filesystem::is_directory(place) ? place / CXDAVManager::kStateName : place;
        Dictionary everybody = contentOf(file).mutableCopy();
        Array groups = everybody[kSubgroupUIDState].array().mutableCopy();
        groups.append(group);
        everybody.set(kSubgroupUIDState, groups);
        rewrite(file, PropertyList::toXML(everybody));
    }
    void letBobWrite() {
        CXMutableMultiValue writers;
        writers.addValue("bob", "bob");
        for (const char* each : {kCXReadSharingACLProperty, kCXReadWriteSharingACLProperty})
            alice.application->allGroup()->setValue(writers, each);
        alice.application->save();
        alice.start();
    }
};

TEST_F(BogusChanges, ADeletionIsNotGivenUpForAnotherVersionOnTheStore) {
    writeElsewhere(people[1], "Mallory");
    alice.application->removeRecord(people[1]);
    alice.application->save();
    settle();
    EXPECT_FALSE(std::filesystem::exists(fileOf(people[1]))) << log.text();
    EXPECT_EQ(alice.countPeople(), 2u);
}

TEST_F(BogusChanges, AGroupIsDeletedThoughTheStoreSaysSomethingElseOfIt) {
    putOnTheStore(friends, {people[1]->uniqueId()});
    alice.application->removeRecord(friends);
    alice.application->save();
    settle();
    EXPECT_FALSE(std::filesystem::exists(world->file(friends->uniqueId().str()))) << log.text();
}

TEST_F(BogusChanges, AGroupOnTheStoreBecomesWhatTheOwnerHas) {
    const std::set<std::string> before = membersOnTheStore(friends);
    ASSERT_EQ(before, (std::set{people[0]->uniqueId().str(), people[2]->uniqueId().str()}));
    putOnTheStore(friends, {people[0]->uniqueId(), people[1]->uniqueId()});
    settle();
    EXPECT_EQ(membersOnTheStore(friends), before) << log.text();
    EXPECT_EQ(friends->memberUniqueIds().size(), 2u);
    expectQuietPass(alice);
}

TEST_F(BogusChanges, ANameWithoutAContactLeavesTheGroupOnTheStore) {
    const std::set<std::string> before = membersOnTheStore(friends);
    putOnTheStore(friends, {people[0]->uniqueId(), people[2]->uniqueId(),
                            UniqueId("6AD1F1B4-2D0C-4F9B-8E63-0A8B5C1D2E3F:CXPerson")});
    settle();
    EXPECT_EQ(membersOnTheStore(friends), before) << log.text();
    expectQuietPass(alice);
}

TEST_F(BogusChanges, WhatTheDatabaseDoesNotHaveIsLeftWhereItIs) {
    const CXGroupRef strange = CXGroup::create();
    rewrite(world->file(strange->uniqueId().str()),
            PropertyList::toXML(Dictionary{{kCXGroupNameProperty, "Strange"}, {kMemberUIDState, Array()}}));
    settle();
    EXPECT_TRUE(std::filesystem::exists(world->file(strange->uniqueId().str()))) << log.text();
    EXPECT_EQ(alice.application->recordForUniqueId(strange->uniqueId()), nullptr);
}

TEST_F(BogusChanges, AGroupThatWasLeftWhereItIsComesWhenSomebodyMayWrite) {
    const CXGroupRef strange = CXGroup::create();
    const std::string name = strange->uniqueId().str();
    rewrite(world->file(name), PropertyList::toXML(Dictionary{{kCXGroupNameProperty, "Strange"},
                                                              {kMemberUIDState, Array{people[0]->uniqueId().str()}}}));
    list(name);
    settle();
    ASSERT_EQ(alice.application->recordForUniqueId(strange->uniqueId()), nullptr);
    letBobWrite();
    settle();
    const auto come = std::dynamic_pointer_cast<CXGroup>(alice.application->recordForUniqueId(strange->uniqueId()));
    ASSERT_TRUE(come) << log.text();
    EXPECT_EQ(come->name(), "Strange");
    EXPECT_EQ(come->memberUniqueIds(), std::vector{people[0]->uniqueId()});
}

// Its writer was interrupted between the members and the name.
TEST_F(BogusChanges, AGroupThatComesBeforeItsNameGetsTheNameWhenThatComes) {
    letBobWrite();
    settle();
    const CXGroupRef half = CXGroup::create();
    const std::string name = half->uniqueId().str();
    Dictionary content{{kMemberUIDState, Array{people[0]->uniqueId().str()}}};
    rewrite(world->file(name), PropertyList::toXML(content));
    list(name);
    settle();
    const auto come = std::dynamic_pointer_cast<CXGroup>(alice.application->recordForUniqueId(half->uniqueId()));
    ASSERT_TRUE(come) << log.text();
    EXPECT_EQ(come->name(), "untitled group");
    const std::filesystem::path file = stateOf(come);
    EXPECT_FALSE(contentOf(file).contains(kCXGroupNameProperty)) << "nobody has given it one\n" << log.text();
    content = contentOf(file).mutableCopy();
    content.set(kCXGroupNameProperty, "Choir");
    rewrite(file, PropertyList::toXML(content));
    settle();
    EXPECT_EQ(come->name(), "Choir") << log.text();
    EXPECT_EQ(contentOf(file)[kCXGroupNameProperty], Value("Choir"));
}

} // namespace rolvane::test
