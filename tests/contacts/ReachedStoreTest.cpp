#include "TestDatabase.h"
#include "foundation/Sqlite.h"

#include <algorithm>
#include <gtest/gtest.h>

namespace rolvane::test {
namespace {

const UniqueId ada{"A:CXPerson"}, ben{"B:CXPerson"}, nobody{"N:CXPerson"};

class ReachedStoreTest : public testing::Test {
protected:
    ReachedStoreTest() {
        d.addPerson("Ada", ada.str());
        d.addPerson("Ben", ben.str());
        d->save();
    }
    std::vector<UniqueId> noted(CXRolvane& database) {
        std::vector<UniqueId> all;
        for (const CXReached& each : database.reached()) all.push_back(each.uniqueId);
        std::sort(all.begin(), all.end());
        return all;
    }
    TestDatabase d;
};

TEST_F(ReachedStoreTest, IsNotedAtOnceAndWithoutTheUnsavedChanges) {
    EXPECT_TRUE(d->reached().empty());
    d->recordForUniqueId(ada)->setValue(Value("unsaved"), "note");
    d->noteReachedAtOnce({{ada, kSelf, Date(1000)}, {ben, UserName("carol"), Date(2000)}, {nobody, kSelf, Date(3000)}});
    EXPECT_TRUE(d->hasUnsavedChanges());
    const auto other = d.open("rolvane");
    EXPECT_EQ(noted(*other), (std::vector{ada, ben})) << "of what is stored";
    for (const CXReached& each : other->reached()) {
        EXPECT_EQ(each.tree, each.uniqueId == ada ? kSelf : UserName("carol"));
        EXPECT_EQ(each.since, Date(each.uniqueId == ada ? 1000 : 2000));
    }
    d->noteReachedAtOnce({{ada, kSelf, Date(4000)}});
    EXPECT_EQ(noted(*d.database), (std::vector{ada, ben}));
}

TEST_F(ReachedStoreTest, GoesWhenItIsForgottenAndWithItsRecord) {
    d->forgetReached({ada}); // there is no such note yet
    d->noteReachedAtOnce({{ada, kSelf, Date(1000)}, {ben, kSelf, Date(1000)}});
    d->forgetReached({ada, nobody});
    EXPECT_EQ(noted(*d.open("rolvane")), std::vector{ben});
    d->removeRecord(d->recordForUniqueId(ben));
    d->save();
    EXPECT_TRUE(d->reached().empty());
}

// A name without a file comes before the file, and never behind it.
TEST_F(ReachedStoreTest, ANameWithoutAFileGivesWayToTheFile) {
    const auto of = [&](const UniqueId& uid) {
        for (const CXReached& each : d.open("rolvane")->reached())
            if (each.uniqueId == uid) return each;
        return CXReached{};
    };
    d->noteReachedAtOnce({{ada, kSelf, Date(1000), false}, {ben, kSelf, Date(1000), false}});
    d->noteReachedAtOnce({{ada, kSelf, Date(2000), false}, {ben, kSelf, Date(3000)}});
    EXPECT_FALSE(of(ada).hasFile);
    EXPECT_EQ(of(ada).since, Date(1000)) << "it has had that name since then";
    EXPECT_TRUE(of(ben).hasFile);
    EXPECT_EQ(of(ben).since, Date(3000));
    d->noteReachedAtOnce({{ben, kSelf, Date(4000), false}});
    EXPECT_TRUE(of(ben).hasFile);
}

TEST_F(ReachedStoreTest, TakesUpTheTableOfAnEarlierVersion) {
    Sqlite file(d.path, 1000);
    file.execute("CREATE TABLE reached(record_id INTEGER PRIMARY KEY REFERENCES records(id) ON DELETE CASCADE,"
                 " tree TEXT NOT NULL, since REAL NOT NULL);"
                 "INSERT INTO reached SELECT id, 'self', 1000 FROM records WHERE uid='A:CXPerson'");
    ASSERT_EQ(noted(*d.database), std::vector{ada});
    EXPECT_TRUE(d->reached().front().hasFile);
    d->noteReachedAtOnce({{ben, kSelf, Date(2000), false}});
    EXPECT_EQ(noted(*d.open("rolvane")), (std::vector{ada, ben}));
}

} // namespace
} // namespace rolvane::test
