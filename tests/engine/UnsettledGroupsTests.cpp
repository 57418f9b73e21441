#include "engine/recovery/UnsettledGroups.h"

#include "Records.h"
#include "contacts/records/Identifier.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>
#include <string>
#include <vector>

namespace rolvane {
namespace {

using test::makeRecord;
using Strings = std::vector<std::string>;

TEST(UnsettledGroups, AreThoseWhoseChangesWaitedAndTheListOfAPersonWhoMetAnotherChange) {
    const CXDChangeRecords records{
        makeRecord(CXDUpdateRecord, "New:CXPerson", nullptr), makeRecord(CXDUpdateRecord, "Both:CXPerson", nullptr),
        makeRecord(CXDChangeGroupName, nullptr, "New:CXGroup"), makeRecord(CXDUpdateRecord, "Both:CXPerson", nullptr),
        makeRecord(CXDAddRecordToGroup, "Old:CXPerson", "Old:CXGroup")};
    EXPECT_EQ(unsettledGroups(records, 3).allKeys(), (Strings{std::string(kCXAllGroupUID), "Old:CXGroup"}));
    EXPECT_EQ(unsettledGroups(records, 4).allKeys(), Strings{"Old:CXGroup"}) << "both changes of the person are new";
    EXPECT_TRUE(unsettledGroups(records, 5).empty()) << "nothing waited";
}

// The rule, an identifier at a time.
bool isUnsettled(const std::string& identifier, const CXDChangeRecords& records, size_t fresh) {
    size_t met = 0;
    bool waited = false, waitedAsGroup = false;
    for (size_t i = 0; i < records.size(); ++i) {
        if (records[i]->initialSource() != CXDSyncSourceCX) continue;
        const bool isGroup = records[i]->group() && records[i]->group()->str() == identifier;
        const bool isPerson = records[i]->person() && records[i]->person()->str() == identifier;
        if (!isGroup && !isPerson) continue;
        ++met;
        waited = waited || i >= fresh;
        waitedAsGroup = waitedAsGroup || (i >= fresh && isGroup);
    }
    return waitedAsGroup || (waited && met > 1);
}

RC_GTEST_PROP(UnsettledGroups, FollowTheRuleWhateverMeets, ()) {
    const auto records = *rc::gen::container<CXDChangeRecords>(test::arbitraryRecord());
    const auto fresh = *rc::gen::inRange<size_t>(0, records.size() + 2);
    Dictionary expected;
    for (const CXDChangeRecordPtr& record : records)
        for (const auto& identifier : {record->group(), record->person()})
            if (identifier && isUnsettled(identifier->str(), records, fresh)) {
                const bool isGroup = std::any_of(
                    records.begin() + static_cast<std::ptrdiff_t>(std::min(fresh, records.size())), records.end(),
                    [&](const auto& r) { return r->initialSource() == CXDSyncSourceCX && r->group() == identifier; });
                expected.set(isGroup ? identifier->str() : std::string(kCXAllGroupUID), true);
            }
    RC_ASSERT(unsettledGroups(records, fresh).allKeys() == expected.allKeys());
}

} // namespace
} // namespace rolvane
