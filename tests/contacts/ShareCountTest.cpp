#include "TestDatabase.h"

namespace rolvane::test {
namespace {

TEST(ShareCount, ChangesOnlyWhenItIsSet) {
    TestDatabase d;
    int64_t count = d->shareCount();
    d.addPerson("A");
    d->save();
    d.reopen();
    EXPECT_EQ(d->shareCount(), count);
    d->setShareCount(count + 5);
    EXPECT_EQ(d->shareCount(), count + 5);
    EXPECT_EQ(d.open("rolvane")->shareCount(), count) << "part of the unit of work";
    d->save();
    EXPECT_EQ(d.open("rolvane")->shareCount(), count + 5);
}

TEST(ShareCount, ANewDatabaseHasItsOwn) {
    TestDatabase one, two;
    EXPECT_NE(one->databaseIdentity(), two->databaseIdentity());
    EXPECT_NE(one->shareCount(), two->shareCount());
    EXPECT_GE(one->shareCount(), 0);
}

} // namespace
} // namespace rolvane::test
