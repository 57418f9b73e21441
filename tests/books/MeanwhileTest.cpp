#include "BooksWorld.h"

#include "foundation/Sqlite.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

// Something else happens between two requests of a client, or in the middle of one.

namespace rolvane {
namespace {

using testing::HasSubstr;
using testing::Not;

const std::string kLocation = "https://a.example/dav/walter";

std::string bookOf(const CXSubscriptionRef& subscription) {
    return "/books/home/shared-" + BooksWorld::uuidOf(subscription) + "/";
}
std::string bookOf(const CXGroupRef& group) {
    return "/books/home/group-" + BooksWorld::uuidOf(group) + "/";
}

class Meanwhile : public testing::Test {
protected:
    // The answer to a PUT whose body the server waits for while something else is done.
    RawAnswer put(const std::string& path, const std::string& card, const std::function<void()>& meanwhile) {
        RawUpload upload(world.port(),
                         {"laptop", "PUT", path, {{"Content-Type", "text/vcard"}, {"Expect", "100-continue"}}, card},
                         0);
        EXPECT_TRUE(upload.awaitContinue());
        meanwhile();
        return upload.finish();
    }
    static std::string edited(std::string card) { return card.replace(card.find("END:VCARD"), 0, "TITLE:Cook\r\n"); }
    std::string cardIn(const std::string& book) {
        for (const auto& each : world.propfind(book, 1, "<D:getetag/>").responses())
            if (each.href != book) return each.href;
        return "";
    }
    size_t peopleOf(const std::string& location) { return world.rolvane().countPeople(RemoteLocation(location)); }

    BooksWorld world;
};

TEST_F(Meanwhile, ASubscriptionEndsAndNothingIsWrittenIntoItsBookAnyMore) {
    const auto subscription = world.addSubscription(kLocation, true, "Yan");
    const std::string book = bookOf(subscription), path = cardIn(book), card = world.ask("GET", path).body;
    int64_t position = 0;
    const RawAnswer answer = put(path, edited(card), [&] {
        world.rolvane().removeRecord(subscription);
        world.rolvane().save();
        position = world.rolvane().journalPosition();
    });
    EXPECT_EQ(answer.status, 404) << answer.body;
    EXPECT_EQ(peopleOf(kLocation), 0u) << "a copy that nothing would ever remove";
    EXPECT_EQ(world.rolvane().journalPosition(), position);
}

TEST_F(Meanwhile, TheRightToWriteIsTakenBackAndTheCopyStays) {
    const auto subscription = world.addSubscription(kLocation, true, "Yan");
    const std::string book = bookOf(subscription), path = cardIn(book), card = world.ask("GET", path).body;
    int64_t position = 0;
    const RawAnswer answer = put(path, edited(card), [&] {
        world.rolvane()
            .allGroupForRemoteLocation(RemoteLocation(kLocation))
            ->removeValueForProperty(kCXReadWriteSharingACLProperty);
        world.rolvane().save();
        position = world.rolvane().journalPosition();
    });
    EXPECT_EQ(answer.status, 403);
    EXPECT_EQ(answer.precondition(), "need-privileges") << answer.body;
    EXPECT_EQ(world.rolvane().journalPosition(), position);
}

TEST_F(Meanwhile, AGroupIsDeletedAndNobodyIsMadeByACardForItsBook) {
    const auto group = world.addGroup("Friends", {});
    const RawAnswer answer = put(bookOf(group) + "ann.vcf", cardOf("ann", "Ann", "Lee"), [&] {
        world.rolvane().removeRecord(group);
        world.rolvane().save();
    });
    EXPECT_EQ(answer.status, 404) << answer.body;
    EXPECT_EQ(peopleOf(""), 0u);
}

// A client that was in the middle of a book is told that there is none, and reads the new one from its beginning.
TEST_F(Meanwhile, ASubscriptionEndsAndBeginsAnewWhileAClientReadsItPageByPage) {
    const auto subscription = world.addSubscription(kLocation, false, "Yan");
    const std::string book = bookOf(subscription), path = cardIn(book);
    const std::string page = "<D:limit><D:nresults>1</D:nresults></D:limit>";
    const auto first = world.sync(book, "", page);
    ASSERT_EQ(first.status, 207);
    world.rolvane().removeRecord(subscription);
    world.rolvane().save();
    EXPECT_EQ(world.sync(book, first.syncToken(), page).status, 404);
    EXPECT_EQ(world.multiget(book, {path}).status, 404);
    EXPECT_EQ(world.ask("GET", path).status, 404);
    EXPECT_THAT(world.propfind("/books/home/", 1, "<D:displayname/>").body, Not(HasSubstr(book)));
    const auto again = world.addSubscription(kLocation, false, "Yan");
    ASSERT_NE(bookOf(again), book);
    const auto refused = world.sync(bookOf(again), first.syncToken());
    EXPECT_EQ(refused.status, 403);
    EXPECT_EQ(refused.precondition(), "valid-sync-token");
    EXPECT_EQ(world.sync(bookOf(again), "").responses().size(), 1u);
}

// As of two people's edits: where one deletes and the other edits, the deletion stands.
TEST_F(Meanwhile, SomebodyElseTakesAPersonAwayAndAnEditOfTheCardBringsNobodyBack) {
    const auto ann = world.addPerson("Ann", "Lee"), bob = world.addPerson("Bob", "May");
    const auto group = world.addGroup("Friends", {ann, bob});
    for (const std::string& book : {bookOf(group), std::string(kContacts)}) {
        const std::string path = book + BooksWorld::uuidOf(ann) + ".vcf",
                          other = book + BooksWorld::uuidOf(bob) + ".vcf";
        const auto edited = [&](const CXPersonRef& who, const char* name) {
            return cardOf("urn:uuid:" + BooksWorld::uuidOf(who), name, "Edited");
        };
        ASSERT_EQ(world.sync(book, "").status, 207);
        ASSERT_EQ(world.multiget(book, {path, other}).status, 207);
        for (const auto& who : {ann, bob})
            if (book == kContacts)
                world.rolvane().removeRecord(who);
            else
                group->removeMember(who);
        world.rolvane().save();
        for (int time = 0; time < 2; ++time)
            EXPECT_EQ(world.put(path, edited(ann, "Ann")).status, 412) << "programs try again: " << book;
        EXPECT_EQ(world.ask("GET", path).status, 404) << book;
        // Who has asked and was told means it, by a listing, too; so does a device that never had the card.
        EXPECT_EQ(world.put(path, edited(ann, "Ann")).status, 201) << book;
        ASSERT_EQ(world.propfind(book, 1, "<D:getetag/>").status, 207);
        EXPECT_EQ(world.put(other, edited(bob, "Bob")).status, 201) << book;
        EXPECT_EQ(world.ask("DELETE", other).status, 204) << book;
        EXPECT_EQ(world.put(other, edited(bob, "Bob")).status, 201) << "it has done so itself: " << book;
        EXPECT_EQ(world.ask("DELETE", other, {}, {}, "phone").status, 204) << book;
        EXPECT_EQ(world.put(other, edited(bob, "Bob"), {{"If-None-Match", "*"}}).status, 201) << "a new card: " << book;
    }
    EXPECT_EQ(peopleOf(""), 2u);
}

// Thunderbird sends what was refused before all else, and would never look into the book again.
TEST_F(Meanwhile, SomebodyElseTakesAPersonAwayAndThunderbirdIsToldByItsNextLook) {
    const BooksWorld::Headers thunderbird = {{"User-Agent", "Mozilla/5.0 Gecko/20100101 Thunderbird/153.0"}};
    const auto ann = world.addPerson("Ann", "Lee");
    const auto group = world.addGroup("Friends", {ann});
    const std::string name = BooksWorld::uuidOf(ann) + ".vcf", uid = "urn:uuid:" + BooksWorld::uuidOf(ann);
    for (const std::string& book : {bookOf(group), std::string(kContacts)}) {
        ASSERT_EQ(world.sync(book, "").status, 207);
        ASSERT_EQ(world.multiget(book, {book + name}).status, 207);
    }
    group->removeMember(ann);
    world.rolvane().save();
    const auto edit = world.put(bookOf(group) + name, cardOf(uid, "Ann", "Leigh"), thunderbird);
    EXPECT_EQ(edit.status, 201) << edit.body;
    EXPECT_EQ(edit.tag(), "");
    EXPECT_EQ(group->memberCount(), 0u);
    EXPECT_EQ(ann->valueForProperty(kCXLastNameProperty).string(), "Leigh") << "the edit itself is kept";
    EXPECT_EQ(world.ask("GET", bookOf(group) + name).status, 404);
    ASSERT_EQ(world.multiget(kContacts, {kContacts + name}).status, 207);
    world.rolvane().removeRecord(ann);
    world.rolvane().save();
    EXPECT_EQ(world.put(kContacts + name, cardOf(uid, "Ann", "Lye"), thunderbird).status, 201);
    EXPECT_EQ(peopleOf(""), 0u);
    EXPECT_EQ(world.put(kContacts + name, cardOf(uid, "Ann", "Lye")).status, 412) << "other programs get over it";
}

TEST_F(Meanwhile, APersonWhoWasTakenAwayIsWrittenByADeviceThatNeverHadTheCard) {
    const auto ann = world.addPerson("Ann", "Lee");
    const std::string path = kContacts + BooksWorld::uuidOf(ann) + ".vcf";
    const std::string card = world.ask("GET", path).body;
    ASSERT_EQ(world.sync(kContacts, "").status, 207);
    world.rolvane().removeRecord(ann);
    world.rolvane().save();
    EXPECT_EQ(world.put(path, card, {}, "phone").status, 201);
}

// The books' own memory is written behind answers, too.
TEST_F(Meanwhile, TheMemoryOfTheBooksIsLockedForLongAndWhoReadsIsServed) {
    const auto ann = world.addPerson("Ann", "Lee");
    const std::string path = kContacts + BooksWorld::uuidOf(ann) + ".vcf";
    const std::string token = world.sync(kContacts, "").syncToken();
    const std::string card = world.ask("GET", path, {}, {}, "phone").body;
    ASSERT_THAT(card, HasSubstr("FN:Ann Lee"));
    {
        Sqlite memory(world.database() + ".books", 1000);
        const SqliteTransaction transaction(memory);
        const auto got = world.ask("GET", path);
        EXPECT_EQ(got.status, 200);
        EXPECT_EQ(got.body, card) << "the card and nothing behind it";
        const auto many = world.multiget(kContacts, {path});
        EXPECT_EQ(many.status, 207);
        EXPECT_TRUE(many.whole);
        EXPECT_THAT(many.body, testing::EndsWith("</D:multistatus>\n"));
        EXPECT_EQ(world.sync(kContacts, token).status, 207);
        // What has changed cannot be told while it cannot be noted.
        ann->setValue("so", kCXNoteProperty);
        world.rolvane().save();
        const auto later = world.sync(kContacts, token);
        EXPECT_EQ(later.status, 503) << later.body;
        EXPECT_EQ(later.header("Retry-After"), "5");
    }
    EXPECT_EQ(world.sync(kContacts, token).responses().size(), 1u);
}

} // namespace
} // namespace rolvane
