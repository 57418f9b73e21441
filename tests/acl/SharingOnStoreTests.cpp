#include "../store/StoreWorld.h"
#include "acl/CXDAVACLManager.h"
#include "foundation/Paths.h"
#include "support/CapturingLog.h"

#include <gtest/gtest.h>

// The owner's and the subscriber's access-list managers against httpd with the store's own module.

using namespace rolvane;
using namespace rolvane::test;

namespace {

using Users = std::vector<UserName>;

const UniqueId kAll{"AllCXGroup"};
const UserName kBob{"bob"};

struct AliceOwns : LocationOwner {
    UserName userForRemoteLocation(const RemoteLocation&) const override { return kSelf; }
};
struct BobSubscribes : LocationOwner {
    UserName userForRemoteLocation(const RemoteLocation&) const override { return UserName("alice"); }
};

class SharingOnAStore : public testing::Test {
protected:
    SharingOnAStore() : alice(world), bob(world, "bob") {
        EXPECT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true)) << alice.wire->text();
        EXPECT_EQ(alice.write("AllCXGroup", Dictionary()) / 100, 2);
    }
    CXDAVACLManager owners() { return {alice.base, owner, alice.manager}; }
    CXDAVACLManager subscribers() { return {alice.base, subscriber, bob.manager}; }
    int bobWrites() { return bob.write("AllCXGroup", Dictionary()); }
    int bobReads() { return bob.read("AllCXGroup").first; }

    const AliceOwns owner;
    const BobSubscribes subscriber;
    const StoreWorld world;
    Client alice, bob;
    CapturingLog log;
};

TEST_F(SharingOnAStore, NobodyIsLetInBeforeTheOwnerSaysSo) {
    auto list = owners();
    EXPECT_TRUE(list.isKnown());
    EXPECT_TRUE(list.principalsWithReadAccess().empty());
    EXPECT_TRUE(subscribers().principalsWithReadAccess().empty());
    EXPECT_EQ(bobReads(), 403);
}

TEST_F(SharingOnAStore, AReaderReadsAndSeesThatThisIsAll) {
    auto list = owners();
    list.grantReadPermissionForGUID(kAll, {}, kBob);
    ASSERT_TRUE(list.save()) << alice.wire->text();
    EXPECT_EQ(owners().principalsWithReadAccess(), Users{kBob});
    auto rights = subscribers();
    EXPECT_EQ(rights.principalsWithReadAccess(), Users{kSelf});
    EXPECT_TRUE(rights.principalsWithAllAccess().empty());
    EXPECT_EQ(bobReads(), 200);
    EXPECT_EQ(bobWrites(), 403);
}

TEST_F(SharingOnAStore, AWriterWritesUntilTheRightIsLoweredAndReadsUntilItIsWithdrawn) {
    auto list = owners();
    list.grantReadWritePermissionForGUID(kAll, {}, kBob);
    ASSERT_TRUE(list.save()) << alice.wire->text();
    EXPECT_EQ(owners().principalsWithAllAccess(), Users{kBob});
    EXPECT_EQ(subscribers().principalsWithAllAccess(), Users{kSelf});
    EXPECT_EQ(bobWrites() / 100, 2);

    list.denyReadWritePermissionForGUID(kAll, {}, kBob);
    list.grantReadPermissionForGUID(kAll, {}, kBob);
    ASSERT_TRUE(list.save());
    EXPECT_TRUE(subscribers().principalsWithAllAccess().empty());
    EXPECT_EQ(bobWrites(), 403);
    EXPECT_EQ(bobReads(), 200);

    list.denyReadPermissionForGUID(kAll, {}, kBob);
    ASSERT_TRUE(list.save());
    EXPECT_TRUE(subscribers().principalsWithReadAccess().empty());
    EXPECT_EQ(bobReads(), 403);
}

TEST_F(SharingOnAStore, TheListIsThePublishedTreesOwnAndOpensNothingBeside) {
    auto list = owners();
    list.grantReadPermissionForGUID(kAll, {}, kBob);
    ASSERT_TRUE(list.save());
    HttpRequest write;
    write.method = "PUT";
    write.url = Url(world.store.baseURL() + "/alice/diary");
    write.body = std::make_shared<const std::string>("dear diary");
    EXPECT_EQ(alice.wire->perform(write).status, 201);
    HttpRequest read;
    read.method = "GET";
    read.url = write.url;
    EXPECT_EQ(bob.wire->perform(read).status, 403);
}

TEST_F(SharingOnAStore, SomebodyWhomTheStoreDoesNotKnowIsNotSaved) {
    auto list = owners();
    list.grantReadPermissionForGUID(kAll, {}, UserName("nobody"));
    list.grantReadPermissionForGUID(kAll, {}, kBob);
    EXPECT_FALSE(list.save());
    EXPECT_EQ(owners().principalsWithReadAccess(), Users{kBob}) << "the others are";
}

TEST_F(SharingOnAStore, AGroupOfTheServersIsGrantedByItsName) {
    writeFileDurably(world.store.stateDirectory() + "/conf/groups", "family: bob\n", 0644);
    auto list = owners();
    list.grantReadPermissionForGUID(kAll, {}, UserName("family"));
    ASSERT_TRUE(list.save()) << alice.wire->text();
    EXPECT_EQ(owners().principalsWithReadAccess(), Users{UserName("family")});
    EXPECT_EQ(bobReads(), 200);
    EXPECT_EQ(bobWrites(), 403);
}

} // namespace
