// What every source of contacts keeps to, whatever it is; and, by name, what each does otherwise.

#include "ConduitSources.h"
#include "TestRecord.h"

#include <gtest/gtest.h>

using namespace rolvane;
using namespace rolvane::test;

namespace {

using Members = std::set<std::string>;

constexpr const char* kPerson = "11111111-AAAA-4AAA-8AAA-000000000001:CXPerson";
constexpr const char* kOther = "11111111-AAAA-4AAA-8AAA-000000000002:CXPerson";
constexpr const char* kGroup = "22222222-BBBB-4BBB-8BBB-000000000001:CXGroup";
constexpr const char* kSubgroup = "22222222-BBBB-4BBB-8BBB-000000000002:CXGroup";

class Contract : public testing::TestWithParam<SourceKind> {
protected:
    static void TearDownTestSuite() { endSharedStore(); }

    void SetUp() override {
        source = GetParam().make();
        conduit = source->makeConduit();
        conduit->open();
        source->engine.takeCalls();
        before = source->contents();
    }
    static CXDChangeRecordPtr record(int type, const char* person, const char* group, Value payload = {}) {
        return testRecord(CXDSyncSourcePending, type, person, group, std::move(payload));
    }
    bool apply(int type, const char* person, const char* group, Value payload = {}) {
        bool denied = false;
        const bool done = conduit->applyChangeRecordIfNeeded(record(type, person, group, std::move(payload)), &denied);
        EXPECT_FALSE(denied) << "nothing is denied here";
        return done;
    }
    bool deviates(Deviation what) const { return source->deviates(what); }
    static Dictionary card(const char* name) { return {{kCXFirstNameProperty, name}}; }
    bool makeGroup(const char* uid = kGroup, const char* name = "Friends") {
        return apply(CXDCreateStructureForGroup, nullptr, uid, Dictionary{{kCXGroupNameProperty, name}});
    }
    std::string groupName() {
        const auto info = source->groupInfo(kGroup);
        return info ? (*info)[kCXGroupNameProperty].string() : "(no group)";
    }

    std::unique_ptr<Source> source;
    std::unique_ptr<CXDConduit> conduit;
    std::map<std::string, std::string> before;
};

INSTANTIATE_TEST_SUITE_P(Conduit, Contract, testing::ValuesIn(everySource()),
                         [](const auto& parameter) { return std::string(parameter.param.name); });

} // namespace

// -- who it is

TEST(Sources, AreToldApartByTheirNamesAndBits) {
    std::set<std::string> names;
    int32_t bits = 0;
    for (const SourceKind& kind : everySource()) {
        const auto source = kind.make();
        const auto conduit = source->makeConduit();
        ASSERT_TRUE(conduit->conduitID()) << kind.name;
        EXPECT_TRUE(names.insert(*conduit->conduitID()).second) << kind.name;
        const int32_t bit = conduit->conduitSource();
        EXPECT_TRUE(bit != 0 && (bit & (bit - 1)) == 0) << kind.name << ": one bit, not " << bit;
        EXPECT_EQ(bits & bit, 0) << kind.name;
        bits |= bit;
    }
    endSharedStore();
}

TEST_P(Contract, TheOwnerHasANameThereAndOthersKeepTheirs) {
    const auto owner = conduit->realUserFromUser(kSelf);
    EXPECT_EQ(owner == kSelf, deviates(Deviation::CallsTheOwnerByTheMarker));
    EXPECT_EQ(conduit->realUserFromUser(owner), owner) << "a real name is its own";
    EXPECT_EQ(conduit->realUserFromUser(UserName("bob")), UserName("bob"));
    EXPECT_EQ(conduit->realUserFromUser(std::nullopt), std::nullopt);
}

TEST_P(Contract, ABaseLocationLeadsBackToItsUser) {
    const auto usual = source->makeUsualConduit();
    for (const UserName& user : {kSelf, UserName("bob"), UserName("jean luc")}) {
        const auto base = usual->baseLocationForUser(usual->realUserFromUser(user));
        EXPECT_EQ(!base, deviates(Deviation::HasNoLocations));
        if (!base) continue;
        EXPECT_EQ(source->engine.userForRemoteLocation(RemoteLocation(base->absoluteString())), user);
        EXPECT_EQ(usual->baseLocationForRemoteLocation(base->cxURLByAppendingComponent("below")), base);
    }
    EXPECT_EQ(usual->baseLocationForUser(std::nullopt), std::nullopt);
}

// -- contacts

TEST_P(Contract, AnUpdateIsThereAfterwards) {
    EXPECT_TRUE(apply(CXDUpdateRecord, kPerson, nullptr, card("Ada")));
    EXPECT_EQ(source->contact(kPerson).value_or(Dictionary()), card("Ada"));
    EXPECT_FALSE(source->contact(kOther));
}

TEST_P(Contract, AnUpdateTakesTheFormersPlaceWhole) {
    Dictionary longer = card("Ada Augusta");
    longer.set(kCXLastNameProperty, "Lovelace");
    apply(CXDUpdateRecord, kPerson, nullptr, longer);
    EXPECT_TRUE(apply(CXDUpdateRecord, kPerson, nullptr, card("Bo")));
    EXPECT_EQ(source->contact(kPerson).value_or(Dictionary()), card("Bo"));
}

TEST_P(Contract, AContactIsReadWhereItsLocationSays) {
    apply(CXDUpdateRecord, kPerson, nullptr, card("Ada"));
    const auto location = conduit->locationForUID(UniqueId(kPerson), kSelf);
    EXPECT_EQ(!location, deviates(Deviation::HasNoLocations));
    if (!location) return;
    const auto read = conduit->defaultManager()->dictionaryAtURL(*location, nullptr, false);
    EXPECT_EQ(!read, deviates(Deviation::WritesContactsBesideTheirURL));
    EXPECT_EQ(read.value_or(card("Ada")), card("Ada"));
}

TEST_P(Contract, ADeletedContactIsGone) {
    apply(CXDUpdateRecord, kPerson, nullptr, card("Ada"));
    apply(CXDUpdateRecord, kOther, nullptr, card("Bo"));
    for (int time = 0; time < 2; ++time) {
        EXPECT_EQ(apply(CXDDeleteRecord, kPerson, nullptr), !deviates(Deviation::KeepsDeletedContacts)) << time;
        EXPECT_EQ(source->contact(kPerson).has_value(), deviates(Deviation::KeepsDeletedContacts)) << time;
    }
    EXPECT_TRUE(source->contact(kOther));
}

// -- groups

TEST_P(Contract, AGroupIsMadeWithItsName) {
    EXPECT_TRUE(makeGroup());
    EXPECT_EQ(groupName(), "Friends");
    EXPECT_FALSE(source->groupInfo(kSubgroup));
}

TEST_P(Contract, ARenamedGroupHasTheNewNameAndItsOtherInfo) {
    apply(CXDCreateStructureForGroup, nullptr, kGroup,
          Dictionary{{kCXGroupNameProperty, "Friends"}, {kCXNoteProperty, "old ones"}});
    EXPECT_TRUE(apply(CXDChangeGroupName, nullptr, kGroup, "Foes"));
    EXPECT_EQ(groupName(), "Foes");
    const auto other = source->groupInfo(kGroup).value_or(Dictionary())[kCXNoteProperty];
    EXPECT_EQ(other.isAbsent(),
              deviates(Deviation::ForgetsOtherInfoOnRename) || deviates(Deviation::TakesOnlyTheNameOfANewGroup));
}

TEST_P(Contract, AMemberComesOnceAndLeaves) {
    for (const char* person : {kPerson, kOther}) apply(CXDUpdateRecord, person, nullptr, card("Ada"));
    makeGroup();
    for (const char* person : {kPerson, kOther, kPerson}) EXPECT_TRUE(apply(CXDAddRecordToGroup, person, kGroup));
    EXPECT_EQ(source->members(kGroup), (Members{kPerson, kOther}));
    for (int time = 0; time < 2; ++time) EXPECT_TRUE(apply(CXDRemoveRecordFromGroup, kPerson, kGroup)) << time;
    EXPECT_EQ(source->members(kGroup),
              deviates(Deviation::KeepsMemberMarkers) ? (Members{kPerson, kOther}) : Members{kOther});
    EXPECT_TRUE(source->contact(kPerson)) << "who leaves a group stays a contact";
}

TEST_P(Contract, ACompositeChangeAddsThenRemoves) {
    makeGroup();
    const bool keys = deviates(Deviation::KeepsMembersAsKeys), none = deviates(Deviation::HasNoCompositeChange);
    const char* adds = keys ? "adds" : kMemberAdds;
    const char* removes = keys ? "removes" : kMemberRemoves;
    EXPECT_EQ(apply(CXDCompositeGroupChange, nullptr, kGroup, Dictionary{{adds, Array{kPerson, kOther, kPerson}}}),
              !none);
    EXPECT_EQ(source->compositeMembers(kGroup), none ? Members{} : (Members{kPerson, kOther}));
    EXPECT_EQ(
        apply(CXDCompositeGroupChange, nullptr, kGroup, Dictionary{{adds, Array{kPerson}}, {removes, Array{kPerson}}}),
        !none);
    EXPECT_EQ(source->compositeMembers(kGroup), none ? Members{} : Members{kOther});
    if (!keys) return;
    apply(CXDCompositeGroupChange, nullptr, kGroup, Dictionary{{kMemberAdds, Array{kPerson}}});
    EXPECT_EQ(source->compositeMembers(kGroup), Members{kOther}) << "the other sources' keys say nothing here";
}

TEST_P(Contract, AGroupsStateAndItsStructureLiveSideBySideInEitherOrder) {
    if (deviates(Deviation::HasNoCompositeChange)) {
        EXPECT_FALSE(apply(CXDCompositeGroupChange, nullptr, kGroup, Dictionary{{kMemberAdds, Array{kPerson}}}));
        EXPECT_TRUE(makeGroup());
        EXPECT_FALSE(apply(CXDCompositeGroupChange, nullptr, kGroup, Dictionary{{kMemberAdds, Array{kPerson}}}));
        EXPECT_EQ(groupName(), "Friends");
        return;
    }
    const char* adds = deviates(Deviation::KeepsMembersAsKeys) ? "adds" : kMemberAdds;
    for (const char* first : {"state", "structure"}) {
        const bool stateFirst = std::string(first) == "state";
        apply(CXDUpdateRecord, kOther, nullptr, card("Bo")); // the user's directory is there
        if (!stateFirst) makeGroup();
        EXPECT_TRUE(apply(CXDCompositeGroupChange, nullptr, kGroup, Dictionary{{adds, Array{kPerson}}})) << first;
        if (stateFirst) makeGroup();
        EXPECT_EQ(source->compositeMembers(kGroup), Members{kPerson}) << first;
        EXPECT_EQ(groupName(), "Friends") << first;
        EXPECT_TRUE(apply(CXDDeleteGroup, nullptr, kGroup)) << first;
    }
}

TEST_P(Contract, ADeletedGroupIsGoneAndItsMembersStayContacts) {
    apply(CXDUpdateRecord, kPerson, nullptr, card("Ada"));
    makeGroup();
    apply(CXDAddRecordToGroup, kPerson, kGroup);
    for (int time = 0; time < 2; ++time) EXPECT_TRUE(apply(CXDDeleteGroup, nullptr, kGroup)) << time;
    EXPECT_FALSE(source->groupInfo(kGroup));
    EXPECT_TRUE(source->contact(kPerson));
}

TEST_P(Contract, SubgroupsAndChosenValuesAreTaken) {
    Dictionary contact = card("Ada");
    CXMutableMultiValue mails;
    const std::string chosen = mails.addValue("ada@example.org", kCXHomeLabel);
    contact.set(kCXEmailProperty, mails.toValue());
    apply(CXDUpdateRecord, kPerson, nullptr, contact);
    makeGroup();
    makeGroup(kSubgroup, "Close ones");
    apply(CXDAddRecordToGroup, kPerson, kGroup);
    const bool taken = !deviates(Deviation::KnowsNoSubgroups);
    const auto changes = [&](int type, const char* person, Value payload = {}) {
        const auto former = source->contents();
        EXPECT_EQ(apply(type, person, kGroup, std::move(payload)), taken) << type;
        return source->contents() != former;
    };
    EXPECT_EQ(changes(CXDAddGroupToGroup, kSubgroup), taken);
    EXPECT_EQ(changes(CXDUpdateDistributionList, kPerson, Dictionary{{kCXEmailProperty, chosen}}), taken);
    EXPECT_EQ(changes(CXDRemoveGroupFromGroup, kSubgroup), taken);
}

// -- every source's frame

TEST_P(Contract, ApplyingAgainChangesNothing) {
    const bool keys = deviates(Deviation::KeepsMembersAsKeys);
    const std::vector<CXDChangeRecordPtr> records = {
        record(CXDUpdateRecord, kPerson, nullptr, card("Ada")),
        record(CXDCreateStructureForGroup, nullptr, kGroup, Dictionary{{kCXGroupNameProperty, "Friends"}}),
        record(CXDChangeGroupName, nullptr, kGroup, "Foes"),
        record(CXDAddRecordToGroup, kPerson, kGroup),
        record(CXDCompositeGroupChange, nullptr, kGroup, Dictionary{{keys ? "adds" : kMemberAdds, Array{kPerson}}}),
        record(CXDRemoveRecordFromGroup, kPerson, kGroup),
        record(CXDDeleteRecord, kPerson, nullptr),
        record(CXDDeleteGroup, nullptr, kGroup)};
    for (const CXDChangeRecordPtr& each : records) {
        const bool once = conduit->applyChangeRecordIfNeeded(each);
        const auto after = source->contents();
        EXPECT_EQ(conduit->applyChangeRecordIfNeeded(each), once) << each->description();
        EXPECT_EQ(source->contents(), after) << each->description();
    }
}

TEST_P(Contract, TypesThatNobodyKnowsFailAndChangeNothing) {
    for (const int type : {0, 10, 256, 262, -1, 257}) {
        EXPECT_FALSE(apply(type, kPerson, kGroup, Dictionary())) << type;
        EXPECT_EQ(source->contents(), before) << type;
    }
}

TEST_P(Contract, AccessListChangesSucceedAndTouchNoContent) {
    const Dictionary differences{{kAdditions, Array{"bob"}}, {kDeletions, Array{"carl"}}};
    EXPECT_TRUE(apply(CXDChangeGroupReadACL, nullptr, "AllCXGroup", differences));
    EXPECT_TRUE(apply(CXDChangeGroupReadWriteACL, nullptr, "AllCXGroup", differences));
    EXPECT_EQ(source->contents(), before);
    EXPECT_TRUE(conduit->saveACLs());
}

TEST_P(Contract, ARecordOfARevokedLocationIsDoneAndNotApplied) {
    const auto base = conduit->baseLocationForUser(kSelf);
    EXPECT_EQ(!base, deviates(Deviation::HasNoLocations));
    source->engine.revoked = {RemoteLocation(base ? base->absoluteString() : "http://any.example/alice/Contacts")};
    EXPECT_TRUE(apply(CXDUpdateRecord, kPerson, nullptr, card("Ada")));
    EXPECT_EQ(source->contact(kPerson).has_value(), deviates(Deviation::HasNoLocations));
}

TEST_P(Contract, ACancelledRecordIsDoneAndNotApplied) {
    source->engine.canceledUser = kSelf;
    EXPECT_TRUE(apply(CXDUpdateRecord, kPerson, nullptr, card("Ada")));
    EXPECT_EQ(source->contents(), before);
}

TEST_P(Contract, NamesOfTheTreesOwnFilesAndWaysOutOfItTouchNothing) {
    if (deviates(Deviation::TakesAnyName)) {
        EXPECT_TRUE(apply(CXDUpdateRecord, "../info:CXPerson", nullptr, card("Ada")));
        EXPECT_TRUE(source->contact("../info:CXPerson"));
        return;
    }
    for (const char* name : {"info", "dateFile", "Contacts", "People", ".", "..", "", ".state", "../../alice"})
        for (const int type : {1, 2, 3, 4, 5, 258, 260, 261}) {
            EXPECT_EQ(apply(type, name, name, Dictionary{{kCXGroupNameProperty, "x"}}),
                      deviates(Deviation::RefusesTheTreesNamesForGood))
                << name << " " << type;
            EXPECT_EQ(source->contents(), before) << name << " " << type;
        }
}

TEST_P(Contract, TheDateOfThePassIsKeptForTheNextRun) {
    EXPECT_EQ(conduit->lastSyncDate(), Date::distantPast()) << "never before";
    conduit->close();
    const auto date = conduit->lastSyncDate();
    ASSERT_TRUE(date);
    EXPECT_GT(*date, Date::distantPast());
    conduit = source->makeConduit();
    conduit->open();
    EXPECT_EQ(conduit->lastSyncDate(), date);
}

TEST_P(Contract, ClosingForgetsTheUsersOfRevokedLocationsAndNobodyElse) {
    Dictionary prior = source->engine.conduitObjectForKey(*conduit->conduitID(), kPriorState);
    for (const char* user : {"bob", "eve"}) prior.set(user, Dictionary());
    source->engine.revoked = {RemoteLocation("http://store.example/bob/Contacts")};
    conduit->close();
    EXPECT_EQ(source->engine.conduitObjectForKey(*conduit->conduitID(), kPriorState).allKeys(), Texts{"eve"});
}

TEST_P(Contract, WhatNobodyPublishesOrSubscribesToGivesNoRecords) {
    for (int pass = 0; pass < 2; ++pass) {
        EXPECT_EQ(lines(conduit->changeRecords()), Texts{}) << pass;
        conduit->close();
        conduit->open();
    }
    EXPECT_EQ(source->contents(), before);
}
