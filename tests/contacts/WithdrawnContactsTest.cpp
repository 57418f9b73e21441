#include "contacts/database/WithdrawnContacts.h"

#include "contacts/records/Constants.h"
#include "contacts/vcard/VCardImport.h"
#include "foundation/CXException.h"
#include "support/TempHome.h"

#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <sys/stat.h>

using namespace rolvane;
using namespace rolvane::test;

namespace {

const RemoteLocation kBobs("http://store.example/bob/Contacts");
const Date kNow(1'800'000'000);

struct Withdrawn : testing::Test {
    Withdrawn() {
        database.addRecord(CXSubscription::create(kBobs));
        for (const char* name : {"Cleo", "Dora"}) people.push_back(subscribed(name));
        group = CXSubscribedGroup::initWithUniqueId(makeUniqueId(kCXSubscribedGroupTable));
        group->setValue(Value("Friends"), kCXGroupNameProperty);
        group->setValue(location(), kCXRemoteLocationProperty);
        database.addRecord(group);
        group->addMember(people[1]);
        auto own = CXPerson::create();
        own->setValue(Value("Own"), kCXFirstNameProperty);
        database.addRecord(own);
        database.save();
    }
    static CXMultiValue location() {
        CXMutableMultiValue all;
        all.addValue(kBobs, kCXSubscribeLabel);
        return all;
    }
    CXPersonRef subscribed(const char* name) {
        auto made = CXSubscribedPerson::initWithUniqueId(makeUniqueId(kCXSubscribedPersonTable));
        auto person = std::dynamic_pointer_cast<CXPerson>(made);
        person->setValue(Value(name), kCXFirstNameProperty);
        person->setValue(location(), kCXRemoteLocationProperty);
        database.addRecord(person);
        return person;
    }
    WithdrawnContacts keep(const char* user = "bob") { return folder.keep(database, kBobs, UserName(user), kNow); }

    TempDirectory directory;
    CXRolvane database{CXRolvane::Options{.path = directory / "contacts.db", .program = "test"}};
    std::vector<CXPersonRef> people;
    CXGroupRef group;
    WithdrawnContactsFolder folder{directory / "withdrawn"};
};

mode_t modeOf(const std::string& path) {
    struct stat info {};
    return stat(path.c_str(), &info) == 0 ? info.st_mode & 0777 : 0;
}

} // namespace

TEST_F(Withdrawn, TheCopiesOfASubscriptionAreKeptInADatedFileThatCanBeImportedAgain) {
    const WithdrawnContacts kept = keep();
    EXPECT_EQ(kept.people, 2u);
    EXPECT_EQ(kept.groups, 1u);
    EXPECT_EQ(std::filesystem::path(kept.file).filename(), "2027-01-15T08-00-00Z-bob.vcf");
    EXPECT_EQ(modeOf(kept.file), 0600u);
    EXPECT_EQ(modeOf(folder.directory()), 0700u);
    EXPECT_EQ(database.countPeople(kBobs), 2u) << "the database stays as it is";

    CXRolvane other({.path = directory / "other.db", .program = "test"});
    const VCardImportReport report = VCardImport::importFile(other, kept.file);
    EXPECT_EQ(report.imported, 2u);
    EXPECT_EQ(report.groups, 1u);
    EXPECT_EQ(report.errorCount, 0u);
    const auto listed = other.listPeople(RemoteLocation(""), "");
    ASSERT_EQ(listed.size(), 2u);
    EXPECT_EQ(listed[0].displayName, "Cleo");
    const auto groups = other.listGroups(RemoteLocation(""));
    ASSERT_EQ(groups.size(), 1u);
    EXPECT_EQ(groups[0].displayName, "Friends");
}

TEST_F(Withdrawn, WhatWasKeptIsListedLatestFirstByAnyProcess) {
    keep();
    folder.keep(database, kBobs, UserName("eve/../x"), kNow.addingSeconds(60));
    const auto all = WithdrawnContactsFolder(folder.directory()).list();
    ASSERT_EQ(all.size(), 2u);
    EXPECT_EQ(all[0].user, UserName("eve/../x"));
    EXPECT_EQ(all[1].user, UserName("bob"));
    EXPECT_EQ(all[1].location, kBobs);
    EXPECT_EQ(all[1].date, kNow);
    EXPECT_EQ(all[1].people, 2u);
    EXPECT_EQ(all[1].groups, 1u);
    EXPECT_TRUE(std::filesystem::exists(all[0].file));
    EXPECT_EQ(std::filesystem::path(all[0].file).parent_path(), folder.directory());
}

TEST_F(Withdrawn, TwoOfOneSecondAreTwo) {
    const std::string first = keep().file;
    database.removeRecord(database.findSubscriptionWithRemoteLocation(kBobs));
    database.addRecord(CXSubscription::create(kBobs)); // subscribed to again
    database.save();
    EXPECT_NE(keep().file, first);
    EXPECT_EQ(folder.list().size(), 2u);
}

TEST_F(Withdrawn, AProcessThatIsKilledBeforeTheCopiesLeaveMakesNoSecondRecord) {
    const WithdrawnContacts first = keep(); // killed here
    const WithdrawnContacts second =
        WithdrawnContactsFolder(folder.directory()).keep(database, kBobs, UserName("bob"), kNow.addingSeconds(600));
    EXPECT_EQ(second.file, first.file);
    EXPECT_EQ(second.date, kNow) << "that is when it ended";
    ASSERT_EQ(folder.list().size(), 1u);
    EXPECT_EQ(folder.list()[0].people, 2u);
}

TEST_F(Withdrawn, OneThatIsKilledAmidTheCardsLeavesNothingButWhatTheNextOneCompletes) {
    const WithdrawnContacts kept = keep();
    // What it has done by then: the record is there, the cards are not whole.
    std::filesystem::rename(kept.file, kept.file + ".making");
    std::filesystem::resize_file(kept.file + ".making", 10);
    const WithdrawnContacts again = folder.keep(database, kBobs, UserName("bob"), kNow.addingSeconds(600));
    EXPECT_EQ(again.file, kept.file);
    size_t files = 0;
    for (const auto& each : std::filesystem::directory_iterator(folder.directory())) files += each.is_regular_file();
    EXPECT_EQ(files, 2u);
    CXRolvane other({.path = directory / "other.db", .program = "test"});
    EXPECT_EQ(VCardImport::importFile(other, kept.file).imported, 2u);
}

TEST_F(Withdrawn, WithoutCopiesThereIsARecordAndNoFile) {
    const auto kept = folder.keep(database, RemoteLocation("http://store.example/mia/Contacts"), UserName("mia"), kNow);
    EXPECT_EQ(kept.file, "");
    ASSERT_EQ(folder.list().size(), 1u);
    EXPECT_EQ(folder.list()[0].file, "");
}

TEST_F(Withdrawn, WhatIsForgottenIsGone) {
    const auto kept = keep();
    folder.forget(kept);
    EXPECT_TRUE(folder.list().empty());
    EXPECT_FALSE(std::filesystem::exists(kept.file));
    folder.forget(kept);
}

TEST_F(Withdrawn, DamagedRecordsAreLeftOutAndAMissingDirectoryIsEmpty) {
    EXPECT_TRUE(folder.list().empty());
    keep();
    std::ofstream(folder.directory() + "/x.plist") << "<plist>";
    EXPECT_EQ(folder.list().size(), 1u);
}

TEST_F(Withdrawn, WhatCannotBeWrittenIsAnExceptionAndLeavesNothing) {
    std::ofstream(directory / "withdrawn") << "in the way";
    EXPECT_THROW(keep(), CXException);
    EXPECT_TRUE(folder.list().empty());
}
