#include "../contacts/TestDatabase.h"
#include "acl/CXDCXACLManager.h"

#include <gtest/gtest.h>

using namespace rolvane;
using namespace rolvane::test;

namespace {

using Users = std::vector<UserName>;

class AdaOwns : public LocationOwner {
public:
    UserName userForRemoteLocation(const RemoteLocation& location) const override {
        return location.str().find("/ada/") != std::string::npos ? kSelf : UserName("bob");
    }
};

// Ada's database with a subscription to what bob publishes.
class RightsInTheDatabase : public testing::Test {
protected:
    static constexpr const char* kBobs = "http://store.example/bob/Contacts";

    RightsInTheDatabase() {
        database->addRecord(CXSubscription::create(RemoteLocation(kBobs)));
        database->save();
    }
    CXDCXACLManager manager(const char* location = kBobs) {
        return {Url(location), owner, *database, UserName("ada lovelace")};
    }
    CXAllGroupRef bobs() { return database->allGroupForRemoteLocation(RemoteLocation(kBobs)); }
    CXMultiValue principals(size_t count) {
        CXMutableMultiValue list;
        for (size_t i = 0; i < count; ++i) list.addValue("user" + std::to_string(i), "user");
        return list;
    }

    AdaOwns owner;
    TestDatabase database;
};

const UniqueId kAll{"AllCXGroup"};

} // namespace

TEST_F(RightsInTheDatabase, WithoutTheReadWritePropertyTheUserMayReadOnly) {
    const auto list = manager();
    EXPECT_FALSE(list.publisher());
    EXPECT_EQ(list.principalsWithReadAccess(), Users{kSelf});
    EXPECT_TRUE(list.principalsWithAllAccess().empty());
}

TEST_F(RightsInTheDatabase, EntriesInTheReadWritePropertyLetTheUserWrite) {
    bobs()->setValue(principals(1), kCXReadWriteSharingACLProperty);
    const auto list = manager();
    EXPECT_EQ(list.principalsWithReadAccess(), Users{kSelf});
    EXPECT_EQ(list.principalsWithAllAccess(), Users{kSelf});
}

TEST_F(RightsInTheDatabase, TheReadPropertyIsNotLookedAt) {
    bobs()->setValue(principals(3), kCXReadSharingACLProperty);
    EXPECT_EQ(manager().principalsWithReadAccess(), Users{kSelf});
    EXPECT_TRUE(manager().principalsWithAllAccess().empty());
}

TEST_F(RightsInTheDatabase, TheCountOfWritersIsATruthValueOfOneByte) {
    const auto mayWrite = [this](size_t count) {
        bobs()->setValue(principals(count), kCXReadWriteSharingACLProperty);
        return !manager().principalsWithAllAccess().empty();
    };
    EXPECT_FALSE(mayWrite(0));
    EXPECT_TRUE(mayWrite(255));
    EXPECT_FALSE(mayWrite(256));
    EXPECT_TRUE(mayWrite(257));
    EXPECT_FALSE(mayWrite(512));
}

TEST_F(RightsInTheDatabase, LoadingAgainAddsNothingTwiceAndTakesNothingAway) {
    bobs()->setValue(principals(1), kCXReadWriteSharingACLProperty);
    auto list = manager();
    list.grantPrincipal(UserName("eve"), true);
    bobs()->removeValueForProperty(kCXReadWriteSharingACLProperty);
    EXPECT_TRUE(list.load());
    EXPECT_EQ(list.principalsWithReadAccess(), Users{kSelf});
    EXPECT_EQ(list.principalsWithAllAccess(), (Users{kSelf, UserName("eve")}));
}

TEST_F(RightsInTheDatabase, SavingAReaderWritesTheRealUserAsValueAndLabelOfTheReadPropertyOnly) {
    auto list = manager();
    EXPECT_TRUE(list.save());
    const auto readers = bobs()->multiValueForProperty(kCXReadSharingACLProperty);
    ASSERT_TRUE(readers);
    ASSERT_EQ(readers->count(), 1u);
    EXPECT_EQ(readers->valueAtIndex(0), Value("ada lovelace"));
    EXPECT_EQ(readers->labelAtIndex(0), "ada lovelace");
    EXPECT_FALSE(bobs()->multiValueForProperty(kCXReadWriteSharingACLProperty));
}

TEST_F(RightsInTheDatabase, SavingAWriterWritesBothAndANewManagerLoadsThem) {
    auto list = manager();
    list.grantReadWritePermissionForGUID(kAll, {}, kSelf);
    list.save();
    EXPECT_TRUE(bobs()
                    ->multiValueForProperty(kCXReadSharingACLProperty)
                    ->sameContents(*bobs()->multiValueForProperty(kCXReadWriteSharingACLProperty)));
    EXPECT_EQ(manager().principalsWithAllAccess(), Users{kSelf});
}

TEST_F(RightsInTheDatabase, LosingTheRightToWriteRemovesTheReadWritePropertyOnly) {
    auto list = manager();
    list.grantReadWritePermissionForGUID(kAll, {}, kSelf);
    list.save();
    list.denyReadWritePermissionForGUID(kAll, {}, kSelf);
    list.save();
    EXPECT_TRUE(bobs()->multiValueForProperty(kCXReadSharingACLProperty));
    EXPECT_FALSE(bobs()->multiValueForProperty(kCXReadWriteSharingACLProperty));
    EXPECT_TRUE(manager().principalsWithAllAccess().empty());
}

TEST_F(RightsInTheDatabase, LosingTheRightToReadRemovesBoth) {
    auto list = manager();
    list.grantReadWritePermissionForGUID(kAll, {}, kSelf);
    list.save();
    list.denyReadPermissionForGUID(kAll, {}, kSelf);
    list.save();
    EXPECT_TRUE(bobs()->valueForProperty(kCXReadSharingACLProperty).isAbsent());
    EXPECT_TRUE(bobs()->valueForProperty(kCXReadWriteSharingACLProperty).isAbsent());
}

// The lists are looked at one by one: who lost the plain right to read alone still stands among the writers.
TEST_F(RightsInTheDatabase, EachPropertyFollowsItsOwnList) {
    auto list = manager();
    list.grantReadWritePermissionForGUID(kAll, {}, kSelf);
    list.denyPrincipal(kSelf, false);
    list.save();
    EXPECT_FALSE(bobs()->multiValueForProperty(kCXReadSharingACLProperty));
    EXPECT_TRUE(bobs()->multiValueForProperty(kCXReadWriteSharingACLProperty));
}

TEST_F(RightsInTheDatabase, OtherPrincipalsOfTheListsAreNotWritten) {
    auto list = manager();
    list.grantReadWritePermissionForGUID(kAll, {}, UserName("eve"));
    list.save();
    EXPECT_EQ(bobs()->multiValueForProperty(kCXReadSharingACLProperty)->count(), 1u);
    EXPECT_FALSE(bobs()->multiValueForProperty(kCXReadWriteSharingACLProperty));
}

TEST_F(RightsInTheDatabase, ThePropertiesOfTheUsersOwnPublicationAreNeverWritten) {
    const char* own = "http://store.example/ada/Contacts";
    database->addRecord(CXSubscription::create(RemoteLocation(own)));
    database->save();
    auto list = manager(own);
    ASSERT_TRUE(list.publisher());
    list.grantReadWritePermissionForGUID(kAll, {}, kSelf);
    EXPECT_TRUE(list.save());
    EXPECT_FALSE(database->hasUnsavedChanges());
    EXPECT_FALSE(database->allGroup()->multiValueForProperty(kCXReadSharingACLProperty));
}

TEST_F(RightsInTheDatabase, SavingLeavesTheSaveOfTheDatabaseToItsConduit) {
    auto list = manager();
    list.save();
    EXPECT_TRUE(database->hasUnsavedChanges());
    database->rollback();
    EXPECT_FALSE(bobs()->multiValueForProperty(kCXReadSharingACLProperty));
}

TEST_F(RightsInTheDatabase, SavingWhatIsThereAlreadyIsNoEdit) {
    auto list = manager();
    list.grantReadWritePermissionForGUID(kAll, {}, kSelf);
    list.save();
    database->save();
    list.save();
    EXPECT_FALSE(database->hasUnsavedChanges());
    list.denyReadPermissionForGUID(kAll, {}, kSelf);
    list.save();
    database->save();
    list.save();
    EXPECT_FALSE(database->hasUnsavedChanges());
}

TEST_F(RightsInTheDatabase, ALocationThatIsNoLongerSubscribedLoadsAsReadableAndSavesNothing) {
    auto list = manager("http://store.example/carl/Contacts");
    EXPECT_EQ(list.principalsWithReadAccess(), Users{kSelf});
    EXPECT_TRUE(list.save());
    EXPECT_FALSE(database->hasUnsavedChanges());

    auto kept = manager();
    database->removeRecord(database->findSubscriptionWithRemoteLocation(RemoteLocation(kBobs)));
    database->save();
    EXPECT_TRUE(kept.save());
    EXPECT_FALSE(database->hasUnsavedChanges());
}

TEST_F(RightsInTheDatabase, TheLocationIsMatchedByItsWholeText) {
    bobs()->setValue(principals(1), kCXReadWriteSharingACLProperty);
    EXPECT_TRUE(manager("http://store.example/bob/Contacts/").principalsWithAllAccess().empty());
    EXPECT_FALSE(manager().principalsWithAllAccess().empty());
}

TEST_F(RightsInTheDatabase, ADamagedReadWritePropertyGivesNoRightToWrite) {
    bobs()->setValue(Value("ada lovelace"), kCXReadWriteSharingACLProperty);
    auto list = manager();
    EXPECT_TRUE(list.principalsWithAllAccess().empty());
    list.save();
    EXPECT_TRUE(bobs()->valueForProperty(kCXReadWriteSharingACLProperty).isAbsent());
}

TEST_F(RightsInTheDatabase, TheDescriptionNamesTheClass) {
    EXPECT_TRUE(manager().description().starts_with("<CXDCXACLManager: 0x"));
}
