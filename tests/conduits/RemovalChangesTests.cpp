#include "conduits/database/RemovalChanges.h"

#include "FakeEngine.h"

#include <gtest/gtest.h>
#include <rapidcheck.h>

using namespace rolvane;
using namespace rolvane::test;

namespace {

const UniqueId kPerson("P:CXPerson");
const UniqueId kGroup("X:CXGroup");

Value group(Array members, Array subgroups = {}) {
    return Dictionary{{"memberUIDState", members}, {"subgroupUIDState", subgroups}};
}

// The two searches word by word: every user, every group, every element.
CXDChangeRecords literally(const Dictionary& prior, const UniqueId& uid, bool person) {
    CXDChangeRecords all;
    const auto add = [&](CXDChangeType type, const std::string& user, std::optional<UniqueId> p,
                         std::optional<UniqueId> g) {
        all.push_back(std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, type, UserName(user), p, g));
        all.back()->setAppliesToSources(4);
    };
    for (const auto& [user, groups] : prior)
        for (const auto& [name, state] : groups.dictionary()) {
            if (!person && name == uid.str()) {
                add(CXDDeleteGroup, user, {}, uid);
                continue;
            }
            for (const Value& element : state.dictionary()[person ? "memberUIDState" : "subgroupUIDState"].array()) {
                if (element.string() != uid.str()) continue;
                if (!person) {
                    add(CXDRemoveGroupFromGroup, user, uid, UniqueId(name));
                } else if (name == "AllCXGroup") {
                    add(CXDDeleteRecord, user, uid, {});
                    add(CXDRemoveDistributionListFromGroup, user, uid, UniqueId(name));
                    add(CXDRemoveRecordFromGroup, user, uid, UniqueId(name));
                } else {
                    add(CXDRemoveRecordFromGroup, user, uid, UniqueId(name));
                    add(CXDRemoveDistributionListFromGroup, user, uid, UniqueId(name));
                }
            }
        }
    return all;
}

} // namespace

TEST(Removal, OfAPersonInNoSharedGroupYieldsNothing) {
    EXPECT_EQ(lines(RemovalChanges({{"<self>", Dictionary{{"G:CXGroup", group({"Q:CXPerson"})}}}})
                        .changesToRemovePerson(kPerson)),
              Texts{});
    EXPECT_EQ(lines(RemovalChanges(Dictionary()).changesToRemovePerson(kPerson)), Texts{});
}

TEST(Removal, OfAPersonDeletesItFromTheWholePublicationAndTakesItOutOfEveryGroup) {
    const Dictionary prior{{"<self>", Dictionary{{"AllCXGroup", group({"P:CXPerson"})},
                                                 {"G:CXGroup", group({"Q:CXPerson", "P:CXPerson"})},
                                                 {"H:CXGroup", group({"Q:CXPerson"})}}}};
    const auto records = RemovalChanges(prior).changesToRemovePerson(kPerson);
    EXPECT_EQ(lines(records), (Texts{"260 <self> P:CXPerson - 4", "257 <self> P:CXPerson AllCXGroup 4",
                                     "258 <self> P:CXPerson AllCXGroup 4", "258 <self> P:CXPerson G:CXGroup 4",
                                     "257 <self> P:CXPerson G:CXGroup 4"}));
    for (const auto& record : records) {
        EXPECT_EQ(record->initialSource(), CXDSyncSourceCX);
        EXPECT_TRUE(record->payload().isAbsent());
    }
}

TEST(Removal, OfAPersonThatIsListedTwiceIsSaidTwice) {
    EXPECT_EQ(RemovalChanges({{"<self>", Dictionary{{"G:CXGroup", group({"P:CXPerson", "P:CXPerson"})}}}})
                  .changesToRemovePerson(kPerson)
                  .size(),
              4u);
}

TEST(Removal, OfAGroupDeletesItAndTakesItOutOfItsParents) {
    const Dictionary prior{{"bob", Dictionary{{"G:CXGroup", group({}, {"X:CXGroup"})}, {"X:CXGroup", group({})}}}};
    EXPECT_EQ(lines(RemovalChanges(prior).changesToRemoveGroup(kGroup)),
              (Texts{"259 bob X:CXGroup G:CXGroup 4", "261 bob - X:CXGroup 4"}));
}

TEST(Removal, OfAGroupUnderTwoUsersDeletesItUnderEach) {
    const Dictionary prior{{"<self>", Dictionary{{"X:CXGroup", group({})}}},
                           {"bob", Dictionary{{"X:CXGroup", group({})}}}};
    EXPECT_EQ(lines(RemovalChanges(prior).changesToRemoveGroup(kGroup)),
              (Texts{"261 <self> - X:CXGroup 4", "261 bob - X:CXGroup 4"}));
}

TEST(Removal, WithAndWithoutItsIndexIsWhatTheLiteralSearchFinds) {
    EXPECT_TRUE(rc::check([](bool many) {
        const auto uid = [](const char* table) {
            return rc::gen::map(rc::gen::inRange(0, 6),
                                [table](int n) { return std::string(1, static_cast<char>('A' + n)) + ":" + table; });
        };
        const auto few = [](auto gen) { return rc::gen::resize(6, rc::gen::container<std::vector<std::string>>(gen)); };
        const auto list = [](std::vector<std::string> from) {
            Array all;
            for (auto& text : from) all.append(std::move(text));
            return all;
        };
        Dictionary prior;
        for (const char* user : {"<self>", "bob", "eve"}) {
            if (!*rc::gen::arbitrary<bool>()) continue;
            Dictionary groups = prior.dictionaryFor(user);
            for (const std::string& name : *few(uid("CXGroup")))
                groups.set(name, group(list(*few(uid("CXPerson"))), list(*few(uid("CXGroup")))));
            if (*rc::gen::arbitrary<bool>()) groups.set("AllCXGroup", group(list(*few(uid("CXPerson")))));
        }
        const RemovalChanges removals(prior, many ? 1000 : 1);
        const UniqueId person(*uid("CXPerson")), deleted(*uid("CXGroup"));
        RC_ASSERT(lines(removals.changesToRemovePerson(person)) == lines(literally(prior, person, true)));
        RC_ASSERT(lines(removals.changesToRemoveGroup(deleted)) == lines(literally(prior, deleted, false)));
    }));
}
