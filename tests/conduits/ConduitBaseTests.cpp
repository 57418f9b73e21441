#include "conduits/CXDConduit.h"

#include "FakeEngine.h"
#include "contacts/records/CXMultiValue.h"
#include "contacts/records/Constants.h"
#include "foundation/CXException.h"
#include "foundation/PropertyList.h"
#include "support/CapturingLog.h"

#include <gtest/gtest.h>
#include <stdexcept>

using namespace rolvane;
using namespace rolvane::test;

namespace {

// A source of its own: its data lives at http://store/<user>/Contacts, and it applies as it is told.
class TestConduit : public CXDConduit {
public:
    using CXDConduit::CXDConduit;
    std::optional<std::string> conduitID() const override { return "test"; }
    std::optional<UserName> realUserFromUser(const std::optional<UserName>& user) const override {
        return user == kSelf ? UserName("ada") : user;
    }
    std::optional<Url> baseLocationForUser(const std::optional<UserName>& user) const override {
        if (!user) return std::nullopt;
        return Url("http://store/" + Url::percentEncodeComponent(user->str()) + "/Contacts");
    }
    using CXDConduit::applyChangeRecord;
    bool applyChangeRecord(const CXDChangeRecordPtr&, bool* denied) override {
        ++applications;
        if (apply) return apply(denied);
        return true;
    }
    void keep(const Url& location, std::shared_ptr<CXACLManager> manager) {
        CXDConduit::ACLManagerForRemoteLocation(location);
        _ACLManagerMap->emplace(location.absoluteString(), std::move(manager));
    }
    bool hasMap() const { return _ACLManagerMap.has_value(); }

    std::function<bool(bool*)> apply;
    int applications = 0;
};

class ConduitBase : public testing::Test {
protected:
    CXDChangeRecordPtr record(const char* user = "bob") {
        return std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDUpdateRecord, UserName(user),
                                                 UniqueId("P:CXPerson"), std::nullopt);
    }
    FakeEngine engine;
    TestConduit conduit{engine};
    CXDConduit bare{engine};
    CapturingLog log;
};

} // namespace

TEST_F(ConduitBase, GivesNothingForWhatASourceHasToOverride) {
    EXPECT_EQ(bare.conduitID(), std::nullopt);
    EXPECT_EQ(bare.realUserFromUser(kSelf), kSelf);
    EXPECT_EQ(bare.realUserFromUser(std::nullopt), std::nullopt);
    EXPECT_EQ(bare.conduitSource(), 0);
    EXPECT_EQ(bare.defaultManager(), nullptr);
    EXPECT_EQ(bare.baseLocationForUser(kSelf), std::nullopt);
    EXPECT_FALSE(bare.applyChangeRecord(record()));
    EXPECT_FALSE(bare.applyChangeRecordIfNeeded(record()));
    EXPECT_TRUE(bare.changeRecords().empty());
    EXPECT_EQ(&bare.engine(), &engine);
    bare.open();
    bare.close();
    EXPECT_TRUE(engine.data.empty()) << "a conduit without identifier has no data";
}

TEST_F(ConduitBase, KnowsTheBookkeepingFilesByTheirExactNames) {
    EXPECT_TRUE(conduit.isASpecialFile("info"));
    EXPECT_FALSE(conduit.isASpecialFile("Info"));
}

TEST_F(ConduitBase, AFreshConduitHasNoManagerAndLeavesAnEmptyMapBehind) {
    EXPECT_FALSE(conduit.hasMap());
    EXPECT_EQ(conduit.ACLManagerForRemoteLocation(Url("http://store/bob/Contacts")), nullptr);
    EXPECT_TRUE(conduit.hasMap());
    EXPECT_EQ(bare.ACLManagerForRemoteLocation(Url("http://store/bob/Contacts")), nullptr);
}

TEST_F(ConduitBase, FindsAManagerUnderTheBaseLocationOfTheLocationsUser) {
    const Url base("http://store/bob/Contacts");
    const auto manager = std::make_shared<CXACLManager>(base, engine);
    conduit.keep(base, manager);
    EXPECT_EQ(conduit.ACLManagerForRemoteLocation(Url("http://elsewhere/bob/Contacts/deeper")), manager);
    EXPECT_EQ(conduit.ACLManagerForRemoteLocation(Url("http://store/eve/Contacts")), nullptr);
}

TEST_F(ConduitBase, MapsTheOwnersLocationThroughTheAccountName) {
    EXPECT_EQ(conduit.baseLocationForRemoteLocation(Url("http://any/ADA/Contacts")), Url("http://store/ada/Contacts"));
}

TEST_F(ConduitBase, SavesEveryManagerAndReportsSuccessWhateverTheySay) {
    struct Counting : CXACLManager {
        using CXACLManager::CXACLManager;
        bool save() override { return ++saves, false; }
        int saves = 0;
    };
    EXPECT_TRUE(conduit.saveACLs()) << "no managers";
    const auto one = std::make_shared<Counting>(Url("http://store/bob/Contacts"), engine);
    const auto two = std::make_shared<Counting>(Url("http://store/eve/Contacts"), engine);
    conduit.keep(one->baseLocation(), one);
    conduit.keep(two->baseLocation(), two);
    EXPECT_TRUE(conduit.saveACLs());
    EXPECT_EQ(one->saves, 1);
    EXPECT_EQ(two->saves, 1);
}

TEST_F(ConduitBase, ClosingForgetsTheUsersOfRevokedLocationsInItsOwnPriorState) {
    Dictionary prior = engine.priorState("test");
    prior.set("bob", Dictionary());
    prior.set("<self>", Dictionary());
    prior.set("eve", Dictionary());
    engine.priorState("other").set("bob", Dictionary());
    engine.revoked = {RemoteLocation("http://store/bob/Contacts"), RemoteLocation("http://store/Ada/Contacts")};
    conduit.close();
    EXPECT_EQ(engine.priorState("test").allKeys(), Texts{"eve"});
    EXPECT_EQ(engine.priorState("other").allKeys(), Texts{"bob"});
}

TEST_F(ConduitBase, ClosingWithoutRevokedLocationsLeavesThePriorStateUntouched) {
    engine.priorState("test").set("bob", Dictionary{{"G", 1}});
    conduit.close();
    EXPECT_EQ(Value(engine.priorState("test")), Value(Dictionary{{"bob", Dictionary{{"G", 1}}}}));
}

TEST_F(ConduitBase, ComparesThePriorStateWithTheCurrentOne) {
    struct Comparing : TestConduit {
        using TestConduit::TestConduit;
        Dictionary currentState() override { return {{"now", 1}}; }
        CXDChangeRecords comparePriorStateToCurrentState(const Dictionary& prior, const Dictionary& current) override {
            seen = {{"prior", prior}, {"current", current}};
            return {std::make_shared<CXDChangeRecord>()};
        }
        Dictionary seen;
    } comparing(engine);
    engine.priorState("test").set("then", 1);
    EXPECT_EQ(comparing.changeRecords().size(), 1u);
    EXPECT_EQ(Value(comparing.seen),
              Value(Dictionary{{"prior", Dictionary{{"then", 1}}}, {"current", Dictionary{{"now", 1}}}}));
}

TEST_F(ConduitBase, WritesADictionaryAsAnXMLPropertyListThatReadsBack) {
    const Dictionary dictionary{{"First", "Ada \xC3\xA9 <&>"}, {"list", Array{"a", 1, true}}};
    const std::string text = conduit.stringForDictionary(dictionary);
    EXPECT_TRUE(text.starts_with("<?xml")) << text;
    EXPECT_EQ(PropertyList::fromXML(text), Value(dictionary));
}

TEST_F(ConduitBase, NamesAContactsFileBelowItsRealUsersBaseAndBucket) {
    EXPECT_EQ(conduit.locationForUID(UniqueId("abc"), kSelf)->absoluteString(),
              "http://store/ada/Contacts/People/16/abc");
    EXPECT_EQ(bare.locationForUID(UniqueId("abc"), kSelf), std::nullopt);
}

TEST_F(ConduitBase, StampsADictionaryWithAMultiValueOfOneSubscribedLocation) {
    Dictionary contact{{"First", "Bob"}};
    conduit.stampWithRemoteLocation(contact, RemoteLocation("http://store/bob/Contacts"));
    const auto stamp = CXMultiValue::fromValue(contact[kCXRemoteLocationProperty]);
    ASSERT_TRUE(stamp);
    ASSERT_EQ(stamp->count(), 1u);
    EXPECT_EQ(stamp->valueAtIndex(0), Value("http://store/bob/Contacts"));
    EXPECT_EQ(stamp->labelAtIndex(0), kCXSubscribeLabel);
    EXPECT_EQ(contact[kCXRemoteLocationProperty].dictionary()["identifiers"].array()[0].string(),
              stamp->identifierAtIndex(0))
        << "the identifier in the stamp is one that the contact database keeps";

    Dictionary other;
    conduit.stampWithRemoteLocation(other, RemoteLocation("http://store/bob/Contacts"));
    EXPECT_NE(other[kCXRemoteLocationProperty], contact[kCXRemoteLocationProperty]) << "each stamp is fresh";

    conduit.unstamp(contact);
    EXPECT_EQ(Value(contact), Value(Dictionary{{"First", "Bob"}}));
}

TEST_F(ConduitBase, ARecordOfARevokedLocationCountsAsDoneAndIsNotApplied) {
    engine.revoked = {RemoteLocation("http://store/bob/Contacts")};
    EXPECT_TRUE(conduit.applyChangeRecordIfNeeded(record("bob")));
    EXPECT_EQ(conduit.applications, 0);
    EXPECT_TRUE(conduit.applyChangeRecordIfNeeded(record("eve")));
    EXPECT_EQ(conduit.applications, 1);
}

// The list names locations by the record's own user, "<self>" included; the account's own location is another text.
TEST_F(ConduitBase, TheGuardLooksUpTheRecordsUserAsItStands) {
    engine.revoked = {RemoteLocation("http://store/ada/Contacts")};
    conduit.applyChangeRecordIfNeeded(record("<self>"));
    EXPECT_EQ(conduit.applications, 1);
    engine.revoked = {RemoteLocation("http://store/%3Cself%3E/Contacts")};
    conduit.applyChangeRecordIfNeeded(record("<self>"));
    EXPECT_EQ(conduit.applications, 1);
}

TEST_F(ConduitBase, ACanceledRecordCountsAsDoneAndIsNotApplied) {
    engine.canceledUser = UserName("bob");
    EXPECT_TRUE(conduit.applyChangeRecordIfNeeded(record("bob")));
    EXPECT_EQ(conduit.applications, 0);
}

TEST_F(ConduitBase, HandsTheDeniedFlagThroughAndReturnsWhatTheSourceSays) {
    conduit.apply = [](bool* denied) {
        if (denied) *denied = true;
        return false;
    };
    bool denied = false;
    EXPECT_FALSE(conduit.applyChangeRecordIfNeeded(record(), &denied));
    EXPECT_TRUE(denied);
    EXPECT_FALSE(conduit.applyChangeRecordIfNeeded(record())) << "no flag is given";
}

TEST_F(ConduitBase, ASourceThatRaisesCostsOneFailureAndTwoLogLinesAtAnyDebugLevel) {
    conduit.apply = [](bool*) -> bool { throw CXException("CXTest", "the disk is full"); };
    const auto failing = record();
    EXPECT_FALSE(conduit.applyChangeRecordIfNeeded(failing));
    EXPECT_EQ(log.lines(), (Texts{"Exception with applying change record: the disk is full",
                                  "Change record: " + failing->description()}));
}

TEST_F(ConduitBase, AnyOtherThrownObjectReachesTheCaller) {
    conduit.apply = [](bool*) -> bool { throw std::runtime_error("other"); };
    EXPECT_THROW(conduit.applyChangeRecordIfNeeded(record()), std::runtime_error);
    EXPECT_TRUE(log.lines().empty());
}

TEST_F(ConduitBase, DoesNotTouchTheAppliedToMask) {
    const auto applied = record();
    conduit.applyChangeRecordIfNeeded(applied);
    EXPECT_EQ(applied->appliedToSources(), 0);
}
