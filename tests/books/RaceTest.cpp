#include "contacts/database/FormerVersions.h"
#include "contacts/database/Journal.h"
#include "contacts/database/RecordStore.h"
#include "foundation/BinaryValue.h"
#include "server/mod_cardbook/CardWriter.h"
#include "server/mod_cardbook/Devices.h"
#include "server/mod_cardbook/Refused.h"
#include "support/TempHome.h"
#include "support/WaitUntil.h"

#include <future>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

// Another program saves a card while a client's request writes it. A save is held open in the file itself, as a slow
// program's would be, until the request has come to the place that the test is about.

namespace rolvane {
namespace {

using namespace cardbook;
using testing::HasSubstr;
using testing::Not;

// A property of a record that another program has written, and commits when told.
class HeldSave {
public:
    HeldSave(const std::string& path, const UniqueId& uid, const char* property, const Value& value)
        : _sqlite(path, kPatience), _store(_sqlite), _transaction(_sqlite) {
        const Date now = Clock::system().now();
        const StoredRow row = _store.row(uid).value();
        Dictionary properties = BinaryValue::decode(*row.properties).dictionary().mutableCopy();
        properties.set(property, value);
        FormerVersions(_sqlite).keep(uid, row.modified, now, *row.properties);
        _store.updateRow(row.id, row.kind, properties, BinaryValue::encode(properties), now, "other");
        Journal journal(_sqlite);
        journal.note(journal.beginSave(getpid(), "other", now), uid, CXChangeKind::updated);
    }
    void commit() { _transaction.commit(); }

private:
    static constexpr int kPatience = 5000;
    Sqlite _sqlite;
    RecordStore _store;
    SqliteTransaction _transaction;
};

class Races : public testing::Test {
protected:
    const std::string uuid = "6F0C1B2A-8B7E-4B53-9B7E-0B8C3D1E2F3A", name = "card.vcf";
    const UniqueId ann = UniqueId(uuid + ":CXPerson"), friends = UniqueId(uuid + ":CXGroup");

    std::string card(const std::string& lines) const {
        return "BEGIN:VCARD\r\nVERSION:4.0\r\nUID:urn:uuid:" + uuid + "\r\nFN:Ann\r\nN:;Ann;;;\r\n" + lines +
               "END:VCARD\r\n";
    }
    std::string groupCard(const std::string& lines) const {
        return "BEGIN:VCARD\r\nVERSION:4.0\r\nUID:urn:uuid:" + uuid + "\r\nKIND:group\r\nFN:Friends\r\n" + lines +
               "END:VCARD\r\n";
    }
    // A request whose conditions are judged now.
    WriteContext request(Conditions conditions = {}) {
        library.catchUp();
        const Book book = *library.book(std::string(kContactsBook));
        return {book, name, "/books", "laptop", conditions, library.memory().named(book.id, name)};
    }
    std::string served() {
        library.catchUp();
        return library.card(*library.memory().named(kContactsBook, name), std::nullopt)->text;
    }
    void read() { // by the device
        const Member member = *library.memory().named(kContactsBook, name);
        Devices(library.memory()).noteHad("laptop", {{member.uid, member.modified}});
    }
    int put(const WriteContext& context, const std::string& text) {
        try {
            return CardWriter(library, context).put(text).made ? 201 : 204;
        } catch (const Refused& refused) {
            return refused.status();
        }
    }

    // The status of a PUT that has looked at the journal and not yet at the record when another program saves. So much
    // has been saved before that the request moves its cursor, and waits there for the other program.
    int putBehindTheJournal(const WriteContext& context, const std::string& text, const UniqueId& uid,
                            const char* property, const Value& value) {
        constexpr int kMoreThanACursorLags = 300;
        for (int i = 0; i < kMoreThanACursorLags; ++i)
            CXPerson::personFromDictionary({{kCXFirstNameProperty, "Many"}}, &other, false, false);
        other.save();
        const int64_t end = other.journalPosition();
        return putMeanwhile(context, text, {path, uid, property, value}, [&] { return memory.position() == end; });
    }
    // The status of a PUT that has merged the record as it was when another program saves.
    int putBehindTheRecord(const WriteContext& context, const std::string& text, const UniqueId& uid,
                           const char* property, const Value& value) {
        const int64_t before = texts();
        return putMeanwhile(context, text, {path, uid, property, value}, [&] { return texts() > before; });
    }
    int64_t texts() { // of clients, that the memory keeps
        return memory.sqlite().integer("SELECT count(*) FROM written");
    }

    static CXRolvane::Options otherProgram(const std::string& path) {
        CXRolvane::Options chosen;
        chosen.path = path;
        chosen.program = "other";
        return chosen;
    }

    test::TempDirectory directory;
    const std::string path = directory / "contacts.db";
    CXRolvane other{otherProgram(path)};
    Library library{path};
    BookMemory memory{bookMemoryPath(path), 5000}; // for the test to look into

private:
    struct Held {
        std::string path;
        UniqueId uid;
        const char* property;
        Value value;
    };
    int putMeanwhile(const WriteContext& context, const std::string& text, const Held& what,
                     const std::function<bool()>& isThere) {
        HeldSave held(what.path, what.uid, what.property, what.value);
        auto status = std::async(std::launch::async, [&] { return put(context, text); });
        EXPECT_TRUE(test::waitUntil(isThere, "the request's waiting for the other program", 4));
        held.commit();
        return status.get();
    }
};

Conditions tag() {
    Conditions conditions;
    conditions.namesTag = true;
    return conditions;
}

TEST_F(Races, AWriteWithoutAConditionIsMergedWithASaveBeforeItsLookAtTheRecord) {
    ASSERT_EQ(put(request(), card("")), 201);
    read();
    EXPECT_EQ(putBehindTheJournal(request(), card("TITLE:Cook\r\n"), ann, kCXNoteProperty, "theirs"), 204);
    EXPECT_THAT(served(), HasSubstr("NOTE:theirs")) << "what the device has never seen it has not taken away";
    EXPECT_THAT(served(), HasSubstr("TITLE:Cook"));
}

TEST_F(Races, AWriteWithoutAConditionIsMergedWithASaveBehindItsLookAtTheRecord) {
    ASSERT_EQ(put(request(), card("")), 201);
    read();
    EXPECT_EQ(putBehindTheRecord(request(), card("TITLE:Cook\r\n"), ann, kCXNoteProperty, "theirs"), 204);
    EXPECT_THAT(served(), HasSubstr("NOTE:theirs"));
    EXPECT_THAT(served(), HasSubstr("TITLE:Cook"));
}

TEST_F(Races, AWriteOverATagThatIsNoLongerThereIsRefusedAndChangesNothing) {
    ASSERT_EQ(put(request(), card("")), 201);
    EXPECT_EQ(putBehindTheJournal(request(tag()), card("TITLE:Cook\r\n"), ann, kCXNoteProperty, "first"), 412);
    EXPECT_EQ(putBehindTheRecord(request(tag()), card("TITLE:Chef\r\nNOTE:first\r\n"), ann, kCXNoteProperty, "second"),
              412);
    EXPECT_THAT(served(), HasSubstr("NOTE:second"));
    EXPECT_THAT(served(), Not(HasSubstr("TITLE")));
}

TEST_F(Races, ConditionsThatStillHoldAreNoneAgainstAnotherVersion) {
    ASSERT_EQ(put(request(), card("")), 201);
    read();
    Conditions there, date;
    there.exists = true;
    date.hasDate = true;
    EXPECT_EQ(putBehindTheRecord(request(there), card("TITLE:Cook\r\n"), ann, kCXNoteProperty, "theirs"), 204);
    EXPECT_THAT(served(), HasSubstr("NOTE:theirs"));
    EXPECT_THAT(served(), HasSubstr("TITLE:Cook"));
    EXPECT_EQ(putBehindTheRecord(request(date), card("TITLE:Chef\r\nNOTE:theirs\r\n"), ann, kCXNoteProperty, "again"),
              412);
}

TEST_F(Races, AGroupsCardIsMergedWithASaveOnEitherSideOfItsLookAtTheRecord) {
    ASSERT_EQ(put(request(), groupCard("")), 201);
    read();
    EXPECT_EQ(putBehindTheJournal(request(), groupCard("ORG:Cooks\r\n"), friends, kCXNoteProperty, "theirs"), 204);
    EXPECT_THAT(served(), HasSubstr("NOTE:theirs"));
    EXPECT_THAT(served(), HasSubstr("ORG:Cooks"));
    EXPECT_THAT(served(), HasSubstr("FN:Friends"));
    read();
    const std::string chefs = groupCard("ORG:Chefs\r\nNOTE:theirs\r\n");
    EXPECT_EQ(putBehindTheRecord(request(), chefs, friends, kCXGroupNameProperty, "Pals"), 204);
    EXPECT_THAT(served(), HasSubstr("FN:Pals")) << "a name that the device has not changed";
    EXPECT_THAT(served(), HasSubstr("ORG:Chefs"));
    EXPECT_EQ(putBehindTheJournal(request(tag()), groupCard("ORG:Else\r\n"), friends, kCXNoteProperty, "more"), 412);
}

} // namespace
} // namespace rolvane
