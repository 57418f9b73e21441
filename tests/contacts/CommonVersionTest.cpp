#include "TestDatabase.h"

#include "contacts/records/Constants.h"
#include "foundation/PropertyList.h"

#include <gtest/gtest.h>

namespace rolvane::test {
namespace {

class CommonVersion : public testing::Test {
protected:
    CommonVersion() {
        d.addPerson("Ada", ada.str());
        d->save();
        share();
    }
    void share() {
        d->setCommonVersion(ada, d->personRow(ada)->encoded);
        d->save();
    }
    static void edit(CXRolvane& database, const char* property, const char* value) {
        database.recordForUniqueId(ada)->setValue(Value(value), property);
        database.save();
    }
    Dictionary common() {
        const auto version = d->commonVersion(ada);
        return version && version->properties ? BinaryValue::decode(*version->properties).dictionary() : Dictionary();
    }

    static inline const UniqueId ada{"A:CXPerson"};
    TestDatabase d;
};

TEST_F(CommonVersion, IsKeptFromTheFirstEditOn) {
    EXPECT_TRUE(d->commonVersion(ada));
    EXPECT_FALSE(d->commonVersion(ada)->properties) << "nothing was edited";
    edit(*d.database, kCXNoteProperty, "one");
    edit(*d.database, kCXNoteProperty, "two");
    EXPECT_EQ(common(), (Dictionary{{kCXFirstNameProperty, "Ada"}}));
    EXPECT_TRUE(d->commonVersion(ada)->edited);
    EXPECT_EQ(d->editedSinceCommon(), std::vector{ada});
}

TEST_F(CommonVersion, EndsWhenTheEditIsSent) {
    edit(*d.database, kCXNoteProperty, "one");
    const auto sent = d->personRow(ada)->encoded;
    d->setCommonVersion(ada, sent);
    EXPECT_FALSE(d->commonVersion(ada)->properties) << "also before it is saved";
    d->save();
    EXPECT_FALSE(d->commonVersion(ada)->properties);
    EXPECT_TRUE(d->editedSinceCommon().empty());
}

TEST_F(CommonVersion, IsWhatWasSentWhereTheContactWasEditedAgainMeanwhile) {
    edit(*d.database, kCXNoteProperty, "sent");
    d->setCommonVersion(ada, d->personRow(ada)->encoded);
    const auto other = d.open("rolvane");
    edit(*other, kCXNoteProperty, "later");
    d->save();
    EXPECT_EQ(common(), (Dictionary{{kCXFirstNameProperty, "Ada"}, {kCXNoteProperty, "sent"}}));
    EXPECT_EQ(d->editedSinceCommon(), std::vector{ada});
}

TEST_F(CommonVersion, KnowsWhatWasSentUntilOneIsSet) {
    edit(*d.database, kCXNoteProperty, "one");
    const auto one = d->personRow(ada)->encoded;
    EXPECT_TRUE(d->commonVersion(ada)->sent.empty());
    d->setSentVersion(ada, one);
    d->save();
    d->setSentVersion(ada, one);
    d->save();
    edit(*d.database, kCXNoteProperty, "two");
    const auto two = d->personRow(ada)->encoded;
    d->setSentVersion(ada, two);
    d->save();
    const auto version = d.open("another")->commonVersion(ada);
    ASSERT_TRUE(version);
    ASSERT_EQ(version->sent.size(), 2u) << "each once";
    EXPECT_EQ(*version->sent[0].properties, *one);
    EXPECT_EQ(*version->sent[1].properties, *two);
    EXPECT_EQ(version->sent[1].edited, version->edited);
    d->setCommonVersion(ada, one);
    d->save();
    EXPECT_TRUE(d->commonVersion(ada)->properties) << "of the second edit";
    EXPECT_TRUE(d->commonVersion(ada)->sent.empty());
}

TEST_F(CommonVersion, GoesWithItsContactAndIsOfNoOtherOne) {
    d.addPerson("Ben", "B:CXPerson");
    d->save();
    EXPECT_FALSE(d->commonVersion(UniqueId("B:CXPerson")));
    edit(*d.database, kCXNoteProperty, "one");
    d->removeRecord(d->recordForUniqueId(ada));
    d->save();
    EXPECT_FALSE(d->commonVersion(ada));
    EXPECT_TRUE(d->editedSinceCommon().empty());
}

TEST_F(CommonVersion, IsNotThatOfAnotherContactWhichHadTheIdentifierBefore) {
    edit(*d.database, kCXNoteProperty, "one");
    d->setCommonVersion(ada, d->personRow(ada)->encoded);
    d->removeRecord(d->recordForUniqueId(ada));
    d.addPerson("Another", ada.str());
    EXPECT_FALSE(d->commonVersion(ada)) << "before it is saved";
    d->save();
    EXPECT_FALSE(d->commonVersion(ada));
}

TEST_F(CommonVersion, AnEditDuringAReplacementIsMergedByValueAndWhatGaveWayIsNoted) {
    const auto other = d.open("rolvane");
    const auto person = std::dynamic_pointer_cast<CXPerson>(d->recordForUniqueId(ada));
    person->resetWithDictionary({{kCXFirstNameProperty, "Adah"}, {kCXNicknameProperty, "A"}}, true, false);
    d->setCommonVersion(ada, person->encodedRepresentation());
    edit(*other, kCXFirstNameProperty, "Adele");
    d->save();
    EXPECT_EQ(person->dictionaryRepresentation(),
              (Dictionary{{kCXFirstNameProperty, "Adele"}, {kCXNicknameProperty, "A"}}));
    EXPECT_EQ(common(), (Dictionary{{kCXFirstNameProperty, "Adah"}, {kCXNicknameProperty, "A"}}));
    ASSERT_EQ(d->conflicts().size(), 1u);
    EXPECT_EQ(d->conflicts()[0].merge.lost, (Dictionary{{kCXFirstNameProperty, "Adah"}}));
}

TEST_F(CommonVersion, ConflictsAreNotedOnceAndForgottenByNumber) {
    const CXMergeConflict note{kCXNoteProperty, {{kCXNoteProperty, "a"}}, {{kCXNoteProperty, "b"}}, CXSide::theirs};
    d->noteConflicts(ada, {note});
    EXPECT_TRUE(d->conflicts().empty());
    d->save();
    d->noteConflictsAtOnce(ada, {note});
    ASSERT_EQ(d->conflicts().size(), 1u);
    const CXConflict known = d->conflicts()[0];
    EXPECT_EQ(known.merge, note);
    EXPECT_EQ(known.name, "Ada");
    EXPECT_TRUE(d->conflict(known.number));
    EXPECT_TRUE(d->forgetConflict(known.number));
    EXPECT_FALSE(d->forgetConflict(known.number));
}

} // namespace
} // namespace rolvane::test
