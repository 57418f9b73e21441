#include "TestDatabase.h"

#include "support/CapturingLog.h"

namespace rolvane::test {
namespace {

TEST(Group, MembersKeepTheOrderInWhichTheyWereAdded) {
    TestDatabase d;
    CXGroupRef friends = d.addGroup("Friends");
    CXPersonRef a = d.addPerson("A"), b = d.addPerson("B"), c = d.addPerson("C");
    for (const auto& p : {c, a, b}) EXPECT_TRUE(friends->addMember(p));
    EXPECT_FALSE(friends->addMember(a)) << "listed already";
    EXPECT_EQ(names(friends->members()), (std::vector<std::string>{"C", "A", "B"}));
    d->save();
    EXPECT_EQ(names(friends->members()), (std::vector<std::string>{"C", "A", "B"}));
    friends->removeMember(a);
    EXPECT_EQ(names(friends->members()), (std::vector<std::string>{"C", "B"}));
    friends->addMember(a);
    d->save();
    EXPECT_EQ(names(friends->members()), (std::vector<std::string>{"C", "A", "B"})) << "taken back, so nothing moved";
    EXPECT_EQ(friends->memberCount(), 3u);
}

TEST(Group, MemberIdentifiersAreTheSharingOnes) {
    TestDatabase d;
    CXGroupRef friends = d.addGroup("Friends");
    CXPersonRef theirs = d.addSubscribedPerson("T", "http://s/bob/Contacts");
    friends->addMember(theirs);
    d->save();
    EXPECT_EQ(friends->memberUniqueIds(), (std::vector<UniqueId>{theirs->uniqueId()}));
    EXPECT_EQ(friends->memberIdentifiers(), (std::vector<UniqueId>{cxNormalizedUID(theirs->uniqueId())}));
}

TEST(Group, HasANameFromTheStartThatCannotBeTakenAway) {
    TestDatabase d;
    CXGroupRef group = CXGroup::create();
    EXPECT_EQ(group->name(), "untitled group");
    EXPECT_FALSE(group->setValue(Value(), kCXGroupNameProperty));
    d->addRecord(group);
    EXPECT_FALSE(group->removeValueForProperty(kCXGroupNameProperty));
    EXPECT_FALSE(group->setValue("", kCXGroupNameProperty));
    group->resetWithDictionary({{"Note", "x"}}, true, false);
    EXPECT_EQ(group->name(), "untitled group");
    EXPECT_FALSE(d->allGroup()->removeValueForProperty(kCXGroupNameProperty));
    EXPECT_EQ(d->allGroup()->name(), "All Contacts");
    d->save();
    EXPECT_EQ(group->name(), "untitled group");
}

TEST(Group, RefusesToContainItself) {
    TestDatabase d;
    CXGroupRef a = d.addGroup("A"), b = d.addGroup("B"), c = d.addGroup("C");
    a->addSubgroup(b);
    d->save();
    b->addSubgroup(c);
    try {
        c->addSubgroup(a);
        FAIL() << "a cycle was made";
    } catch (const CXException& e) {
        EXPECT_EQ(e.reason(), "The group \"A\" cannot become a subgroup of \"C\": it would contain itself.");
    }
    EXPECT_THROW(a->addSubgroup(a), CXException);
    EXPECT_TRUE(c->subgroups().empty());
}

TEST(Group, RefusesToContainItselfHoweverDeep) {
    constexpr size_t kLevels = 20000;
    TestDatabase d;
    std::vector<CXGroupRef> groups;
    for (size_t i = 0; i < kLevels; ++i) {
        groups.push_back(CXGroup::initWithUniqueId(UniqueId(std::to_string(kLevels + i) + ":CXGroup")));
        d->addRecord(groups.back());
        if (i > 0) groups[i - 1]->addSubgroup(groups[i]);
    }
    d->save();
    EXPECT_FALSE(groups.back()->mayListSubgroup(groups.front()));
    EXPECT_FALSE(groups.back()->mayListSubgroup(groups[kLevels / 2]));
    const CXGroupRef other = d.addGroup("Other");
    EXPECT_TRUE(groups.back()->mayListSubgroup(other));
    EXPECT_TRUE(other->mayListSubgroup(groups.front()));
}

TEST(Group, ACycleThatTwoProcessesMakeTogetherIsNotWritten) {
    TestDatabase d;
    CXGroupRef a = d.addGroup("A"), b = d.addGroup("B");
    d->save();
    auto other = d.open("rolvane");
    auto a2 = std::dynamic_pointer_cast<CXGroup>(other->recordForUniqueId(a->uniqueId()));
    auto b2 = std::dynamic_pointer_cast<CXGroup>(other->recordForUniqueId(b->uniqueId()));
    a->addSubgroup(b);
    b2->addSubgroup(a2);
    d->save();
    CapturingLog log;
    other->save();
    EXPECT_TRUE(log.mentions("left out")) << log.text();
    EXPECT_EQ(a->subgroups().size(), 1u);
    EXPECT_TRUE(b->subgroups().empty());
}

// Nested groups that are put into another order in one save, in whatever order their identifiers sort.
TEST(Group, NestedGroupsCanBeTurnedInOneSave) {
    std::vector<std::string> names{"A:CXGroup", "B:CXGroup", "C:CXGroup"};
    const auto chainOf = [](CXRolvane& database, const std::vector<std::string>& order) {
        std::vector<CXGroupRef> chain;
        for (const std::string& name : order)
            chain.push_back(std::dynamic_pointer_cast<CXGroup>(database.recordForUniqueId(UniqueId(name))));
        return chain;
    };
    const auto nest = [](const std::vector<CXGroupRef>& chain) {
        for (const CXGroupRef& group : chain)
            for (const CXGroupRef& below : group->subgroups()) group->removeSubgroup(below);
        for (size_t i = 0; i + 1 < chain.size(); ++i) chain[i]->addSubgroup(chain[i + 1]);
    };
    TestDatabase d;
    for (const std::string& name : names) d.addGroup(name, name);
    CapturingLog log;
    std::vector<std::vector<std::string>> orders;
    do {
        orders.push_back(names);
        orders.push_back({names[0], names[1]});
    } while (std::next_permutation(names.begin(), names.end()));
    for (const auto& before : orders)
        for (const auto& after : orders) {
            for (const CXGroupRef& group : chainOf(*d, names))
                for (const CXGroupRef& below : group->subgroups()) group->removeSubgroup(below);
            nest(chainOf(*d, before));
            d->save();
            for (const CXGroupRef& group : chainOf(*d, before))
                for (const CXGroupRef& below : group->subgroups()) group->removeSubgroup(below);
            nest(chainOf(*d, after));
            d->save();
            const auto chain = chainOf(*d, after);
            for (size_t i = 0; i < chain.size(); ++i) {
                std::vector<UniqueId> expected;
                if (i + 1 < after.size()) expected.emplace_back(after[i + 1]);
                EXPECT_EQ(texts(chain[i]->subgroupUniqueIds()), texts(expected)) << after[i];
            }
        }
    EXPECT_EQ(log.text(), "");
}

TEST(Group, MembersAndSubgroupsAreKeptApart) {
    TestDatabase d;
    CXGroupRef a = d.addGroup("A"), b = d.addGroup("B");
    a->addSubgroup(b);
    a->addMember(d.addPerson("P"));
    d->save();
    EXPECT_EQ(a->memberUniqueIds().size(), 1u);
    EXPECT_EQ(a->subgroupIdentifiers(), (std::vector<UniqueId>{b->uniqueId()}));
    ASSERT_EQ(b->parentGroups().size(), 1u);
    EXPECT_EQ(b->parentGroups()[0], a);
}

TEST(Group, OnlyRecordsOfOneDatabaseCanBeListed) {
    TestDatabase d, other;
    CXGroupRef friends = d.addGroup("Friends");
    EXPECT_THROW(friends->addMember(CXPerson::create()), CXException);
    EXPECT_THROW(friends->addMember(other.addPerson("X")), CXException);
    EXPECT_THROW(friends->addMember(nullptr), CXException);
    EXPECT_THROW(CXGroup::create()->addMember(d.addPerson("Y")), CXException);
    EXPECT_EQ(friends->memberCount(), 0u);
}

TEST(Group, ARemovedPersonLeavesItsGroupsAndTouchesThem) {
    TestDatabase d;
    CXGroupRef friends = d.addGroup("Friends");
    CXPersonRef a = d.addPerson("A"), b = d.addPerson("B");
    friends->addMember(a);
    friends->addMember(b);
    d->save();
    d.clock.advance(5);
    d->removeRecord(a);
    EXPECT_EQ(names(friends->members()), (std::vector<std::string>{"B"}));
    d->save();
    EXPECT_EQ(names(friends->members()), (std::vector<std::string>{"B"}));
    EXPECT_EQ(friends->valueForProperty(kCXModificationDateProperty).date(), Date(1700000005));
}

TEST(Group, ARecordRemovedAndAddedAgainIsInNoGroup) {
    TestDatabase d;
    CXGroupRef friends = d.addGroup("Friends");
    CXPersonRef a = d.addPerson("A", "P:CXPerson");
    friends->addMember(a);
    d->save();
    d->removeRecord(a);
    CXPersonRef again = d.addPerson("A2", "P:CXPerson");
    EXPECT_TRUE(friends->members().empty());
    EXPECT_TRUE(again->parentGroups().empty());
    d->save();
    EXPECT_TRUE(friends->members().empty());
    friends->addMember(again);
    d->save();
    EXPECT_EQ(names(friends->members()), (std::vector<std::string>{"A2"}));
}

TEST(Group, AllContactsHoldsEverybodyAndTakesNoListing) {
    TestDatabase d;
    CXPersonRef a = d.addPerson("A");
    CXGroupRef friends = d.addGroup("Friends"), nested = d.addGroup("Nested");
    friends->addSubgroup(nested);
    d.addSubscribedPerson("Theirs", "http://s/bob/Contacts");
    CXAllGroupRef all = d->allGroup();
    EXPECT_EQ(names(all->members()), (std::vector<std::string>{"A"}));
    d->save();
    EXPECT_EQ(names(all->members()), (std::vector<std::string>{"A"}));
    EXPECT_EQ(all->subgroups().size(), 2u) << "nested groups too";
    EXPECT_FALSE(all->removeMember(a));
    EXPECT_FALSE(all->addMember(a));
    EXPECT_EQ(all->memberCount(), 1u);
    EXPECT_EQ(all->sharingUniqueId().str(), "AllCXGroup");
    EXPECT_TRUE(a->parentGroups().empty()) << "all contacts is nobody's parent group";
}

TEST(Group, ARequestToRemoveAllContactsIsRefusedAndLogged) {
    TestDatabase d;
    d.addPerson("A");
    d->save();
    CapturingLog log;
    EXPECT_FALSE(d->removeRecord(d->allGroup()));
    EXPECT_TRUE(log.mentions("AllCXGroup")) << log.text();
    EXPECT_FALSE(d->hasUnsavedChanges());
    EXPECT_EQ(d->allGroup()->memberCount(), 1u);
}

TEST(Group, DistributionChoicesAreTheGroupsOwn) {
    TestDatabase d;
    CXGroupRef friends = d.addGroup("Friends"), work = d.addGroup("Work");
    CXPersonRef a = d.addPerson("A"), b = d.addPerson("B");
    CXMutableMultiValue mails;
    std::string first = mails.addValue("a@b", kCXHomeLabel);
    std::string second = mails.addValue("c@d", kCXWorkLabel);
    a->setValue(mails, kCXEmailProperty);
    for (const auto& p : {a, b}) friends->addMember(p);
    work->addMember(a);
    friends->setDistributionIdentifier(first, kCXEmailProperty, a);
    work->setDistributionIdentifier(second, kCXEmailProperty, a);
    friends->setDistributionIdentifier("x", kCXPhoneProperty, b); // B has no phone
    auto check = [&] {
        EXPECT_EQ(friends->distributionIdentifierForProperty(kCXEmailProperty, a), first);
        EXPECT_EQ(work->distributionIdentifierForProperty(kCXEmailProperty, a), second);
        EXPECT_EQ(friends->distributionIdentifierForProperty(kCXEmailProperty, b), std::nullopt);
        EXPECT_EQ(friends->distributionChoices(),
                  (std::map<UniqueId, CXDistributionChoices>{{a->uniqueId(), {{kCXEmailProperty, first}}}}));
        EXPECT_EQ(CXGroup::distributionChoicesForPerson(*a),
                  (std::map<UniqueId, CXDistributionChoices>{{friends->uniqueId(), {{kCXEmailProperty, first}}},
                                                             {work->uniqueId(), {{kCXEmailProperty, second}}}}));
    };
    check();
    d->save();
    check();
    friends->setDistributionIdentifier(std::nullopt, kCXEmailProperty, a);
    d->save();
    EXPECT_EQ(friends->distributionIdentifierForProperty(kCXEmailProperty, a), std::nullopt);
}

TEST(Group, AMemberThatLeavesTakesItsChoicesAlong) {
    TestDatabase d;
    CXGroupRef friends = d.addGroup("Friends");
    CXPersonRef a = d.addPerson("A");
    a->setValue(CXMultiValue(), kCXEmailProperty);
    friends->addMember(a);
    friends->setDistributionIdentifier("id", kCXEmailProperty, a);
    d->save();
    friends->removeMember(a);
    EXPECT_EQ(friends->distributionIdentifierForProperty(kCXEmailProperty, a), std::nullopt);
    friends->addMember(a);
    EXPECT_TRUE(friends->distributionChoices().empty());
    d->save();
    EXPECT_TRUE(friends->distributionChoices().empty());
}

TEST(Group, AChoiceMadeBeforeThePersonIsAMemberIsKept) {
    TestDatabase d;
    CXGroupRef friends = d.addGroup("Friends");
    CXPersonRef a = d.addPerson("A");
    a->setValue(CXMultiValue(), kCXEmailProperty);
    friends->setDistributionIdentifier("id", kCXEmailProperty, a);
    d->save();
    EXPECT_TRUE(friends->distributionChoices().empty()) << "not a member yet";
    friends->addMember(a);
    EXPECT_EQ(friends->distributionChoices().size(), 1u);
    d->save();
    EXPECT_EQ(friends->distributionChoices().size(), 1u);
}

TEST(Group, ParentGroupsAreInOrderOfAge) {
    TestDatabase d;
    CXGroupRef older = d.addGroup("Older");
    d->save();
    CXGroupRef newer = d.addGroup("Newer");
    CXPersonRef a = d.addPerson("A");
    newer->addMember(a);
    older->addMember(a);
    std::vector<UniqueId> expected{older->uniqueId(), newer->uniqueId()};
    EXPECT_EQ(a->parentGroupUniqueIds(), expected);
    d->save();
    EXPECT_EQ(a->parentGroupUniqueIds(), expected);
}

} // namespace
} // namespace rolvane::test
