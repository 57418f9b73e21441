#include "contacts/records/ContactMerge.h"

#include "contacts/records/CXMerger.h"
#include "contacts/records/CXMultiValue.h"
#include "contacts/records/Constants.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <map>
#include <rapidcheck/gtest.h>

namespace rolvane {
namespace {

struct Line {
    const char *identifier, *label, *value;
};
Value phones(std::initializer_list<Line> lines) {
    CXMutableMultiValue all;
    for (const Line& line : lines) all.addValue(line.value, line.label, line.identifier);
    return all.toValue();
}
std::multiset<std::string> said(const Value& value) { // label and value, whatever the order and the identifiers
    std::multiset<std::string> all;
    const auto multi = CXMultiValue::fromValue(value);
    if (multi)
        for (const auto& entry : multi->entries()) all.insert(entry.label + "=" + entry.value.string());
    return all;
}
std::set<std::string> values(const Value& value) {
    std::set<std::string> all;
    const auto multi = CXMultiValue::fromValue(value);
    if (multi)
        for (const auto& entry : multi->entries()) all.insert(entry.value.string());
    return all;
}
using Said = std::multiset<std::string>;

TEST(ContactMerge, DifferentPropertiesAreBothKept) {
    const Dictionary base{{"First", "Ada"}, {"Note", "n"}};
    const Dictionary ours{{"First", "Ada"}, {"Note", "n"}, {"Nickname", "Countess"}};
    const Dictionary theirs{{"First", "Ada"}, {"Organization", "Engine"}};
    const auto result = mergedContact(base, ours, theirs, CXSide::ours);
    EXPECT_EQ(result.contact, (Dictionary{{"First", "Ada"}, {"Nickname", "Countess"}, {"Organization", "Engine"}}));
    EXPECT_TRUE(result.conflicts.empty());
}

TEST(ContactMerge, OfTwoValuesTheLaterIsKeptAndTheOtherIsAConflict) {
    const Dictionary base{{"First", "Ada"}}, ours{{"First", "Adah"}}, theirs{{"First", "Ada L."}};
    for (const CXSide later : {CXSide::ours, CXSide::theirs}) {
        const Dictionary& kept = later == CXSide::ours ? ours : theirs;
        const auto result = mergedContact(base, ours, theirs, later);
        EXPECT_EQ(result.contact, kept);
        ASSERT_EQ(result.conflicts.size(), 1u);
        EXPECT_EQ(result.conflicts[0], (CXMergeConflict{"First", kept, later == CXSide::ours ? theirs : ours, later}));
    }
}

TEST(ContactMerge, AValueThatOneRemovedAndTheOtherChangedIsAConflictToo) {
    const auto result = mergedContact(Dictionary{{"Note", "a"}}, {}, Dictionary{{"Note", "b"}}, CXSide::ours);
    EXPECT_TRUE(result.contact.empty());
    ASSERT_EQ(result.conflicts.size(), 1u);
    EXPECT_EQ(result.conflicts[0].lost, (Dictionary{{"Note", "b"}}));
    EXPECT_TRUE(result.conflicts[0].kept.empty());
}

TEST(ContactMerge, APhotoKeepsItsOwnType) {
    const auto photo = [](const char* content, const char* type) {
        Dictionary d{{kCXPhotoTypeProperty, type}};
        d.set(kCXPhotoProperty, content);
        return d;
    };
    const Dictionary ours = photo("p1", "image/png"), theirs = photo("p2", "image/jpeg");
    const auto result = mergedContact(photo("p0", "image/png"), ours, theirs, CXSide::ours);
    EXPECT_EQ(result.contact, ours);
    ASSERT_EQ(result.conflicts.size(), 1u);
    EXPECT_EQ(result.conflicts[0].lost, theirs);
}

TEST(ContactMerge, LabelledValuesMergeByValue) {
    const Value base = phones({{"a", "Work", "1"}, {"b", "Home", "2"}, {"c", "Fax", "3"}});
    const Value ours = phones({{"a", "Work", "11"}, {"b", "Home", "2"}, {"d", "Mobile", "4"}});
    const Value theirs = phones({{"a", "Work", "12"}, {"b", "Main", "2"}, {"c", "Fax", "3"}, {"e", "Mobile", "4"}});
    const auto result = mergedContact(Dictionary{{"Phone", base}}, Dictionary{{"Phone", ours}},
                                      Dictionary{{"Phone", theirs}}, CXSide::ours);
    EXPECT_EQ(said(result.contact["Phone"]), (Said{"Work=11", "Work=12", "Main=2", "Mobile=4"}));
    EXPECT_TRUE(result.conflicts.empty());
    EXPECT_EQ(CXMultiValue::fromValue(result.contact["Phone"])->valueForIdentifier("b"), Value("2"))
        << "choices that name the entry still do";
}

TEST(ContactMerge, ALabelAndAValueOfOneEntryMeet) {
    const auto result = mergedContact(Dictionary{{"Phone", phones({{"a", "Work", "1"}})}},
                                      Dictionary{{"Phone", phones({{"a", "Home", "1"}})}},
                                      Dictionary{{"Phone", phones({{"a", "Work", "2"}})}}, CXSide::theirs);
    EXPECT_EQ(said(result.contact["Phone"]), (Said{"Home=2"}));
}

TEST(ContactMerge, AnEntryThatOneRemovedAndTheOtherChangedStays) {
    const Dictionary base{{"Phone", phones({{"a", "Work", "1"}})}}, none,
        changed{{"Phone", phones({{"a", "Work", "2"}})}};
    EXPECT_EQ(said(mergedContact(base, none, changed, CXSide::ours).contact["Phone"]), (Said{"Work=2"}));
    EXPECT_EQ(said(mergedContact(base, changed, none, CXSide::theirs).contact["Phone"]), (Said{"Work=2"}));
    EXPECT_FALSE(mergedContact(base, none, base, CXSide::ours).contact.contains("Phone"));
}

TEST(ContactMerge, ListsAreMergedByElement) {
    const auto result = mergedContact(Dictionary{{"Categories", Array{"a", "b", "c"}}},
                                      Dictionary{{"Categories", Array{"b", "c", "x"}}},
                                      Dictionary{{"Categories", Array{"a", "c", "y"}}}, CXSide::ours);
    EXPECT_EQ(result.contact["Categories"], Value(Array{"c", "y", "x"}));
}

TEST(ContactMerge, PropertiesThatNobodyKnowsAreValuesToo) {
    const auto result = mergedContact(Dictionary{{"X-Shoe", 40}}, Dictionary{{"X-Shoe", 40}, {"First", "A"}},
                                      Dictionary{{"X-Shoe", 41}, {"X-Hat", true}}, CXSide::ours);
    EXPECT_EQ(result.contact, (Dictionary{{"First", "A"}, {"X-Hat", true}, {"X-Shoe", 41}}));
}

TEST(ContactMerge, TheLaterDateDecidesAndTheContentWhereThereIsNone) {
    const Dictionary a{{"First", "A"}}, b{{"First", "B"}};
    EXPECT_EQ(laterSide(Date(2), Date(1), a, b), CXSide::ours);
    EXPECT_EQ(laterSide(Date(1), Date(2), b, a), CXSide::theirs);
    for (const auto& date : {std::optional<Date>(), std::optional(Date(1))}) {
        EXPECT_EQ(laterSide(date, Date(1), a, b), CXSide::theirs);
        EXPECT_EQ(laterSide(Date(1), date, b, a), CXSide::ours) << "the same content, seen from the other side";
    }
}

// -- in general

// A contact as a map of independent facts: each is a single value, an entry of a multi-value or an element of a list.
// Two sides that change different facts must come out with all of it.
struct Facts {
    std::map<std::string, std::string> single;
    std::map<std::string, std::pair<std::string, std::string>> phone; // by identifier: label and value
    std::set<std::string> categories;

    Dictionary contact() const {
        Dictionary d;
        for (const auto& [name, value] : single) d.set(name, value);
        CXMutableMultiValue all;
        for (const auto& [id, entry] : phone) all.addValue(entry.second, entry.first, id);
        if (!all.empty()) d.set(kCXPhoneProperty, all.toValue());
        Array list;
        for (const std::string& each : categories) list.append(each);
        if (!list.empty()) d.set(kCXCategoriesProperty, list);
        return d;
    }
};

const std::vector<std::string> kSingles{"First", "Last", "Nickname", "Organization", "Note", "X-Unknown", "JobTitle"};
const std::vector<std::string> kIdentifiers{"p1", "p2", "p3", "p4", "p5"};
const std::vector<std::string> kCategories{"a", "b", "c", "d"};

// `apart`: no two entries of different identifiers say the same.
rc::Gen<Facts> anyFacts(bool apart = false) {
    return rc::gen::exec([apart] {
        Facts f;
        for (const auto& name : kSingles)
            if (*rc::gen::arbitrary<bool>()) f.single[name] = *rc::gen::element<std::string>("1", "2", "3");
        for (const auto& id : kIdentifiers)
            if (*rc::gen::arbitrary<bool>())
                f.phone[id] = {*rc::gen::element<std::string>("Home", "Work"),
                               *rc::gen::element<std::string>("1", "2", "3") + (apart ? id : "")};
        for (const auto& each : kCategories)
            if (*rc::gen::arbitrary<bool>()) f.categories.insert(each);
        return f;
    });
}

template <class Map, class Key>
void take(Map& to, const Map& from, const Key& key) {
    to.erase(key);
    if (const auto found = from.find(key); found != from.end()) to.insert(*found);
}

// What differs only in the order of entries and in identifiers is equal.
std::map<std::string, std::string> content(const Dictionary& contact) {
    std::map<std::string, std::string> all;
    for (const auto& [name, value] : contact) {
        if (const auto multi = CXMultiValue::fromValue(value)) {
            std::string text;
            const Said lines = said(value); // what is said twice is said
            for (auto line = lines.begin(); line != lines.end(); line = lines.upper_bound(*line)) text += *line + ";";
            if (!text.empty()) all[name] = text;
        } else if (const Array* list = value.arrayIf()) {
            std::set<std::string> sorted;
            for (const Value& each : *list) sorted.insert(each.string());
            for (const std::string& each : sorted) all[name] += each + ";";
        } else {
            all[name] = value.description();
        }
    }
    return all;
}

CXSide otherSide(CXSide side) {
    return side == CXSide::ours ? CXSide::theirs : CXSide::ours;
}

RC_GTEST_PROP(ContactMerge, ChangesOfDifferentFactsAreAllThere, ()) {
    const Facts base = *anyFacts(), ourWish = *anyFacts(), theirWish = *anyFacts();
    Facts ours = base, theirs = base, both = base;
    const auto share = [](const auto& names, const auto& change) {
        for (const auto& name : names) change(name, *rc::gen::arbitrary<bool>());
    };
    share(kSingles, [&](const auto& name, bool isOurs) {
        take((isOurs ? ours : theirs).single, (isOurs ? ourWish : theirWish).single, name);
        take(both.single, (isOurs ? ourWish : theirWish).single, name);
    });
    share(kIdentifiers, [&](const auto& id, bool isOurs) {
        take((isOurs ? ours : theirs).phone, (isOurs ? ourWish : theirWish).phone, id);
        take(both.phone, (isOurs ? ourWish : theirWish).phone, id);
    });
    share(kCategories, [&](const auto& each, bool isOurs) {
        take((isOurs ? ours : theirs).categories, (isOurs ? ourWish : theirWish).categories, each);
        take(both.categories, (isOurs ? ourWish : theirWish).categories, each);
    });
    // Entries are told apart by identifier; ones that say the same would be one addition of both.
    const auto isAmbiguous = [&](const Facts& side) {
        for (const auto& [id, entry] : side.phone)
            if (!base.phone.contains(id))
                for (const auto& [other, value] : (&side == &ours ? theirs : ours).phone)
                    if (other != id && value == entry) return true;
        for (const auto& [id, entry] : base.phone)
            if (!side.phone.contains(id))
                for (const auto& [other, value] : side.phone)
                    if (!base.phone.contains(other) && value == entry) return true;
        return false;
    };
    RC_PRE(!isAmbiguous(ours) && !isAmbiguous(theirs));
    const auto result = mergedContact(base.contact(), ours.contact(), theirs.contact(),
                                      *rc::gen::element(CXSide::ours, CXSide::theirs));
    RC_ASSERT(content(result.contact) == content(both.contact()));
    RC_ASSERT(result.conflicts.empty());
}

RC_GTEST_PROP(ContactMerge, WhoMergesMakesNoDifference, ()) {
    const Dictionary base = (*anyFacts()).contact(), ours = (*anyFacts()).contact(), theirs = (*anyFacts()).contact();
    const CXSide later = *rc::gen::element(CXSide::ours, CXSide::theirs);
    const auto here = mergedContact(base, ours, theirs, later),
               there = mergedContact(base, theirs, ours, otherSide(later));
    RC_ASSERT(content(here.contact) == content(there.contact));
    RC_ASSERT(here.conflicts.size() == there.conflicts.size());
}

RC_GTEST_PROP(ContactMerge, MergingAgainGivesTheSame, ()) {
    const Dictionary base = (*anyFacts(true)).contact(), ours = (*anyFacts(true)).contact(),
                     theirs = (*anyFacts(true)).contact();
    const CXSide later = *rc::gen::element(CXSide::ours, CXSide::theirs);
    const Dictionary once = mergedContact(base, ours, theirs, later).contact;
    // A pass that was killed behind its write meets its own result, which is younger than what it was made of.
    const auto again = mergedContact(base, ours, once, CXSide::theirs);
    RC_ASSERT(again.contact == once);
    RC_ASSERT(mergedContact(ours, ours, once, later).contact == once);
    RC_ASSERT(mergedContact(once, once, once, later).contact == once);
}

RC_GTEST_PROP(ContactMerge, NothingThatEitherSideSaysIsLostUnlessItIsAConflict, ()) {
    const Dictionary ours = (*anyFacts()).contact(), theirs = (*anyFacts()).contact();
    const bool hasBase = *rc::gen::arbitrary<bool>();
    const Dictionary base = hasBase ? (*anyFacts()).contact() : Dictionary();
    const auto result = mergedContact(hasBase ? std::optional(base) : std::nullopt, ours, theirs, CXSide::ours);
    for (const Dictionary& side : {ours, theirs})
        for (const auto& [name, value] : side) {
            if (value == base[name]) continue; // not this side's change
            if (CXMultiValue::isMultiValue(value)) {
                const auto before = values(base[name]), now = values(result.contact[name]);
                for (const std::string& each : values(value)) RC_ASSERT(before.contains(each) || now.contains(each));
            } else if (!value.isArray() && result.contact[name] != value) {
                RC_ASSERT(std::any_of(result.conflicts.begin(), result.conflicts.end(), [&](const auto& conflict) {
                    return conflict.property == name && conflict.lost[name] == value;
                }));
            }
        }
}

// A version that was sent and came, or did not come.
RC_GTEST_PROP(ContactMerge, OwnVersionsThatMayHaveComeAreNobodyElsesChanges, ()) {
    const Dictionary base = (*anyFacts()).contact(), sent = (*anyFacts()).contact(), ours = (*anyFacts()).contact();
    const CXSide later = *rc::gen::element(CXSide::ours, CXSide::theirs);
    RC_ASSERT(content(cxBaseAfterSending(base, sent, sent)) == content(sent));
    RC_ASSERT(content(cxBaseAfterSending(base, sent, base)) == content(base));
    for (const Dictionary& theirs : {sent, base}) {
        const auto result = mergedContact(cxBaseAfterSending(base, sent, theirs), ours, theirs, later);
        RC_ASSERT(content(result.contact) == content(ours));
        RC_ASSERT(result.conflicts.empty());
    }
}

// Somebody else has changed a version that came: that is a change, and our removal of what came is one, too.
TEST(ContactMerge, OfAVersionThatCameTheOthersChangesAreTold) {
    Facts base, sent, ours, theirs;
    base.phone = {{"a", {"home", "1"}}, {"b", {"home", "2"}}};
    sent.phone = {{"a", {"home", "11"}}, {"b", {"home", "2"}}, {"c", {"home", "3"}}};
    theirs.phone = {{"a", {"home", "11"}}, {"b", {"home", "22"}}, {"c", {"home", "3"}}};
    ours.phone = {{"b", {"home", "2"}}};
    Facts all;
    all.phone = {{"b", {"home", "22"}}};
    const Dictionary common = cxBaseAfterSending(base.contact(), sent.contact(), theirs.contact());
    const auto result = mergedContact(common, ours.contact(), theirs.contact(), CXSide::theirs);
    EXPECT_EQ(content(result.contact), content(all.contact()));
    EXPECT_TRUE(result.conflicts.empty());
}

TEST(ContactMerge, AnEntryThatCameTellsThatAllOfItsVersionCame) {
    Facts base, sent, ours, theirs;
    base.phone = {{"a", {"home", "1"}}};
    sent.phone = {{"a", {"home", "11"}}, {"b", {"home", "2"}}};
    ours.phone = sent.phone;
    theirs.phone = {{"b", {"home", "2"}}}; // they have seen 11, and removed it
    const Dictionary common = cxBaseAfterSending(base.contact(), sent.contact(), theirs.contact());
    EXPECT_EQ(content(common), content(sent.contact()));
    const auto result = mergedContact(common, ours.contact(), theirs.contact(), CXSide::ours);
    EXPECT_EQ(content(result.contact), content(theirs.contact()));
}

TEST(ContactMerge, AnEntryThatCameAndWasChangedThereDoesNotStandBesideItself) {
    Facts base, sent, theirs;
    base.phone = {{"a", {"home", "1"}}};
    sent.phone = {{"a", {"home", "1"}}, {"b", {"home", "2"}}};
    theirs.phone = {{"a", {"home", "1"}}, {"b", {"work", "22"}}};
    const Dictionary common = cxBaseAfterSending(base.contact(), sent.contact(), theirs.contact());
    for (const CXSide later : {CXSide::ours, CXSide::theirs}) {
        const auto result = mergedContact(common, sent.contact(), theirs.contact(), later);
        EXPECT_EQ(content(result.contact), content(theirs.contact()));
        EXPECT_TRUE(result.conflicts.empty());
    }
}

// They have seen 11 and the new entry, removed the one and changed the other.
TEST(ContactMerge, AnEntryThatCameAndWasChangedThereTellsThatAllOfItsVersionCame) {
    Facts base, sent, ours, theirs;
    base.phone = {{"a", {"home", "1"}}};
    sent.phone = {{"a", {"home", "11"}}, {"b", {"home", "2"}}};
    ours.phone = sent.phone;
    theirs.phone = {{"b", {"home", "22"}}};
    const Dictionary common = cxBaseAfterSending(base.contact(), sent.contact(), theirs.contact());
    EXPECT_EQ(content(common), content(sent.contact()));
    const auto result = mergedContact(common, ours.contact(), theirs.contact(), CXSide::ours);
    EXPECT_EQ(content(result.contact), content(theirs.contact()));
}

TEST(ContactMerge, OfASingleValueThatMayHaveComeTheOthersStandsAndItIsAConflict) {
    const Dictionary base{{kCXFirstNameProperty, "0"}}, sent{{kCXFirstNameProperty, "1"}},
        theirs{{kCXFirstNameProperty, "2"}};
    const Dictionary common = cxBaseAfterSending(base, sent, theirs);
    CXMergeResult result = mergedContact(common, sent, theirs, CXSide::ours);
    cxYieldWhatWasSent(result, sent);
    EXPECT_EQ(result.contact, theirs);
    ASSERT_EQ(result.conflicts.size(), 1u);
    EXPECT_EQ(result.conflicts[0], (CXMergeConflict{kCXFirstNameProperty, theirs, sent, CXSide::theirs}));
    // Edited once more since, it is later than anything that they have seen.
    const Dictionary ours{{kCXFirstNameProperty, "3"}};
    CXMergeResult later = mergedContact(common, ours, theirs, CXSide::ours);
    cxYieldWhatWasSent(later, sent);
    EXPECT_EQ(later.contact, ours);
    EXPECT_EQ(later.conflicts[0].winner, CXSide::ours);
}

// Without a base the result holds what the merging of two cards holds.
RC_GTEST_PROP(ContactMerge, WithoutABaseNoValueIsLost, ()) {
    const Dictionary ours = (*anyFacts()).contact(), theirs = (*anyFacts()).contact();
    const auto cards = content(CXMerger::merged(theirs, ours));
    RC_ASSERT(content(mergedContact(std::nullopt, ours, theirs, CXSide::ours).contact) == cards);
}

} // namespace
} // namespace rolvane
