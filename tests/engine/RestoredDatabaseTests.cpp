// A backup of the contact database is put back: with it comes the memory that it was copied with.

#include "TwoUsers.h"

namespace rolvane::test {

class Restored : public TwoUsers {
protected:
    // Nothing of the user's has the file open while the action runs.
    static void whileClosed(Participant& user, const std::function<void(const std::filesystem::path& file)>& action) {
        user.engine.reset();
        user.database.reset();
        user.application.reset();
        user.preferences.keepElsewhere(nullptr);
        const std::string file = user.directory / "contacts.db";
        action(file);
        user.preferences.keepElsewhere(daemonMemory(file));
        user.application = std::make_unique<CXRolvane>(
            CXRolvane::Options{.path = file, .program = "rolvane", .center = &user.applicationCenter});
        user.start();
    }
    void backUp(Participant& user) {
        whileClosed(user, [&](const auto& file) {
            std::filesystem::copy_file(file, backups / user.name, std::filesystem::copy_options::overwrite_existing);
        });
    }
    void restore(Participant& user) {
        whileClosed(user, [&](const auto& file) {
            std::filesystem::copy_file(backups / user.name, file, std::filesystem::copy_options::overwrite_existing);
        });
    }
    CXPersonRef again(const CXPersonRef& person) {
        return std::dynamic_pointer_cast<CXPerson>(alice.application->recordForUniqueId(person->uniqueId()));
    }
    void aliceChangesMuch() {
        again(people[0])->setValue(Value("Adelheid"), kCXFirstNameProperty);
        alice.application->removeRecord(again(people[1]));
        people.push_back(alice.add("Dora"));
        alice.group("Family", {people[3]});
        alice.application->save();
        alice.pass();
        alice.pass();
    }
    TempDirectory backups;
};

TEST_F(Restored, ASubscriberReadsAllThatCameSince) {
    bob.pass();
    bob.pass();
    backUp(bob);
    aliceChangesMuch();
    bob.pass();
    ASSERT_EQ(copies(), alice.view()) << log.text();
    restore(bob);
    ASSERT_NE(copies(), alice.view());
    bob.wire->clear();
    bob.pass();
    bob.pass();
    EXPECT_EQ(copies(), alice.view()) << log.text();
    EXPECT_EQ(bob.writes(), 0u) << bob.wire->text();
}

TEST_F(Restored, AnOwnerWithAWriterGetsBackWhatWasOnTheStore) {
    bob.pass();
    alice.pass();
    backUp(alice);
    aliceChangesMuch();
    bob.pass();
    const auto latest = alice.view();
    restore(alice);
    ASSERT_NE(alice.view(), latest);
    for (int round = 0; round < 2; ++round) {
        alice.pass();
        bob.pass();
    }
    EXPECT_EQ(alice.view(), latest) << log.text();
    EXPECT_EQ(copies(), latest);
}

TEST_F(Restored, AnEditThatWasNotSentThenIsSentNow) {
    bob.pass();
    alice.pass();
    again(people[0])->setValue(Value("Adelheid"), kCXFirstNameProperty);
    alice.application->save();
    backUp(alice);
    alice.pass();
    restore(alice);
    for (int round = 0; round < 2; ++round) {
        alice.pass();
        bob.pass();
    }
    EXPECT_EQ(firstName(again(people[0])), Value("Adelheid"));
    EXPECT_EQ(firstName(bob.copyOf(people[0])), Value("Adelheid")) << log.text();
    EXPECT_EQ(copies(), alice.view());
}

} // namespace rolvane::test
