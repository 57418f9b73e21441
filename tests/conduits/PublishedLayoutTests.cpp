#include "conduits/PublishedLayout.h"

#include "contacts/records/Constants.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <rapidcheck.h>
#include <set>

using namespace rolvane;

namespace {
const Url kBase("http://store.example/ada/Contacts");
}

TEST(PublishedLayout, PutsAContactIntoTheBucketOfItsIdentifier) {
    EXPECT_EQ(layout::contactLocation(kBase, UniqueId("abc")).absoluteString(),
              "http://store.example/ada/Contacts/People/16/abc");
}

TEST(PublishedLayout, NamesTheFilesOfAGroupBelowTheGroupsOwnPath) {
    const UniqueId group("G");
    EXPECT_EQ(layout::groupLocation(kBase, group).absoluteString(), "http://store.example/ada/Contacts/G");
    EXPECT_EQ(layout::groupInfoLocation(kBase, group).absoluteString(), "http://store.example/ada/Contacts/G/info");
    EXPECT_EQ(layout::memberMarkerLocation(kBase, group, UniqueId("P")).absoluteString(),
              "http://store.example/ada/Contacts/G/P");
    EXPECT_EQ(layout::dateFileLocation(kBase).absoluteString(), "http://store.example/ada/Contacts/dateFile");
}

TEST(PublishedLayout, AnIdentifierNeverLeavesItsFolder) {
    EXPECT_EQ(layout::groupLocation(kBase, UniqueId("../eve/x")).absoluteString().find("/../"), std::string::npos);
}

TEST(PublishedLayout, SpecialFilesAreNamedExactly) {
    for (const char* name : {"dateFile", "info", "Contacts"}) EXPECT_TRUE(layout::isASpecialFile(name)) << name;
    for (const char* name : {"Info", "datefile", "contacts", "People", "info ", ""})
        EXPECT_FALSE(layout::isASpecialFile(name)) << name;
}

TEST(CompositeChange, OfAMissingStateMakesOne) {
    const Dictionary state =
        layout::groupStateAfterComposite({}, {{"memberAdds", Array{"a", "b"}},
                                              {"subgroupAdds", Array{"g"}},
                                              {kCXGroupNameProperty, "Friends"},
                                              {"distributionListAdds", Dictionary{{"a", Dictionary{{"Email", "1"}}}}}});
    EXPECT_EQ(Value(state),
              Value(Dictionary{{"memberUIDState", Array{"a", "b"}},
                               {"subgroupUIDState", Array{"g"}},
                               {kCXGroupNameProperty, "Friends"},
                               {"distributionListState", Dictionary{{"a", Dictionary{{"Email", "1"}}}}}}));
}

TEST(CompositeChange, AddsAMemberOnceHoweverOftenItIsListed) {
    const Dictionary before{{"memberUIDState", Array{"a"}}};
    EXPECT_EQ(layout::groupStateAfterComposite(before, {{"memberAdds", Array{"b", "a", "b"}}})["memberUIDState"],
              Value(Array{"a", "b"}));
    EXPECT_EQ(Value(before), Value(Dictionary{{"memberUIDState", Array{"a"}}})) << "the state that was read is changed";
}

TEST(CompositeChange, RemovesEveryOccurrence) {
    EXPECT_EQ(layout::groupStateAfterComposite({{"memberUIDState", Array{"a", "b", "a"}}},
                                               {{"memberRemoves", Array{"a"}}})["memberUIDState"],
              Value(Array{"b"}));
}

TEST(CompositeChange, RemovesAfterItHasAdded) {
    const Dictionary state =
        layout::groupStateAfterComposite({}, {{"memberAdds", Array{"a"}},
                                              {"memberRemoves", Array{"a"}},
                                              {"distributionListAdds", Dictionary{{"a", Dictionary()}}},
                                              {"distributionListRemoves", Array{"a", "a"}}});
    EXPECT_EQ(state["memberUIDState"], Value(Array{}));
    EXPECT_EQ(state["distributionListState"], Value(Dictionary{}));
}

TEST(CompositeChange, KeepsTheNameUnlessThePayloadHasOne) {
    EXPECT_EQ(layout::groupStateAfterComposite({{kCXGroupNameProperty, "Old"}}, {})[kCXGroupNameProperty],
              Value("Old"));
    EXPECT_EQ(layout::groupStateAfterComposite({{kCXGroupNameProperty, "Old"}},
                                               {{kCXGroupNameProperty, "New"}})[kCXGroupNameProperty],
              Value("New"));
}

TEST(CompositeChange, TakesPartsOfAnotherKindAsEmpty) {
    EXPECT_EQ(Value(layout::groupStateAfterComposite({{"memberUIDState", "text"}, {"distributionListState", Array{}}},
                                                     {{"memberAdds", 7}, {"subgroupAdds", Dictionary()}})),
              Value(Dictionary{{"memberUIDState", Array{}},
                               {"subgroupUIDState", Array{}},
                               {"distributionListState", Dictionary{}}}));
}

TEST(CompositeChange, KeepsWhatItDoesNotKnow) {
    EXPECT_EQ(layout::groupStateAfterComposite({{"else", 1}}, {})["else"], Value(1));
}

TEST(CompositeChange, IsWhatAddingAndRemovingOneByOneGives) {
    EXPECT_TRUE(rc::check(
        [](const std::vector<uint8_t>& held, const std::vector<uint8_t>& adds, const std::vector<uint8_t>& removes) {
            const auto name = [](uint8_t n) { return "m" + std::to_string(n % 12); };
            const auto array = [&](const std::vector<uint8_t>& from) {
                Array all;
                for (uint8_t n : from) all.append(name(n));
                return all;
            };
            std::vector<std::string> expected;
            for (uint8_t n : held) expected.push_back(name(n));
            for (uint8_t n : adds)
                if (std::find(expected.begin(), expected.end(), name(n)) == expected.end()) expected.push_back(name(n));
            for (uint8_t n : removes) std::erase(expected, name(n));
            Array wanted;
            for (const auto& member : expected) wanted.append(member);
            RC_ASSERT(layout::groupStateAfterComposite(
                          {{"subgroupUIDState", array(held)}},
                          {{"subgroupAdds", array(adds)}, {"subgroupRemoves", array(removes)}})["subgroupUIDState"] ==
                      Value(wanted));
        }));
}

TEST(Rename, WritesTheNameAndDropsEveryOtherKey) {
    EXPECT_EQ(Value(layout::infoAfterRename("New")), Value(Dictionary{{kCXGroupNameProperty, "New"}}));
}
