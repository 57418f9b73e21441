#include "BooksWorld.h"

#include "server/mod_cardbook/CatchUp.h"
#include "server/mod_cardbook/Devices.h"
#include "server/mod_cardbook/Library.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <random>
#include <set>

namespace rolvane {
namespace {

using testing::HasSubstr;

std::string hrefOf(const CXRecordRef& record) {
    return kContacts + BooksWorld::uuidOf(record) + ".vcf";
}

// A client that knows nothing but what it is told.
struct Client {
    const BooksWorld& world;
    std::string book = kContacts, token = {};
    std::map<std::string, std::string> tags = {};

    size_t sync(const std::string& limit = {}) {
        size_t told = 0;
        for (bool more = true; more;) {
            more = false;
            const auto answer = world.sync(
                book, token, limit.empty() ? limit : "<D:limit><D:nresults>" + limit + "</D:nresults></D:limit>");
            EXPECT_EQ(answer.status, 207) << answer.body;
            if (answer.status != 207) return told;
            for (const BookResponse& each : answer.responses()) {
                if (each.status == 507) {
                    EXPECT_EQ(each.href, book);
                    more = true;
                    continue;
                }
                ++told;
                if (each.status == 404)
                    tags.erase(each.href);
                else
                    tags[each.href] = each.property("D:getetag");
            }
            token = answer.syncToken();
        }
        return told;
    }
    std::map<std::string, std::string> served() const {
        std::map<std::string, std::string> all;
        for (const BookResponse& each : world.propfind(book, 1, "<D:getetag/>").responses())
            if (each.href != book) all[each.href] = each.property("D:getetag");
        return all;
    }
};

TEST(Sync, TellsExactlyWhatChangedWhoeverDidIt) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee"), bob = world.addPerson("Bob", "May");
    Client client{world};
    EXPECT_EQ(client.sync(), 2u);
    EXPECT_EQ(client.sync(), 0u) << "nothing has changed";
    ann->setValue("changed", kCXNoteProperty);
    world.rolvane().removeRecord(bob);
    world.rolvane().save();
    const auto cem = world.addPerson("Cem", "Ay");
    EXPECT_EQ(client.sync(), 3u);
    EXPECT_EQ(client.tags, client.served());
    EXPECT_TRUE(client.tags.contains(hrefOf(cem)));
    EXPECT_FALSE(client.tags.contains(hrefOf(bob)));
    const auto group = world.addGroup("Friends", {ann});
    EXPECT_EQ(client.sync(), 1u) << "the group's card; its member's is as it was";
    group->addMember(cem);
    world.rolvane().save();
    EXPECT_EQ(client.sync(), 1u);
    world.rolvane().removeRecord(cem);
    world.rolvane().save();
    EXPECT_EQ(client.sync(), 2u) << "the person's card and that of the group which lost a member";
    EXPECT_EQ(client.tags, client.served());
}

// The removal of a listed group has no line in the journal for the groups that list it.
TEST(Sync, TellsOfAGroupThatHasLostASubgroup) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee");
    const auto inner = world.addGroup("Inner", {ann}), outer = world.addGroup("Outer", {ann});
    ASSERT_TRUE(outer->addSubgroup(inner));
    world.rolvane().save();
    Client client{world};
    EXPECT_EQ(client.sync(), 3u);
    world.rolvane().removeRecord(inner);
    world.rolvane().save();
    EXPECT_EQ(client.sync(), 2u) << "the group that has gone, and the one that listed it";
    EXPECT_EQ(client.tags, client.served());
    const auto card = world.ask("GET", hrefOf(outer));
    EXPECT_EQ(world.put(hrefOf(outer), card.body, {{"If-Match", card.tag()}}).status, 204);
}

TEST(Sync, GoesOnWhereItWasCutOff) {
    BooksWorld world;
    std::vector<CXPersonRef> people;
    for (int i = 0; i < 25; ++i) people.push_back(world.addPerson("P" + std::to_string(i), "X"));
    const auto first = world.sync(kContacts, "", "<D:limit><D:nresults>10</D:nresults></D:limit>");
    const auto responses = first.responses();
    ASSERT_EQ(responses.size(), 11u);
    EXPECT_EQ(responses.back().status, 507);
    EXPECT_THAT(responses.back().text, HasSubstr("number-of-matches-within-limits"));
    Client client{world};
    EXPECT_EQ(client.sync("10"), 25u);
    for (int i = 0; i < 15; ++i) world.rolvane().removeRecord(people[static_cast<size_t>(i)]);
    world.rolvane().save();
    EXPECT_EQ(client.sync("4"), 15u);
    EXPECT_EQ(client.tags, client.served());
    EXPECT_EQ(client.tags.size(), 10u);
}

TEST(Sync, IsExactOverRestartsAndWhereTheJournalWasCutOff) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee"), bob = world.addPerson("Bob", "May");
    Client client{world};
    EXPECT_EQ(client.sync(), 2u);
    world.restart(true);
    EXPECT_EQ(client.sync(), 0u);
    ann->setValue("once more", kCXNoteProperty);
    world.rolvane().removeRecord(bob);
    world.rolvane().save();
    // More lines than the journal keeps for the books.
    std::vector<CXPersonRef> many;
    for (int i = 0; i < 3000; ++i)
        many.push_back(
            CXPerson::personFromDictionary({{kCXFirstNameProperty, "Many"}}, &world.rolvane(), false, false));
    world.rolvane().save();
    for (int round = 0; round < 4; ++round) {
        for (const auto& person : many) person->setValue(std::to_string(round), kCXNoteProperty);
        world.rolvane().save();
    }
    world.addPerson("Last", "One"); // a save cuts off what was too much before it
    ASSERT_GT(world.rolvane().journalEntries(0, 1).front().sequence, 4000) << "it was cut off";
    EXPECT_EQ(client.sync(), 3003u) << "Ann, the many, the last one, and Bob who has gone";
    EXPECT_EQ(client.tags, client.served());
}

TEST(Sync, RefusesTokensThatSayNothing) {
    BooksWorld world;
    world.addPerson("Ann", "Lee");
    const std::string good = world.sync(kContacts, "").syncToken();
    ASSERT_NE(good, "");
    for (const std::string& token : {std::string("urn:else"), good + "1", good.substr(0, good.size() - 1) + "x",
                                     std::string("urn:x-rolvane:books:0000000000000000:1")}) {
        const auto answer = world.sync(kContacts, token);
        EXPECT_EQ(answer.status, 403) << token;
        EXPECT_EQ(answer.precondition(), "valid-sync-token") << answer.body;
    }
    EXPECT_EQ(world
                  .report(kContacts,
                          "<D:sync-collection xmlns:D=\"DAV:\"><D:sync-token/><D:sync-level>infinite</D:sync-level>"
                          "<D:prop/></D:sync-collection>")
                  .precondition(),
              "sync-traversal-supported");
}

// Thunderbird begins anew where a token is refused with 400, and with no other status.
TEST(Sync, RefusesTokensInAWayThatThunderbirdGetsOver) {
    BooksWorld world;
    const auto asked = [&](const std::string& program, const std::string& level) {
        return world.ask("REPORT", kContacts, {{"Content-Type", "application/xml"}, {"User-Agent", program}},
                         "<D:sync-collection xmlns:D=\"DAV:\"><D:sync-token>urn:else</D:sync-token><D:sync-level>" +
                             level + "</D:sync-level><D:prop/></D:sync-collection>");
    };
    const std::string thunderbird = "Mozilla/5.0 (X11; Linux x86_64; rv:153.0) Gecko/20100101 Thunderbird/153.7.0";
    EXPECT_EQ(asked(thunderbird, "1").status, 400);
    EXPECT_EQ(asked(thunderbird, "1").precondition(), "valid-sync-token");
    EXPECT_EQ(asked("Evolution/3.46", "1").status, 403);
    EXPECT_EQ(asked(thunderbird, "infinite").status, 403) << "another precondition";
}

TEST(Sync, GoesOnOnAnEarlierCopyOfTheDatabaseAndKeepsTheNames) {
    test::TempDirectory directory;
    const std::string path = directory / "contacts.db";
    const auto open = [&] {
        CXRolvane::Options options;
        options.path = path;
        options.program = "test";
        return std::make_unique<CXRolvane>(options);
    };
    auto rolvane = open();
    const auto ann = CXPerson::personFromDictionary({{kCXFirstNameProperty, "Ann"}}, rolvane.get(), false, false);
    rolvane->save();
    int64_t before = 0;
    const UniqueId uid = ann->uniqueId();
    {
        cardbook::Library library(path);
        {
            cardbook::BookMemory::Change change(library.memory());
            library.memory().wish(cardbook::kContactsBook, uid, "mine.vcf");
            change.commit();
        }
        library.catchUp();
        EXPECT_TRUE(library.memory().named(cardbook::kContactsBook, "mine.vcf"));
    }
    rolvane.reset();
    std::filesystem::copy_file(path, directory / "backup");
    rolvane = open();
    CXPerson::personFromDictionary({{kCXFirstNameProperty, "Bob"}}, rolvane.get(), false, false);
    rolvane->save();
    {
        cardbook::Library library(path);
        library.catchUp();
        before = library.memory().latest(cardbook::kContactsBook);
    }
    rolvane.reset();
    for (const char* suffix : {"", "-wal", "-shm"}) std::filesystem::remove(path + suffix);
    std::filesystem::copy_file(directory / "backup", path);
    cardbook::Library library(path);
    library.catchUp();
    const auto told = library.memory().after(cardbook::kContactsBook, before, true, 10);
    ASSERT_EQ(told.size(), 1u) << "a client that had Bob hears that he has gone, and nothing else";
    EXPECT_TRUE(told.front().gone);
    EXPECT_TRUE(library.memory().named(cardbook::kContactsBook, "mine.vcf"));
}

TEST(BookMemory, OfAFormBeforeKeepsNamesAndTokensAndLooksAtEverybodyOnceMore) {
    for (const int format : {1, 2, 3, 4}) {
        test::TempDirectory directory;
        std::string epoch;
        {
            cardbook::BookMemory memory(directory / "books", 1000);
            epoch = memory.epoch();
            cardbook::BookMemory::Change change(memory);
            memory.note("contacts", UniqueId("1:CXPerson"), Date(1));
            memory.setPosition(7, {});
            cardbook::Devices(memory).noteLook("laptop", "contacts", 1, Date(1));
            change.commit();
            if (format < 2) memory.sqlite().execute("DROP TABLE joined");
            if (format < 4) memory.sqlite().execute("DROP TABLE waiting");
            memory.sqlite().execute("DROP TABLE told");
            memory.sqlite().execute("PRAGMA user_version=" + std::to_string(format));
        }
        cardbook::BookMemory memory(directory / "books", 1000);
        EXPECT_EQ(memory.epoch(), epoch) << format;
        EXPECT_EQ(memory.position(), format < 4 ? -1 : 7) << format;
        EXPECT_TRUE(memory.named("contacts", "1.vcf")) << format;
        EXPECT_FALSE(memory.joinedAs("x")) << format;
        EXPECT_TRUE(memory.waitingFor("x").empty()) << format;
        EXPECT_EQ(cardbook::Devices(memory).lookedAt("laptop", "contacts"), format < 3 ? -1 : 1);
    }
}

TEST(BookMemory, ForgetsTheOldestDeparturesAndTheirTokens) {
    test::TempDirectory directory;
    cardbook::BookMemory memory(directory / "books", 1000, 10);
    {
        cardbook::BookMemory::Change change(memory);
        for (int i = 0; i < 30; ++i) memory.note("contacts", UniqueId(std::to_string(i) + ":CXPerson"), Date(1));
        memory.note("group-1", UniqueId("0:CXPerson"), Date(1));
        for (int i = 0; i < 25; ++i) memory.noteGone("contacts", UniqueId(std::to_string(i) + ":CXPerson"));
        memory.forgetOldDepartures();
        change.commit();
    }
    const auto all = memory.after("contacts", 0, true, 100);
    EXPECT_EQ(std::count_if(all.begin(), all.end(), [](const auto& m) { return m.gone; }), 10);
    EXPECT_EQ(memory.forgottenUntil("contacts"), all[all.size() - 10].sequence - 1);
    EXPECT_EQ(memory.forgottenUntil("group-1"), 0) << "nobody has left it";
}

// Anybody's saves in any order: a client that follows by tokens has what a listing shows, book by book.
TEST(Sync, FollowsRandomChanges) {
    const unsigned seed = std::getenv("ROLVANE_TEST_SEED")
                              ? static_cast<unsigned>(std::atoi(std::getenv("ROLVANE_TEST_SEED")))
                              : std::random_device()();
    std::mt19937 random(seed);
    const auto pick = [&](size_t below) { return std::uniform_int_distribution<size_t>(0, below - 1)(random); };
    BooksWorld world;
    std::vector<CXPersonRef> people;
    std::vector<CXGroupRef> groups = {world.addGroup("A", {}), world.addGroup("B", {})};
    std::vector<Client> clients = {{world}};
    for (const auto& group : groups) clients.push_back({world, "/books/home/group-" + BooksWorld::uuidOf(group) + "/"});
    for (int step = 0; step < 60; ++step) {
        for (size_t n = 1 + pick(4); n > 0; --n) {
            const size_t what = pick(6);
            if (people.empty() || what == 0) {
                people.push_back(CXPerson::personFromDictionary({{kCXFirstNameProperty, "P" + std::to_string(step)}},
                                                                &world.rolvane(), false, false));
                continue;
            }
            const size_t who = pick(people.size());
            const auto& group = groups[pick(groups.size())];
            if (what == 1) people[who]->setValue(std::to_string(step), kCXNoteProperty);
            if (what == 2) group->addMember(people[who]);
            if (what == 3) group->removeMember(people[who]);
            if (what == 4) group->setValue("Name " + std::to_string(step), kCXGroupNameProperty);
            if (what == 5) {
                world.rolvane().removeRecord(people[who]);
                people.erase(people.begin() + static_cast<std::ptrdiff_t>(who));
            }
        }
        world.rolvane().save();
        if (pick(10) == 0) world.restart(pick(2) == 0);
        for (Client& client : clients) {
            if (pick(2)) client.sync(pick(2) ? "2" : "");
        }
    }
    for (Client& client : clients) {
        client.sync();
        EXPECT_EQ(client.tags, client.served()) << client.book << " seed " << seed;
    }
}

} // namespace
} // namespace rolvane
