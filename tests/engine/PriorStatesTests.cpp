#include "engine/memory/PriorStates.h"

#include "Records.h"
#include "contacts/records/Identifier.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <map>
#include <optional>
#include <rapidcheck/gtest.h>

namespace rolvane {
namespace {

using test::makeRecord;

Dictionary groupState(const Dictionary& data, const char* conduit, const char* user, const char* group) {
    return data[conduit].dictionary()["priorState"].dictionary()[user].dictionary()[group].dictionary();
}

bool hasGroup(const Dictionary& data, const char* conduit, const char* user, const char* group) {
    return data[conduit].dictionary()["priorState"].dictionary()[user].dictionary().contains(group);
}

// The folding as it reads, over plain containers.
struct LiteralGroup {
    std::optional<std::vector<std::string>> members, subgroups, readers, writers;
    std::optional<std::map<std::string, Value>> distribution;
    Value name;

    Dictionary asDictionary() const {
        Dictionary d;
        const auto put = [&](const char* key, const std::optional<std::vector<std::string>>& list) {
            if (!list) return;
            Array a;
            for (const std::string& s : *list) a.append(s);
            d.set(key, a);
        };
        put("memberUIDState", members);
        put("subgroupUIDState", subgroups);
        put("ReadSharingACL", readers);
        put("ReadWriteSharingACL", writers);
        if (distribution) {
            Dictionary values;
            for (const auto& [key, value] : *distribution) values.set(key, value);
            d.set("distributionListState", values);
        }
        if (name) d.set("GroupName", name);
        return d;
    }
};

class LiteralCache {
public:
    std::map<std::string, std::map<std::string, LiteralGroup>> users; // of one conduit
    void fold(const CXDChangeRecord& r) {
        if (!r.user()) return;
        auto& groups = users[r.user()->str()];
        if (!r.group()) return;
        const std::string g = cxUIDWithTableName(*r.group(), "CXGroup").str();
        const bool sub = r.type() == 6 || r.type() == 259;
        std::optional<std::string> p;
        if (r.person()) p = cxUIDWithTableName(*r.person(), sub ? "CXGroup" : "CXPerson").str();
        const Value payload = r.inMemoryPayload();
        switch (r.type()) {
        case 2:
        case 4:
        case 5:
        case 6: structure(made(groups, g), r.type(), p, payload); break;
        case 3: composite(made(groups, g), payload.dictionary()); break;
        case 258:
            if (groups.count(g) && p && groups[g].members) std::erase(*groups[g].members, *p);
            break;
        case 259:
            if (groups.count(g) && p && groups[g].subgroups) std::erase(*groups[g].subgroups, *p);
            break;
        case 9:
            if (!groups.count(g)) break;
            if (!groups[g].distribution) groups[g].distribution.emplace();
            if (p && payload) (*groups[g].distribution)[*p] = payload;
            break;
        case 261: groups.erase(g); break;
        case 7:
        case 8: {
            if (!groups.count(g)) break;
            auto& list = r.type() == 7 ? groups[g].readers : groups[g].writers;
            if (!list) list.emplace();
            change(*list, payload.dictionary()["additions"].array(), payload.dictionary()["deletions"].array());
            break;
        }
        default: break;
        }
    }

private:
    static LiteralGroup& made(std::map<std::string, LiteralGroup>& groups, const std::string& g) {
        LiteralGroup& group = groups[g];
        if (!group.members) group.members.emplace();
        if (!group.subgroups) group.subgroups.emplace();
        return group;
    }
    static void once(std::vector<std::string>& list, const std::string& s) {
        if (std::find(list.begin(), list.end(), s) == list.end()) list.push_back(s);
    }
    static void change(std::vector<std::string>& list, const Array& adds, const Array& removes) {
        for (const Value& v : adds) list.push_back(v.string());
        for (const Value& v : removes) std::erase(list, v.string());
    }
    static void structure(LiteralGroup& group, int32_t type, const std::optional<std::string>& p,
                          const Value& payload) {
        if (type == 6) {
            if (p) once(*group.subgroups, *p);
            return;
        }
        if (type == 2 && payload.dictionary().contains("GroupName")) group.name = payload.dictionary()["GroupName"];
        if (p)
            once(*group.members, *p);
        else if (type == 4 && payload)
            group.name = payload;
    }
    static void composite(LiteralGroup& group, const Dictionary& payload) {
        if (!group.distribution) group.distribution.emplace();
        change(*group.members, payload["memberAdds"].array(), payload["memberRemoves"].array());
        change(*group.subgroups, payload["subgroupAdds"].array(), payload["subgroupRemoves"].array());
        for (const auto& [key, value] : payload["distributionListAdds"].dictionary())
            (*group.distribution)[key] = value;
        for (const Value& key : payload["distributionListRemoves"].array()) group.distribution->erase(key.string());
        if (payload.contains("GroupName")) group.name = payload["GroupName"];
    }
};

Array someOf(std::initializer_list<const char*> all) {
    Array chosen;
    for (const char* each : all)
        if (*rc::gen::arbitrary<bool>()) chosen.append(each);
    return chosen;
}

CXDChangeRecordPtr arbitraryApplied() {
    const int32_t type = *rc::gen::elementOf(std::vector<int32_t>{1, 2, 3, 4, 5, 6, 7, 8, 9, 257, 258, 259, 260, 261});
    Value payload;
    if (type == 3)
        payload = Dictionary{{"memberAdds", someOf({"P1:CXPerson", "P2:CXPerson"})},
                             {"memberRemoves", someOf({"P1:CXPerson", "P2:CXPerson"})},
                             {"subgroupAdds", someOf({"G2:CXGroup"})},
                             {"distributionListAdds", Dictionary{{"P1:CXPerson", "home"}}},
                             {"distributionListRemoves", someOf({"P1:CXPerson", "P2:CXPerson"})}};
    if (type == 7 || type == 8)
        payload = Dictionary{{"additions", someOf({"ann", "bob"})}, {"deletions", someOf({"ann", "bob"})}};
    if (type == 4 || type == 9) payload = *rc::gen::elementOf(std::vector<std::string>{"one", "two"});
    if (type == 2 && *rc::gen::arbitrary<bool>()) payload = Dictionary{{"GroupName", "three"}};
    const auto* person = *rc::gen::elementOf(
        std::vector<const char*>{nullptr, "P1:CXPerson", "P2:CXSubscribedPerson", "G2:CXSubscribedGroup"});
    const auto* group =
        *rc::gen::elementOf(std::vector<const char*>{nullptr, "G1:CXGroup", "G1:CXSubscribedGroup", "AllCXGroup"});
    const auto* user = *rc::gen::elementOf(std::vector<const char*>{nullptr, "<self>", "ann"});
    return makeRecord(type, person, group, {4, 4, user}, payload);
}

RC_GTEST_PROP(PriorStates, FoldsAsTheLiteralCacheDoes, ()) {
    Dictionary data;
    LiteralCache literal;
    const int count = *rc::gen::inRange(0, 60);
    for (int i = 0; i < count; ++i) {
        const CXDChangeRecordPtr record = arbitraryApplied();
        didApplyChange(data, *record, CXDSyncSourceVaultra);
        literal.fold(*record);
    }
    Dictionary expected;
    for (const auto& [user, groups] : literal.users) {
        Dictionary states;
        for (const auto& [group, state] : groups) states.set(group, state.asDictionary());
        expected.set(user, states);
    }
    const Value got = data["CXDVaultra"].dictionary()["priorState"];
    RC_ASSERT(got.dictionary() == expected);
}

TEST(PriorStates, ARecordFromTheContactDatabaseUpdatesBothSources) {
    Dictionary data;
    didApplyChange(data, *makeRecord(CXDAddRecordToGroup, "P1:CXPerson", "G1:CXGroup"), CXDSyncSourceVaultra);
    for (const char* conduit : {"CXDVaultra", "CXDCX"})
        EXPECT_EQ(groupState(data, conduit, "<self>", "G1:CXGroup")["memberUIDState"], Value(Array{"P1:CXPerson"}));
}

TEST(PriorStates, ARecordAppliedToItsInitialSourceUpdatesItOnce) {
    Dictionary data;
    didApplyChange(data,
                   *makeRecord(CXDCompositeGroupChange, nullptr, "G1:CXGroup", {4, 4, "<self>"},
                               Dictionary{{"memberAdds", Array{"P1:CXPerson"}}}),
                   CXDSyncSourceVaultra);
    EXPECT_EQ(groupState(data, "CXDVaultra", "<self>", "G1:CXGroup")["memberUIDState"].array().count(), 1u);
}

TEST(PriorStates, ThePendingSourceAndSourcesWithoutAConduitChangeNothing) {
    for (const int32_t source : {0, 8, 16, 5}) {
        Dictionary data;
        updateCache(data, source, *makeRecord(CXDAddRecordToGroup, "P1:CXPerson", "G1:CXGroup"));
        EXPECT_TRUE(data.empty()) << source;
    }
}

TEST(PriorStates, AMemberAddedByTwoCompositesIsListedTwiceAndByTwoAdditionsOnce) {
    Dictionary data;
    const Dictionary adds{{"memberAdds", Array{"P1:CXPerson"}}};
    for (int i = 0; i < 2; ++i) {
        updateCache(data, 4, *makeRecord(CXDCompositeGroupChange, nullptr, "G1:CXGroup", {}, adds));
        updateCache(data, 4, *makeRecord(CXDAddRecordToGroup, "P2:CXPerson", "G1:CXGroup"));
    }
    EXPECT_EQ(groupState(data, "CXDVaultra", "<self>", "G1:CXGroup")["memberUIDState"],
              Value(Array{"P1:CXPerson", "P2:CXPerson", "P1:CXPerson"}));
}

TEST(PriorStates, RemovingFromAGroupWithoutStateCreatesNothing) {
    Dictionary data;
    for (const int32_t type : {258, 259, 9, 7, 8}) {
        updateCache(data, 4, *makeRecord(type, "P1:CXPerson", "G1:CXGroup", {}, "payload"));
        EXPECT_FALSE(hasGroup(data, "CXDVaultra", "<self>", "G1:CXGroup")) << type;
    }
}

TEST(PriorStates, IdentifiersAreNormalisedAndTheSubgroupsAsGroups) {
    Dictionary data;
    updateCache(data, 4, *makeRecord(CXDAddGroupToGroup, "G2:CXSubscribedGroup", "AllCXSubscribedGroup"));
    updateCache(data, 4, *makeRecord(CXDAddRecordToGroup, "P1:CXSubscribedPerson", "AllCXSubscribedGroup"));
    const Dictionary state = groupState(data, "CXDVaultra", "<self>", "AllCXGroup");
    EXPECT_EQ(state["subgroupUIDState"], Value(Array{"G2:CXGroup"}));
    EXPECT_EQ(state["memberUIDState"], Value(Array{"P1:CXPerson"}));
}

TEST(PriorStates, ADeletedGroupIsForgotten) {
    Dictionary data;
    updateCache(data, 4, *makeRecord(CXDCreateStructureForGroup, nullptr, "G1:CXGroup"));
    EXPECT_TRUE(hasGroup(data, "CXDVaultra", "<self>", "G1:CXGroup"));
    updateCache(data, 4, *makeRecord(CXDDeleteGroup, nullptr, "G1:CXGroup"));
    EXPECT_FALSE(hasGroup(data, "CXDVaultra", "<self>", "G1:CXGroup"));
}

Dictionary publishedAt(std::initializer_list<const char*> conduits, const char* user) {
    Dictionary data;
    for (const char* conduit : conduits)
        data.dictionaryFor(conduit).dictionaryFor("priorState").dictionaryFor(user).dictionaryFor("G1:CXGroup");
    return data;
}

TEST(PriorStates, SourcesOfAGroupAreTheStoresThatHoldIt) {
    const UniqueId group("G1:CXGroup");
    EXPECT_EQ(sourcesForGUID({}, group), 0);
    EXPECT_EQ(sourcesForGUID(publishedAt({"CXDVaultra", "CXDLocal"}, "ann"), group), 6);
    EXPECT_EQ(sourcesForGUID(publishedAt({"CXDCX"}, "<self>"), group), 0);
    EXPECT_EQ(sourcesForGUID(publishedAt({"CXDVaultra"}, "<self>"), UniqueId("G2:CXGroup")), 0);
    const Dictionary odd{{"CXDVaultra", Dictionary{{"priorState", "damaged"}}}, {"subscriptionMap", "damaged"}};
    EXPECT_EQ(sourcesForGUID(odd, group), 0) << "a damaged entry is nobody's";
}

TEST(PriorStates, AGroupIsLookedForWithEveryUserOfASource) {
    const UniqueId group("G2:CXGroup");
    for (const char* holder : {"ann", "bob", "eve"}) {
        Dictionary data;
        for (const char* user : {"ann", "bob", "eve"}) {
            Dictionary groups = data.dictionaryFor("CXDVaultra").dictionaryFor("priorState").dictionaryFor(user);
            groups.dictionaryFor("G1:CXGroup");
            if (std::string(user) == holder) groups.dictionaryFor(group.str());
        }
        EXPECT_EQ(sourcesForGUID(data, group), 4) << holder;
    }
    Dictionary both = publishedAt({"CXDVaultra"}, "ann");
    both.dictionaryFor("CXDVaultra").dictionaryFor("priorState").dictionaryFor("bob").dictionaryFor("G1:CXGroup");
    EXPECT_EQ(sourcesForGUID(both, UniqueId("G1:CXGroup")), 4) << "with two users, once";
}

TEST(PriorStates, AGroupIsPublishedWhenTheOwnersStateHasIt) {
    EXPECT_TRUE(isGUIDPublished(publishedAt({"CXDCX"}, "<self>"), UniqueId("G1:CXGroup")));
    EXPECT_FALSE(isGUIDPublished(publishedAt({"CXDVaultra"}, "ann"), UniqueId("G1:CXGroup")));
}

TEST(PriorStates, ARemovedGroupLeavesEveryUserOfEveryConduit) {
    Dictionary data = publishedAt({"CXDCX", "CXDVaultra"}, "<self>");
    data.addEntriesFrom(publishedAt({"CXDLocal"}, "ann"));
    removeGUID(data, UniqueId("G1:CXGroup"));
    EXPECT_FALSE(hasGroup(data, "CXDCX", "<self>", "G1:CXGroup"));
    EXPECT_FALSE(hasGroup(data, "CXDVaultra", "<self>", "G1:CXGroup"));
    EXPECT_FALSE(hasGroup(data, "CXDLocal", "ann", "G1:CXGroup"));
}

} // namespace
} // namespace rolvane
