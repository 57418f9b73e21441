#include "TestDatabase.h"

#include "contacts/records/PersonJoining.h"
#include "contacts/vcard/VCardImport.h"

#include <gtest/gtest.h>

#include <sstream>

namespace rolvane {
namespace {

using test::TestDatabase;

CXPersonRef add(TestDatabase& db, const std::string& first, const std::string& mail, const std::string& title = {}) {
    auto person = db.addPerson(first);
    CXMutableMultiValue mails;
    if (!mail.empty()) mails.addValue(mail, kCXHomeLabel);
    if (!mail.empty()) person->setValue(mails.toValue(), kCXEmailProperty);
    if (!title.empty()) person->setValue(title, kCXJobTitleProperty);
    return person;
}

TEST(PersonJoining, WhoLooksAlikeIsFoundSurestFirst) {
    TestDatabase db;
    add(db, "Ann", "ann@b.test");
    add(db, "ann", "ANN@b.test");
    add(db, "Bo", "bo@b.test");
    add(db, "Bo", "other@b.test");
    add(db, "Cy", "shared@b.test");
    add(db, "Di", "shared@b.test");
    add(db, "Ed", "ed@b.test");
    db->save();
    const auto found = findAlikePeople(*db);
    ASSERT_EQ(found.size(), 3u);
    EXPECT_EQ(found[0].alikeness, CXAlikeness::same);
    EXPECT_EQ(found[1].alikeness, CXAlikeness::named);
    EXPECT_EQ(found[2].alikeness, CXAlikeness::reached);
    for (const auto& each : found) EXPECT_EQ(each.people.size(), 2u);
}

TEST(PersonJoining, TheFirstGetsWhatTheSecondHasAndNothingIsLostUnsaid) {
    TestDatabase db;
    auto one = add(db, "Ann", "ann@b.test", "Cook"), two = add(db, "Ann", "ann@c.test", "Baker");
    two->setValue("Lee", kCXLastNameProperty);
    one->setValue("first note", kCXNoteProperty);
    two->setValue("second note", kCXNoteProperty);
    auto group = db.addGroup("Choir");
    group->addMember(two);
    const std::string chosen = two->multiValueForProperty(kCXEmailProperty)->identifierAtIndex(0);
    group->setDistributionIdentifier(chosen, kCXEmailProperty, two);
    db->save();
    const UniqueId gone = two->uniqueId();
    EXPECT_EQ(joinPeople(*db, one, two), std::vector<std::string>{"JobTitle: Baker"});
    db->save();
    EXPECT_FALSE(db->recordForUniqueId(gone));
    EXPECT_EQ(one->valueForProperty(kCXJobTitleProperty).string(), "Cook");
    EXPECT_EQ(one->valueForProperty(kCXLastNameProperty).string(), "Lee");
    EXPECT_EQ(one->valueForProperty(kCXNoteProperty).string(), "first note\nJobTitle: Baker\nsecond note");
    const auto mails = *one->multiValueForProperty(kCXEmailProperty);
    ASSERT_EQ(mails.count(), 2u);
    EXPECT_EQ(test::texts(group->memberUniqueIds()), std::vector<std::string>{one->uniqueId().str()});
    const auto choice = group->distributionIdentifierForProperty(kCXEmailProperty, one);
    ASSERT_TRUE(choice);
    EXPECT_EQ(mails.valueForIdentifier(*choice).string(), "ann@c.test");
    // A card of the one who is gone means the one who stays.
    std::istringstream in("BEGIN:VCARD\r\nVERSION:3.0\r\nUID:" + gone.str().substr(0, 36) +
                          "\r\nFN:Ann Lee\r\nN:Lee;Ann;;;\r\nTEL:5550100\r\nEND:VCARD\r\n");
    VCardImport import(*db);
    import.addStream(in, "text.vcf");
    const auto report = import.finish();
    EXPECT_EQ(report.imported, 0u);
    EXPECT_EQ(report.updated, 1u);
    EXPECT_EQ(one->multiValueForProperty(kCXPhoneProperty)->count(), 1u);
}

} // namespace
} // namespace rolvane
