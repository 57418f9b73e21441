#include "BooksWorld.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <map>
#include <set>

// What a client finds and reads, by raw HTTP.

namespace rolvane {
namespace {

using testing::HasSubstr;
using testing::Not;

std::string hrefOf(const CXRecordRef& record, const std::string& book = kContacts) {
    return book + BooksWorld::uuidOf(record) + ".vcf";
}

TEST(Books, AreFoundFromTheHostAlone) {
    BooksWorld world;
    const auto known = world.ask("PROPFIND", "/.well-known/carddav");
    EXPECT_EQ(known.status, 301);
    EXPECT_THAT(known.header("Location"), testing::EndsWith("/books/"));
    const auto root = world.propfind("/books/", 0, "<D:current-user-principal/><D:resourcetype/>");
    ASSERT_EQ(root.status, 207) << root.body << world.log();
    EXPECT_THAT(root.body, HasSubstr("<D:current-user-principal><D:href>/books/principal/</D:href>"));
    const auto principal = world.propfind("/books/principal/", 0, "<C:addressbook-home-set/><D:displayname/>");
    EXPECT_THAT(principal.body, HasSubstr("<D:href>/books/home/</D:href>"));
    EXPECT_THAT(principal.body, HasSubstr(">laptop<"));
    const auto home = world.propfind("/books/home/", 1, "<D:resourcetype/><D:displayname/>");
    const auto responses = home.responses();
    ASSERT_EQ(responses.size(), 2u) << home.body;
    const auto* contacts = home.find(responses, kContacts);
    ASSERT_NE(contacts, nullptr);
    EXPECT_THAT(contacts->text, HasSubstr("addressbook"));
    EXPECT_EQ(contacts->property("D:displayname"), "Contacts");
}

TEST(Books, SayWhatAClientNeedsToKnow) {
    BooksWorld world;
    const auto options = world.ask("OPTIONS", kContacts);
    EXPECT_THAT(options.header("DAV"), HasSubstr("addressbook"));
    EXPECT_THAT(options.header("Allow"), HasSubstr("REPORT"));
    const auto answer = world.propfind(
        kContacts, 0,
        "<D:supported-report-set/><C:supported-address-data/><C:max-resource-size/><C:addressbook-description/>"
        "<D:sync-token/><S:getctag/><D:current-user-privilege-set/><D:owner/><C:supported-collation-set/>");
    const auto responses = answer.responses();
    ASSERT_EQ(responses.size(), 1u) << answer.body;
    const BookResponse& book = responses.front();
    for (const char* report : {"addressbook-multiget", "addressbook-query", "sync-collection"})
        EXPECT_THAT(book.property("D:supported-report-set"), HasSubstr(report));
    EXPECT_THAT(book.property("C:supported-address-data"), HasSubstr("version=\"4.0\""));
    EXPECT_EQ(book.property("C:max-resource-size"), "33554432");
    EXPECT_NE(book.property("C:addressbook-description"), "");
    EXPECT_NE(book.property("CS:getctag"), "");
    EXPECT_THAT(book.property("D:current-user-privilege-set"), HasSubstr("<D:write-content/>"));
    EXPECT_THAT(answer.body, Not(HasSubstr(" 404 ")));
}

TEST(Books, HaveNamesAndColoursThatStay) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee");
    std::map<std::string, std::string> names{{kContacts, "Contacts"}};
    for (const char* name : {"Friends", "Choir", "Works & Co", "Neighbours", "Club"})
        names["/books/home/group-" + BooksWorld::uuidOf(world.addGroup(name, {ann})) + "/"] = name;
    const auto look = [&] {
        std::map<std::string, std::string> colours;
        const auto answer = world.propfind(
            "/books/home/", 1, "<D:displayname/><I:addressbook-color xmlns:I=\"http://inf-it.com/ns/ab/\"/>");
        for (const BookResponse& book : answer.responses()) {
            if (!names.contains(book.href)) continue;
            std::string name = book.property("D:displayname");
            if (const size_t at = name.find("&amp;"); at != std::string::npos) name.replace(at, 5, "&");
            EXPECT_EQ(name, names.at(book.href));
            const size_t hash = book.text.find('#');
            colours[book.href] = hash == std::string::npos ? answer.body : book.text.substr(hash, 9);
        }
        return colours;
    };
    const auto colours = look();
    ASSERT_EQ(colours.size(), names.size());
    std::set<std::string> different;
    for (const auto& [book, colour] : colours) {
        EXPECT_THAT(colour, testing::MatchesRegex("#[0-9a-f]+")) << book;
        EXPECT_EQ(colour.size(), 9U) << "red, green, blue and how opaque it is";
        different.insert(colour);
    }
    EXPECT_GT(different.size(), 1U);
    world.restart();
    EXPECT_EQ(look(), colours);
}

TEST(Books, AskWhoItIs) {
    BooksWorld world;
    EXPECT_EQ(world.ask("PROPFIND", kContacts, {}, {}, "").status, 401);
    EXPECT_EQ(world.ask("GET", "/books/", {}, {}, "stranger").status, 401);
}

TEST(Books, AreNotServedWhereNobodyIsAsked) {
    BooksWorld::Options options;
    options.signedIn = false;
    BooksWorld world(options);
    EXPECT_EQ(world.propfind(kContacts, 1, "<D:getetag/>").status, 500);
    EXPECT_THAT(world.log(), HasSubstr("Nobody is signed in"));
}

TEST(Books, DoNotPutANewDatabaseInThePlaceOfALostOne) {
    BooksWorld world;
    world.addPerson("Ann", "Lee");
    EXPECT_EQ(world.propfind(kContacts, 1, "<D:getetag/>").responses().size(), 2u);
    for (const char* suffix : {"", "-wal", "-shm"}) std::filesystem::remove(world.database() + suffix);
    EXPECT_EQ(world.propfind(kContacts, 1, "<D:getetag/>").status, 500) << "and no client takes it for empty";
    EXPECT_FALSE(std::filesystem::exists(world.database()));
    EXPECT_THAT(world.log(), HasSubstr("There is no contact database"));
}

TEST(Books, ShowEveryOwnPersonAndGroupAsACard) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee"), bob = world.addPerson("Bob", "Öz");
    const auto friends = world.addGroup("Friends", {ann});
    const auto listing = world.propfind(kContacts, 1, "<D:getetag/><D:getcontenttype/><D:resourcetype/>");
    const auto responses = listing.responses();
    ASSERT_EQ(responses.size(), 4u) << listing.body;
    const auto* one = listing.find(responses, hrefOf(ann));
    ASSERT_NE(one, nullptr) << listing.body;
    const auto got = world.ask("GET", hrefOf(ann));
    EXPECT_EQ(got.status, 200);
    EXPECT_THAT(got.body, HasSubstr("VERSION:3.0\r\n"));
    EXPECT_THAT(got.body, HasSubstr("N:Lee;Ann;"));
    EXPECT_EQ(one->property("lp1:getetag") + one->property("D:getetag"),
              "&quot;" + got.tag().substr(1, got.tag().size() - 2) + "&quot;");
    EXPECT_THAT(world.ask("GET", hrefOf(bob)).body, HasSubstr("Öz"));
    const auto group = world.ask("GET", hrefOf(friends), {{"Accept", "text/vcard;version=4.0"}});
    EXPECT_THAT(group.body, HasSubstr("KIND:group"));
    EXPECT_THAT(group.body, HasSubstr("MEMBER:urn:uuid:" + BooksWorld::uuidOf(ann)));
    EXPECT_THAT(group.body, Not(HasSubstr(BooksWorld::uuidOf(bob))));
    const auto older = world.ask("GET", hrefOf(friends), {{"Accept", "text/vcard;version=3.0"}});
    EXPECT_THAT(older.body, HasSubstr("X-ADDRESSBOOKSERVER-KIND:group\r\n")) << "as phones know groups";
    EXPECT_THAT(older.body, HasSubstr("X-ADDRESSBOOKSERVER-MEMBER:urn:uuid:" + BooksWorld::uuidOf(ann)));
    EXPECT_EQ(world.ask("GET", hrefOf(ann), {{"If-None-Match", got.tag()}}).status, 304);
    EXPECT_EQ(world.ask("GET", std::string(kContacts) + "nobody.vcf").status, 404);
    EXPECT_EQ(world.ask("PROPFIND", "/books/home/other/", {{"Depth", "0"}}).status, 404);
    EXPECT_EQ(world.ask("PROPFIND", "/books/home/contacts/a/b", {{"Depth", "0"}}).status, 404);
}

TEST(Multiget, GivesTheCardsThatAreThereInBothVersions) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee", {{kCXNoteProperty, "a < b & c\nsecond"}});
    const auto answer =
        world.multiget(kContacts, {hrefOf(ann), std::string(kContacts) + "gone.vcf", "/elsewhere", "%zz"});
    ASSERT_EQ(answer.status, 207) << answer.body;
    const auto responses = answer.responses();
    ASSERT_EQ(responses.size(), 4u) << answer.body;
    EXPECT_EQ(responses[0].card(), world.ask("GET", hrefOf(ann)).body) << "with its line ends";
    EXPECT_THAT(responses[0].card(), HasSubstr("a < b & c\\nsecond"));
    for (size_t i : {1, 2, 3}) EXPECT_EQ(responses[i].status, 404) << i;
    const auto four = world.multiget(kContacts, {"http://localhost:" + std::to_string(world.port()) + hrefOf(ann)},
                                     "<C:address-data content-type=\"text/vcard\" version=\"4.0\"/>");
    EXPECT_THAT(four.body, HasSubstr("VERSION:4.0"));
    const auto part =
        world.multiget(kContacts, {hrefOf(ann)},
                       "<C:address-data><C:prop name=\"FN\"/><C:prop name=\"note\" novalue=\"yes\"/></C:address-data>");
    EXPECT_EQ(part.responses().at(0).card(), "BEGIN:VCARD\r\nVERSION:3.0\r\nFN:Ann Lee\r\nNOTE:\r\nEND:VCARD\r\n");
    const auto unknown =
        world.multiget(kContacts, {hrefOf(ann)}, "<C:address-data content-type=\"text/vcard\" version=\"2.1\"/>");
    EXPECT_EQ(unknown.status, 403);
    EXPECT_EQ(unknown.precondition(), "supported-address-data");
}

TEST(Reports, RefuseWhatTheyAreNotMadeFor) {
    BooksWorld world;
    EXPECT_EQ(world.report("/books/home/", "<D:sync-collection xmlns:D=\"DAV:\"><D:sync-token/></D:sync-collection>")
                  .precondition(),
              "supported-report");
    EXPECT_EQ(world.report(kContacts, "<D:version-tree xmlns:D=\"DAV:\"/>").status, 403);
    EXPECT_EQ(world.report(kContacts, "<D:sync-collection xmlns:D=\"DAV:\"/>").status, 400);
    EXPECT_EQ(world.report(kContacts, "no xml").status, 400);
    EXPECT_EQ(world.sync(kContacts, "", "<D:limit><D:nresults>x</D:nresults></D:limit>").status, 400);
    std::string bomb = "<!DOCTYPE a [<!ENTITY a \"aaaaaaaaaa\">";
    for (char c = 'b'; c < 'k'; ++c) {
        const std::string inner = std::string("&") + static_cast<char>(c - 1) + ";";
        bomb += std::string("<!ENTITY ") + c + " \"" + inner + inner + inner + inner + inner + inner + inner + "\">";
    }
    const auto refused = world.report(kContacts, bomb + "]><D:sync-collection xmlns:D=\"DAV:\"><D:sync-token>&j;"
                                                        "</D:sync-token></D:sync-collection>");
    EXPECT_EQ(refused.status, 400) << "declared entities are not expanded";
}

TEST(Reports, AreBoundedInTheirBodies) {
    BooksWorld::Options options;
    options.directives = "CardBookMaxReport 2000";
    BooksWorld world(options);
    EXPECT_EQ(world.multiget(kContacts, std::vector<std::string>(10, "/books/home/contacts/a.vcf")).status, 207);
    EXPECT_EQ(world.multiget(kContacts, std::vector<std::string>(200, "/books/home/contacts/a.vcf")).status, 413);
}

TEST(Configuration, IsToldWhatIsWrongWithIt) {
    BooksWorld::Options options;
    options.directives = "CardBookMaxCard many";
    EXPECT_THROW(BooksWorld{options}, std::runtime_error);
}

// "Contacts" is what the own book is called: a program that showed two of them could not be used.
TEST(Books, OfASubscriptionAreCalledByWhoShares) {
    BooksWorld world;
    world.addSubscription("https://store.example/dav/choir/Contacts", false, "Zoe");
    world.addSubscription("https://store.example/dav/walter/Friends/", false, "Yan");
    const std::string books = world.propfind("/books/home/", 1, "<D:displayname/>").body;
    EXPECT_THAT(books, HasSubstr("<D:displayname>choir</D:displayname>"));
    EXPECT_THAT(books, HasSubstr("<D:displayname>Friends</D:displayname>"));
    EXPECT_EQ(books.find("<D:displayname>Contacts<"), books.rfind("<D:displayname>Contacts<")) << "the own one alone";
}

} // namespace
} // namespace rolvane
