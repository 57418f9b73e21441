#include "contacts/records/Identifier.h"

#include <set>

#include <gtest/gtest.h>

namespace rolvane {
namespace {

struct Conversion {
    const char *from, *table, *to;
};

class IdentifierConversion : public testing::TestWithParam<Conversion> {};

TEST_P(IdentifierConversion, GivesTheIdentifierOfTheOtherTable) {
    EXPECT_EQ(cxUIDWithTableName(UniqueId(GetParam().from), GetParam().table).str(), GetParam().to);
}

INSTANTIATE_TEST_SUITE_P(
    EveryPair, IdentifierConversion,
    testing::Values(Conversion{"U:CXPerson", "CXPerson", "U:CXPerson"},
                    Conversion{"U:CXPerson", "CXSubscribedPerson", "U:CXSubscribedPerson"},
                    Conversion{"U:CXSubscribedPerson", "CXPerson", "U:CXPerson"},
                    Conversion{"U:CXSubscribedPerson", "CXSubscribedPerson", "U:CXSubscribedPerson"},
                    Conversion{"U:CXGroup", "CXGroup", "U:CXGroup"},
                    Conversion{"U:CXGroup", "CXSubscribedGroup", "U:CXSubscribedGroup"},
                    Conversion{"U:CXSubscribedGroup", "CXGroup", "U:CXGroup"},
                    Conversion{"U:CXSubscribedGroup", "CXSubscribedGroup", "U:CXSubscribedGroup"},
                    Conversion{"AllCXGroup", "CXGroup", "AllCXGroup"},
                    Conversion{"AllCXGroup", "CXSubscribedGroup", "AllCXSubscribedGroup"},
                    Conversion{"AllCXSubscribedGroup", "CXGroup", "AllCXGroup"},
                    Conversion{"AllCXSubscribedGroup", "CXSubscribedGroup", "AllCXSubscribedGroup"},
                    Conversion{"U:AllCXSubscribedGroup", "CXGroup", "U:AllCXGroup"},
                    Conversion{"U:CXGroup", "CXGroupContents", "U:CXGroupContents"},
                    Conversion{"U:CXGroupContents", "CXGroup", "U:CXGroup"},
                    Conversion{"U:CXSubscriptionRecord", "AllCXSubscribedGroup", "U:AllCXSubscribedGroup"},
                    Conversion{"a:b:CXPerson", "CXSubscribedPerson", "a:b:CXSubscribedPerson"},
                    Conversion{"U", "CXPerson", "U:CXPerson"}));

struct Normal {
    const char *from, *to;
    bool subscribed;
};

class IdentifierNormalForm : public testing::TestWithParam<Normal> {};

TEST_P(IdentifierNormalForm, IsOfThePlainTableAndIdempotent) {
    UniqueId normal = cxNormalizedUID(UniqueId(GetParam().from));
    EXPECT_EQ(normal.str(), GetParam().to);
    EXPECT_EQ(cxNormalizedUID(normal), normal);
    EXPECT_EQ(cxIsSubscribed(UniqueId(GetParam().from)), GetParam().subscribed);
    EXPECT_FALSE(cxIsSubscribed(normal));
}

INSTANTIATE_TEST_SUITE_P(
    EveryTable, IdentifierNormalForm,
    testing::Values(Normal{"U:CXPerson", "U:CXPerson", false}, Normal{"U:CXSubscribedPerson", "U:CXPerson", true},
                    Normal{"U:CXGroup", "U:CXGroup", false}, Normal{"U:CXSubscribedGroup", "U:CXGroup", true},
                    Normal{"AllCXGroup", "AllCXGroup", false}, Normal{"AllCXSubscribedGroup", "AllCXGroup", true},
                    Normal{"U:AllCXSubscribedGroup", "U:AllCXGroup", true},
                    Normal{"U:CXSubscriptionRecord", "U:CXSubscriptionRecord", false},
                    Normal{"U:CXGroupContents", "U:CXGroupContents", false}, Normal{"U:CXInfo", "U:CXInfo", false},
                    Normal{"", "", false}));

TEST(Identifier, FreshOnesDifferAndCarryTheirTable) {
    std::set<UniqueId> made;
    for (int i = 0; i < 100; i++) {
        UniqueId uid = makeUniqueId(kCXPersonTable);
        EXPECT_EQ(cxTableName(uid), kCXPersonTable);
        made.insert(uid);
    }
    EXPECT_EQ(made.size(), 100u);
}

} // namespace
} // namespace rolvane
