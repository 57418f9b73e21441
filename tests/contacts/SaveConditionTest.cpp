#include "TestDatabase.h"

#include "contacts/database/Journal.h"
#include "foundation/PropertyList.h"

namespace rolvane {
namespace {

using test::TestDatabase;

std::string noteOf(const std::shared_ptr<const Bytes>& properties) {
    return properties ? BinaryValue::decode(*properties).dictionary()[kCXNoteProperty].string() : "nothing";
}

TEST(SaveIfStill, WritesOnlyWhereTheRecordsAreAsExpected) {
    TestDatabase db;
    const auto ann = db.addPerson("Ann");
    db->save();
    const auto when = ann->valueForProperty(kCXModificationDateProperty).date();
    ann->setValue("one", kCXNoteProperty);
    db.clock.advance(1);
    EXPECT_TRUE(db->saveIfStill({{ann->uniqueId(), when}}));
    ann->setValue("two", kCXNoteProperty);
    EXPECT_FALSE(db->saveIfStill({{ann->uniqueId(), when}})) << "it was written meanwhile";
    EXPECT_TRUE(db->hasUnsavedChanges());
    EXPECT_FALSE(db->saveIfStill({{ann->uniqueId(), std::nullopt}})) << "it is there";
    EXPECT_FALSE(db->saveIfStill({{UniqueId("x:CXPerson"), when}})) << "it is not there";
    EXPECT_TRUE(db->saveIfStill({{UniqueId("x:CXPerson"), std::nullopt}}));
    EXPECT_EQ(db.open("other")->recordForUniqueId(ann->uniqueId())->valueForProperty(kCXNoteProperty).string(), "two");
}

TEST(FormerVersions, AreWhatAPersonWasAtAMoment) {
    TestDatabase db;
    const auto ann = db.addPerson("Ann");
    db->save();
    ann->setValue("unkept", kCXNoteProperty);
    db.clock.set(Date(1700000010));
    db->save();
    EXPECT_EQ(db->formerVersion(ann->uniqueId(), Date(1700000005)), nullptr) << "nobody had asked";
    db->keepFormerVersions();
    auto other = db.open("other");
    for (int i = 1; i <= 3; ++i) {
        db.clock.set(Date(1700000010 + 10 * i));
        other->recordForUniqueId(ann->uniqueId())->setValue(std::to_string(i), kCXNoteProperty);
        other->save();
    }
    EXPECT_EQ(noteOf(db->formerVersion(ann->uniqueId(), Date(1700000015))), "unkept");
    EXPECT_EQ(noteOf(db->formerVersion(ann->uniqueId(), Date(1700000020))), "1");
    EXPECT_EQ(noteOf(db->formerVersion(ann->uniqueId(), Date(1700000035))), "2");
    EXPECT_EQ(db->formerVersion(ann->uniqueId(), Date(1700000040)), nullptr) << "that is the present one";
    EXPECT_EQ(db->formerVersion(ann->uniqueId(), Date(1700000005)), nullptr) << "what was then is not known";
}

TEST(Journal, IsNotHeldForEverByTheBooks) {
    TestDatabase db;
    const auto books = db.open(std::string(kCXBooksProgram));
    EXPECT_EQ(books->cursorPosition(), 0);
    std::vector<CXPersonRef> people;
    for (int i = 0; i < 4000; ++i) people.push_back(db.addPerson("P"));
    db->save();
    for (int round = 0; round < 3; ++round) {
        for (const auto& person : people) person->setValue(std::to_string(round), kCXNoteProperty);
        db->save();
    }
    const int64_t first = db->journalEntries(0, 1).front().sequence;
    EXPECT_GT(first, 1);
    EXPECT_LE(db->journalPosition() - first, 10000);
}

} // namespace
} // namespace rolvane
