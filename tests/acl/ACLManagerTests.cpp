#include "acl/CXACLManager.h"

#include <gtest/gtest.h>
#include <rapidcheck.h>
#include <set>

using namespace rolvane;

namespace {

// Everything below /ada is the daemon's own user's.
class AdaOwns : public LocationOwner {
public:
    UserName userForRemoteLocation(const RemoteLocation& location) const override {
        asked.push_back(location.str());
        return location.str().find("/ada/") != std::string::npos ? kSelf : UserName("bob");
    }
    mutable std::vector<std::string> asked;
};

const UniqueId kGroup{"G:CXGroup"};
const UserName kBob{"bob"};
const UserName kEve{"eve"};
using Users = std::vector<UserName>;

std::vector<std::string> texts(const std::vector<Url>& urls) {
    std::vector<std::string> all;
    for (const Url& url : urls) all.push_back(url.absoluteString());
    return all;
}

class AccessList : public testing::Test {
protected:
    AdaOwns owner;
    CXACLManager manager{Url("http://store.example/ada/Contacts"), owner};
};

} // namespace

TEST_F(AccessList, OfTheCurrentUsersLocationKnowsThatItIsThePublishers) {
    EXPECT_TRUE(manager.publisher());
    EXPECT_EQ(owner.asked, std::vector<std::string>{"http://store.example/ada/Contacts"});
    CXACLManager other(Url("http://store.example/bob/Contacts"), owner);
    EXPECT_FALSE(other.publisher());
}

TEST_F(AccessList, StartsEmptyAndTheBaseLoadsNothingAndSavesAsItValidates) {
    EXPECT_TRUE(manager.principalsWithReadAccess().empty());
    EXPECT_TRUE(manager.principalsWithAllAccess().empty());
    EXPECT_FALSE(manager.load());
    EXPECT_TRUE(manager.validate());
    EXPECT_TRUE(manager.save());
}

TEST_F(AccessList, SavesAsASubclassValidates) {
    struct Invalid : CXACLManager {
        using CXACLManager::CXACLManager;
        bool validate() override { return false; }
    } invalid(Url("http://store.example/ada/Contacts"), owner);
    EXPECT_FALSE(invalid.save());
}

TEST_F(AccessList, GrantingReadWriteMakesAReaderToo) {
    manager.grantReadWritePermissionForGUID(kGroup, {}, kBob);
    EXPECT_EQ(manager.principalsWithAllAccess(), Users{kBob});
    EXPECT_EQ(manager.principalsWithReadAccess(), Users{kBob});
}

TEST_F(AccessList, GrantingReadWriteToAnExistingReaderListsItOnceInEach) {
    manager.grantReadPermissionForGUID(kGroup, {}, kBob);
    manager.grantReadWritePermissionForGUID(kGroup, {}, kBob);
    EXPECT_EQ(manager.principalsWithReadAccess(), Users{kBob});
    EXPECT_EQ(manager.principalsWithAllAccess(), Users{kBob});
}

TEST_F(AccessList, GrantingReadWriteToAWriterThatIsNoReaderLeavesItWithoutReadAccess) {
    manager.grantPrincipal(kBob, true);
    manager.grantReadWritePermissionForGUID(kGroup, {}, kBob);
    EXPECT_EQ(manager.principalsWithAllAccess(), Users{kBob});
    EXPECT_TRUE(manager.principalsWithReadAccess().empty());
}

TEST_F(AccessList, DenyingReadTakesAllAccessToo) {
    manager.grantReadWritePermissionForGUID(kGroup, {}, kBob);
    manager.denyReadPermissionForGUID(kGroup, {}, kBob);
    EXPECT_TRUE(manager.principalsWithReadAccess().empty());
    EXPECT_TRUE(manager.principalsWithAllAccess().empty());
}

TEST_F(AccessList, DenyingReadWriteKeepsReadAccess) {
    manager.grantReadWritePermissionForGUID(kGroup, {}, kBob);
    manager.denyReadWritePermissionForGUID(kGroup, {}, kBob);
    EXPECT_EQ(manager.principalsWithReadAccess(), Users{kBob});
    EXPECT_TRUE(manager.principalsWithAllAccess().empty());
}

TEST_F(AccessList, KeepsTheOrderOfGrantingAndNeverDoubles) {
    for (const UserName& user : {kEve, kBob, kEve}) manager.grantReadPermissionForGUID(kGroup, {}, user);
    EXPECT_EQ(manager.principalsWithReadAccess(), (Users{kEve, kBob}));
}

TEST_F(AccessList, PlainGrantAndDenyTouchOneListOnly) {
    manager.grantPrincipal(kBob, false);
    manager.grantPrincipal(kBob, false);
    manager.grantPrincipal(kBob, true);
    EXPECT_EQ(manager.principalsWithReadAccess(), Users{kBob});
    manager.denyPrincipal(kBob, false);
    EXPECT_TRUE(manager.principalsWithReadAccess().empty());
    EXPECT_EQ(manager.principalsWithAllAccess(), Users{kBob});
    manager.denyPrincipal(kBob, true);
    EXPECT_TRUE(manager.principalsWithAllAccess().empty());
}

TEST_F(AccessList, GrantsAndDenialsNeverLeaveAnAllAccessPrincipalThatMayNotRead) {
    EXPECT_TRUE(rc::check([this] {
        CXACLManager list(Url("http://store.example/ada/Contacts"), owner);
        for (const auto& [step, who] : *rc::gen::container<std::vector<std::pair<int, int>>>(
                 rc::gen::pair(rc::gen::inRange(0, 4), rc::gen::inRange(0, 4)))) {
            const UserName user("user" + std::to_string(who));
            if (step == 0) list.grantReadPermissionForGUID(kGroup, {}, user);
            if (step == 1) list.grantReadWritePermissionForGUID(kGroup, {}, user);
            if (step == 2) list.denyReadPermissionForGUID(kGroup, {}, user);
            if (step == 3) list.denyReadWritePermissionForGUID(kGroup, {}, user);
            const std::set<UserName> readers(list.principalsWithReadAccess().begin(),
                                             list.principalsWithReadAccess().end());
            RC_ASSERT(readers.size() == list.principalsWithReadAccess().size());
            for (const UserName& writer : list.principalsWithAllAccess()) RC_ASSERT(readers.contains(writer));
        }
    }));
}

TEST_F(AccessList, DescribesReadersAndCallsTheAllAccessListWriters) {
    manager.grantReadPermissionForGUID(kGroup, {}, kEve);
    manager.grantPrincipal(kBob, true);
    const std::string text = manager.description();
    EXPECT_TRUE(text.starts_with("<CXACLManager: 0x")) << text;
    EXPECT_NE(text.find(">\nReaders: (\n    eve,\n)\nWriters: (\n    bob,\n)"), std::string::npos) << text;
}

TEST_F(AccessList, NamesTheFilesOfAGroupsMembersThenTheGroup) {
    EXPECT_EQ(texts(manager.affectedURLsForGUID(UniqueId("G"), {UniqueId("a"), UniqueId("abc")})),
              (std::vector<std::string>{"http://store.example/ada/Contacts/People/12/a",
                                        "http://store.example/ada/Contacts/People/16/abc",
                                        "http://store.example/ada/Contacts/G"}));
    EXPECT_EQ(texts(manager.affectedURLsForGUID(UniqueId("G"), {})),
              std::vector<std::string>{"http://store.example/ada/Contacts/G"});
}

TEST_F(AccessList, NamesThe32BucketsInNumericOrder) {
    const auto urls = texts(manager.bucketURLs());
    ASSERT_EQ(urls.size(), 32u);
    for (size_t i = 0; i < urls.size(); ++i)
        EXPECT_EQ(urls[i], "http://store.example/ada/Contacts/People/" + std::to_string(i));
}

TEST_F(AccessList, NamesTheBaseItsInfoAndItsClockFileAsTheOtherStructure) {
    EXPECT_EQ(texts(manager.otherStructureURLs()),
              (std::vector<std::string>{"http://store.example/ada/Contacts", "http://store.example/ada/Contacts/info",
                                        "http://store.example/ada/Contacts/dateFile"}));
}

// First digest bytes of the known digests: "" d4, "a" 0c, "abc" 90, "message digest" f9.
TEST(BucketName, IsTheLowFiveBitsOfTheFirstDigestByteInDecimal) {
    EXPECT_EQ(CXACLManager::bucketNameForUID(UniqueId("")), "20");
    EXPECT_EQ(CXACLManager::bucketNameForUID(UniqueId("a")), "12");
    EXPECT_EQ(CXACLManager::bucketNameForUID(UniqueId("abc")), "16");
    EXPECT_EQ(CXACLManager::bucketNameForUID(UniqueId("message digest")), "25");
}

TEST(BucketName, DropsTheHighBitsOfTheDigestByte) {
    EXPECT_EQ(CXACLManager::bucketNameForUID(UniqueId("uid142")), "0"); // 20
    EXPECT_EQ(CXACLManager::bucketNameForUID(UniqueId("uid487")), "0"); // e0
    EXPECT_EQ(CXACLManager::bucketNameForUID(UniqueId("uid60")), "31"); // 3f
}

// The text has fewer UTF-16 units than UTF-8 bytes: that many bytes count, even when they end inside a character.
TEST(BucketName, HashesAsManyBytesAsTheTextHasUtf16Units) {
    EXPECT_EQ(CXACLManager::bucketNameForUID(UniqueId("\u00e9:CXPerson")), "5"); // 10 of 11 bytes: 85
    EXPECT_EQ(CXACLManager::bucketNameForUID(UniqueId("\U0001F600x")), "11");    // 3 of 5 bytes: 4b
}
