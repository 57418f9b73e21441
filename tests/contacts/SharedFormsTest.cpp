#include "TestDatabase.h"

#include "contacts/database/SharedForms.h"

#include <rapidcheck/gtest.h>

namespace rolvane::test {
namespace {

// Those whose text is the very text of an element of the list.
size_t sharing(const std::vector<UniqueId>& people, const Array& known) {
    std::set<const std::string*> texts;
    for (const Value& element : known)
        if (const std::string* text = element.stringIf()) texts.insert(text);
    size_t count = 0;
    for (const UniqueId& person : people) count += texts.contains(&person.str()) ? 1 : 0;
    return count;
}

Array listOf(int first, int last) {
    Array known;
    for (int i = first; i < last; i++) known.append("P" + std::to_string(i) + ":CXPerson");
    return known;
}

std::vector<UniqueId> copies(int first, int last) {
    std::vector<UniqueId> people;
    for (int i = first; i < last; i++) people.emplace_back("P" + std::to_string(i) + ":CXSubscribedPerson");
    return people;
}

TEST(SharedForms, MakeNoTextForThoseWhoWereThereBefore) {
    const Array known = listOf(0, 100);
    EXPECT_EQ(sharing(SharedForms(known).of(copies(0, 100)), known), 100u);
}

TEST(SharedForms, FindTheRestBehindALongGapAndBehindNewPeople) {
    const Array known = listOf(0, 200);
    std::vector<UniqueId> people = copies(50, 150);
    people.insert(people.begin() + 10, UniqueId("New:CXSubscribedPerson"));
    EXPECT_EQ(sharing(SharedForms(known).of(people), known), 100u);
}

TEST(SharedForms, OfAllContactsGroupsShareTheTextsSavedOrNot) {
    TestDatabase d;
    const RemoteLocation bob("http://s/bob/Contacts");
    d->addRecord(CXSubscription::create(bob));
    for (int i = 0; i < 10; i++) d.addSubscribedPerson("S" + std::to_string(i), bob.str());
    for (int i = 0; i < 10; i++) d.addPerson("P" + std::to_string(i));
    for (bool saved : {false, true}) {
        if (saved) d->save();
        for (const CXGroupRef& all : {CXGroupRef(d->allGroup()), CXGroupRef(d->allGroupForRemoteLocation(bob))}) {
            std::vector<UniqueId> expected = all->memberUniqueIds();
            ASSERT_EQ(expected.size(), 10u);
            EXPECT_EQ(all->memberCount(), 10u);
            Array known;
            for (UniqueId& uid : expected) known.append(std::string((uid = cxNormalizedUID(uid)).str()));
            EXPECT_EQ(all->memberIdentifiers(), expected);
            EXPECT_EQ(all->memberIdentifiersLike(known), expected);
            EXPECT_EQ(sharing(all->memberIdentifiersLike(known), known), 10u) << "saved: " << saved;
        }
    }
}

UniqueId addedTo(const CXGroupRef& group, const CXPersonRef& person) {
    group->addMember(person);
    return person->uniqueId();
}

TEST(SharedForms, OfAGroupShareTheTexts) {
    TestDatabase d;
    CXGroupRef friends = d.addGroup("Friends");
    const UniqueId theirs = cxNormalizedUID(addedTo(friends, d.addSubscribedPerson("T", "http://s/bob/Contacts")));
    const UniqueId own = addedTo(friends, d.addPerson("A"));
    const Array known{"other:CXPerson", std::string(theirs.str()), 7, std::string(own.str())};
    EXPECT_EQ(friends->memberIdentifiersLike(known), (std::vector{theirs, own}));
    EXPECT_EQ(sharing(friends->memberIdentifiersLike(known), known), 2u);
}

RC_GTEST_PROP(SharedForms, AreWhatNormalizingGivesWhateverIsKnown, ()) {
    const auto uid = rc::gen::map(rc::gen::tuple(rc::gen::inRange(0, 12), rc::gen::inRange(0, 5)), [](const auto& of) {
        const auto& [number, table] = of;
        constexpr const char* kTables[] = {":CXPerson", ":CXSubscribedPerson", "", ":CXSubscribedPerson:CXPerson",
                                           "CXSubscribedPerson"};
        return (number == 0 ? "" : std::to_string(number)) + kTables[table];
    });
    const auto people = *rc::gen::container<std::vector<std::string>>(uid);
    Array known;
    for (const std::string& text : *rc::gen::container<std::vector<std::string>>(uid)) known.append(text);
    if (*rc::gen::arbitrary<bool>()) known.append(7);
    std::vector<UniqueId> uids, expected;
    for (const std::string& person : people) {
        uids.emplace_back(person);
        expected.push_back(cxNormalizedUID(uids.back()));
    }
    RC_ASSERT(SharedForms(known).of(uids) == expected);
    SharedForms single(known);
    for (size_t i = 0; i < people.size(); i++) RC_ASSERT(single.of(std::string_view(people[i])) == expected[i]);
}

} // namespace
} // namespace rolvane::test
