// Versions on the store that dates cannot tell apart, and versions that must not be taken for somebody else's.

#include "TwoUsers.h"

namespace rolvane::test {

class Versions : public TwoUsers {};

TEST_F(Versions, AnEditDatedWithinTenSecondsOfTheLastSyncArrivesWithTheNextPass) {
    bob.pass();
    for (int64_t offset = -10; offset <= 10; ++offset) {
        const std::string name = "Offset " + std::to_string(offset);
        const auto lastSync = bob.preferences.get(kDaemonDomain, CXDVaultraConduit::kLastSyncDateKey).date();
        ASSERT_TRUE(lastSync);
        writeElsewhere(people[0], name);
        setDate(fileOf(people[0]), static_cast<int64_t>(lastSync->secondsSince1970()) + offset);
        bob.pass();
        EXPECT_EQ(firstName(bob.copyOf(people[0])), Value(name)) << log.text();
    }
}

TEST_F(Versions, AnEditThatReplacesOurOwnWithinItsSecondAndInItsSizeIsRead) {
    for (int round = 0; round < 3; ++round) {
        const std::string ours = "Ann" + std::to_string(round), theirs = "Eva" + std::to_string(round);
        people[1]->setValue(Value(ours), kCXFirstNameProperty);
        alice.application->save();
        alice.pass();
        ASSERT_EQ(contentOf(fileOf(people[1]))[kCXFirstNameProperty], Value(ours));
        const int64_t written = dateOf(fileOf(people[1]));
        const size_t size = textOf(fileOf(people[1])).size();
        writeElsewhere(people[1], theirs);
        ASSERT_EQ(textOf(fileOf(people[1])).size(), size);
        setDate(fileOf(people[1]), written);
        alice.pass();
        EXPECT_EQ(firstName(people[1]), Value(theirs)) << log.text();
        expectQuietPass(alice);
    }
}

TEST_F(Versions, AnOwnerReadsNothingBackWhatsoeverItHasWritten) {
    alice.pass();
    people[0]->setValue(Value("Adelheid"), kCXFirstNameProperty);
    people.push_back(alice.add("Dora"));
    friends->addMember(people[3]);
    friends->setValue(Value("Old friends"), kCXGroupNameProperty);
    alice.group("Family", {people[1]});
    alice.application->removeRecord(people[2]);
    alice.application->save();
    alice.wire->clear();
    alice.pass();
    EXPECT_EQ(alice.reads("People"), 2u) << "each before it was written over\n" << alice.wire->text();
    EXPECT_EQ(alice.wire->count("HEAD"), 1u) << "the clock file's\n" << alice.wire->text();
    expectQuietPass(alice);
    alice.start(); // with the memory of what it has written
    alice.pass();
    expectQuietPass(alice);
}

TEST_F(Versions, TheSecondPassAfterAnythingIsQuiet) {
    const std::vector<std::pair<const char*, std::function<void()>>> scenarios{
        {"the first pass", [] {}},
        {"an edit of the owner",
         [&] { people[0]->setValue(Value("Adelheid"), kCXFirstNameProperty), alice.application->save(); }},
        {"an edit of the subscriber",
         [&] { bob.copyOf(people[1])->setValue(Value("Benno"), kCXFirstNameProperty), bob.application->save(); }},
        {"a new contact and a new group",
         [&] {
             people.push_back(alice.add("Dora"));
             alice.group("Family", {people[3], people[1]});
         }},
        {"a member more and a new name",
         [&] {
             friends->addMember(people[1]);
             friends->setValue(Value("Old friends"), kCXGroupNameProperty);
             alice.application->save();
         }},
        {"edits on both sides",
         [&] {
             people[1]->setValue(Value("Bernd"), kCXFirstNameProperty), alice.application->save();
             bob.copyOf(people[0])->setValue(Value("Adda"), kCXFirstNameProperty), bob.application->save();
         }},
        {"removals", [&] {
             alice.application->removeRecord(people[2]);
             alice.application->removeRecord(friends);
             alice.application->save();
         }}};
    for (const auto& [what, happen] : scenarios) {
        SCOPED_TRACE(what);
        happen();
        for (Participant* each : {&bob, &alice, &bob, &alice}) each->pass();
        for (Participant* each : {&bob, &alice}) expectQuietPass(*each);
        EXPECT_EQ(copies(), alice.view());
    }
}

TEST_F(Versions, AContactFileThatIsNoContactIsReadOnceAndAgainWhenItChanges) {
    bob.pass();
    const std::string sound = textOf(fileOf(people[0]));
    rewrite(fileOf(people[0]), "<html>not a contact</html>");
    bob.pass();
    expectQuietPass(bob);
    EXPECT_EQ(copies(), alice.view()) << "the copy stays";
    rewrite(fileOf(people[0]), std::string("\x00\xff\xfe garbage", 11));
    bob.wire->clear();
    bob.pass();
    EXPECT_GT(bob.reads("People"), 0u);
    expectQuietPass(bob);
    rewrite(fileOf(people[0]), sound);
    writeElsewhere(people[0], "Adelheid");
    bob.pass();
    EXPECT_EQ(firstName(bob.copyOf(people[0])), Value("Adelheid")) << log.text();
}

} // namespace rolvane::test
