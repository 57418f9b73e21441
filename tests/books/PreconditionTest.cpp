#include "BooksWorld.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

// Each precondition of RFC 6352, RFC 6578 and the RFCs that they stand on: the status, the element that the body names,
// in its namespace, and what stands in it. Nothing is saved by any of the requests.

namespace rolvane {
namespace {

using testing::HasSubstr;
using testing::Not;

constexpr const char *kDav = "DAV:", *kCard = "urn:ietf:params:xml:ns:carddav";

class Preconditions : public testing::Test {
protected:
    Preconditions()
        : ann(world.addPerson("Ann", "Lee")), bob(world.addPerson("Bob", "May")), friends(world.addGroup("F", {ann})),
          others(world.addGroup("O", {ann, bob})),
          shared(world.addSubscription("https://a.example/dav/x", false, "Zoe")),
          position(world.rolvane().journalPosition()) {}
    ~Preconditions() override { EXPECT_EQ(world.rolvane().journalPosition(), position) << "something was saved"; }

    static std::string card(const CXRecordRef& record, const std::string& book = kContacts) {
        return book + BooksWorld::uuidOf(record) + ".vcf";
    }
    static std::string bookOf(const CXRecordRef& group) {
        return "/books/home/group-" + BooksWorld::uuidOf(group) + "/";
    }

    // One request, with the precondition that it fails.
    struct Expected {
        int status;
        const char* space;
        std::string precondition;
        std::string inside = {}; // of the element
    };
    static void expect(const BookAnswer& answer, const Expected& expected) {
        SCOPED_TRACE(expected.precondition);
        EXPECT_EQ(answer.status, expected.status) << answer.body;
        EXPECT_THAT(answer.header("Content-Type"), HasSubstr("xml"));
        EXPECT_EQ(answer.precondition(), expected.precondition) << answer.body;
        const size_t error = answer.body.find("<D:error");
        ASSERT_NE(error, std::string::npos) << answer.body;
        const std::string head = answer.body.substr(error, answer.body.find('>', error) - error);
        EXPECT_THAT(head, HasSubstr("xmlns:D=\"DAV:\""));
        const size_t element = answer.body.find('<', error + 1);
        const std::string prefix = answer.body.substr(element + 1, answer.body.find(':', element) - element - 1);
        EXPECT_THAT(head, HasSubstr("xmlns:" + prefix + "=\"" + expected.space + "\"")) << answer.body;
        EXPECT_THAT(answer.body, HasSubstr(expected.inside));
    }
    BookAnswer report(const std::string& name, const std::string& inside, const std::string& book = kContacts) const {
        return world.report(book, "<C:" + name + " xmlns:D=\"DAV:\" xmlns:C=\"" + kCard + "\">" + inside +
                                      "</C:" + name + ">");
    }
    BookAnswer query(const std::string& filter) const {
        return report("addressbook-query", "<D:prop><D:getetag/></D:prop><C:filter>" + filter + "</C:filter>");
    }

    BooksWorld world;
    CXPersonRef ann, bob;
    CXGroupRef friends, others;
    CXSubscriptionRef shared;
    int64_t position;
};

// RFC 6352 section 5.1.1.1.
TEST_F(Preconditions, OfAReadingInATypeThatCardsAreNotMadeIn) {
    for (const std::string accept :
         {"text/vcard;version=2.1", "text/vcard; version=\"2.1\", text/directory;version=2.0", "text/calendar",
          "application/vcard+json, application/xml"}) {
        SCOPED_TRACE(accept);
        expect(world.ask("GET", card(ann), {{"Accept", accept}}), {406, kCard, "supported-address-data-conversion"});
    }
    for (const std::string accept : {"", "*/*", "text/*;q=0.1", "text/vcard;version=2.1, text/vcard;version=\"3.0\"",
                                     "text/html, */*;q=0.1", "TEXT/VCARD", "text/x-vcard"})
        EXPECT_EQ(world.ask("GET", card(ann), {{"Accept", accept}}).status, 200) << accept;
    EXPECT_THAT(
        world.ask("GET", card(ann), {{"Accept", "text/vcard;charset=utf-8; version=4.0, text/vcard;version=3.0"}}).body,
        HasSubstr("VERSION:4.0"));
}

// RFC 6352 section 6.3.1.1, RFC 5689 section 3: httpd takes no body with MKCOL, and says so.
TEST_F(Preconditions, OfABookThatIsToBeMade) {
    for (const char* path : {"/books/home/mine/", "/books/home/contacts/sub/", "/books/x/"})
        EXPECT_THAT(world.ask("MKCOL", path).status, testing::AnyOf(403, 409)) << path;
    expect(world.ask("MKCOL", "/books/home/mine/"), {403, kCard, "addressbook-collection-location-ok"});
    EXPECT_EQ(world.ask("MKCOL", kContacts).status, 405) << "it is there";
    EXPECT_EQ(
        world
            .ask("MKCOL", "/books/home/mine/", {{"Content-Type", "application/xml"}},
                 "<D:mkcol xmlns:D=\"DAV:\"><D:set><D:prop><D:resourcetype><D:collection/></D:resourcetype></D:prop>"
                 "</D:set></D:mkcol>")
            .status,
        415);
}

// RFC 6352 section 6.3.2.1.
TEST_F(Preconditions, OfACardThatIsWritten) {
    const std::string fresh = std::string(kContacts) + "fresh.vcf", good = cardOf("fresh", "A", "B");
    expect(world.put(fresh, "BEGIN:VCARD\r\nVERSION:2.1\r\nUID:a\r\nN:x\r\nEND:VCARD\r\n"),
           {403, kCard, "supported-address-data"});
    expect(world.ask("PUT", fresh, {{"Content-Type", "text/calendar"}}, good), {403, kCard, "supported-address-data"});
    expect(world.put(fresh, "no card"), {403, kCard, "valid-address-data"});
    expect(world.put(fresh, good + cardOf("second", "A", "B")), {403, kCard, "valid-address-data"});
    expect(world.put(fresh, cardOf("urn:uuid:" + BooksWorld::uuidOf(ann), "Ann", "Lee")),
           {409, kCard, "no-uid-conflict", "<D:href>" + card(ann) + "</D:href>"});
    expect(world.put(card(ann), good), {409, kCard, "no-uid-conflict", "<D:href>" + card(ann) + "</D:href>"});
    expect(world.put("/books/home/nowhere/x.vcf", good), {403, kCard, "addressbook-collection-location-ok"});
    expect(world.put(fresh, cardOf("big", "A", "B", "NOTE:" + std::string(size_t{33} << 20, 'x') + "\r\n")),
           {403, kCard, "max-resource-size"});
    const std::string book = "/books/home/shared-" + BooksWorld::uuidOf(shared) + "/";
    expect(world.put(book + "x.vcf", good),
           {403, kDav, "need-privileges",
            "<D:resource><D:href>" + book + "</D:href><D:privilege><D:write/></D:privilege></D:resource>"});
    for (const char* header : {"If-Match", "If-None-Match"})
        EXPECT_EQ(world.put(header == std::string("If-Match") ? fresh : card(ann), good, {{header, "*"}}).status, 412);
}

// RFC 6352 section 6.3.2.1, for COPY and MOVE: a card is in a book once, by one name.
TEST_F(Preconditions, OfACardThatIsCopiedOrMoved) {
    const auto to = [&](const std::string& method, const std::string& from, const std::string& path) {
        return world.ask(method, from, {{"Destination", path}, {"Overwrite", "T"}});
    };
    expect(to("COPY", card(ann), std::string(kContacts) + "twice.vcf"),
           {409, kCard, "no-uid-conflict", "<D:href>" + card(ann) + "</D:href>"});
    expect(to("COPY", card(ann, bookOf(friends)), std::string(kContacts) + "twice.vcf"),
           {409, kCard, "no-uid-conflict", "<D:href>" + card(ann) + "</D:href>"});
    for (const char* method : {"COPY", "MOVE"}) {
        SCOPED_TRACE(method);
        expect(to(method, card(ann, bookOf(friends)), bookOf(others) + "twice.vcf"),
               {409, kCard, "no-uid-conflict", "<D:href>" + card(ann, bookOf(others)) + "</D:href>"});
        expect(to(method, card(friends), bookOf(others) + "g.vcf"), {403, kCard, "addressbook-collection-location-ok"});
        EXPECT_EQ(to(method, kContacts, "/books/home/copy/").status, 403);
        EXPECT_EQ(to(method, card(ann), "/elsewhere/x.vcf").status, 405);
        EXPECT_EQ(world
                      .ask(method, card(ann, bookOf(friends)),
                           {{"Destination", card(ann, bookOf(others))}, {"Overwrite", "F"}})
                      .status,
                  412);
    }
}

// RFC 6352 sections 8.3.1, 8.6 and 8.7; RFC 3253 section 3.6.
TEST_F(Preconditions, OfReports) {
    const std::string wrong = "<D:prop><C:address-data content-type=\"text/vcard\" version=\"2.1\"/></D:prop>";
    expect(report("addressbook-query", wrong + "<C:filter/>"), {403, kCard, "supported-address-data"});
    expect(report("addressbook-multiget", wrong + "<D:href>" + card(ann) + "</D:href>"),
           {403, kCard, "supported-address-data"});
    expect(report("addressbook-multiget",
                  "<D:prop><C:address-data content-type=\"text/html\"/></D:prop><D:href>" + card(ann) + "</D:href>"),
           {403, kCard, "supported-address-data"});
    expect(query("<C:prop-filter name=\"FN\"><C:text-match collation=\"i;other\">x</C:text-match></C:prop-filter>"),
           {403, kCard, "supported-collation"});
    expect(query("<C:prop-filter name=\"FN\"><C:sounds-like/></C:prop-filter>"), {403, kCard, "supported-filter"});
    expect(report("addressbook-query", "<C:filter/>", "/books/home/"), {403, kDav, "supported-report"});
    expect(report("addressbook-multiget", "<D:href>x</D:href>", card(ann)), {403, kDav, "supported-report"});
    expect(report("calendar-query", ""), {403, kDav, "supported-report"});
    const auto cut = report("addressbook-query", "<D:prop/><C:filter/><C:limit><C:nresults>1</C:nresults></C:limit>");
    EXPECT_EQ(cut.status, 207);
    EXPECT_EQ(cut.responses().back().status, 507);
    EXPECT_THAT(cut.responses().back().text, HasSubstr("<D:error><D:number-of-matches-within-limits/></D:error>"));
}

// RFC 6578 sections 3.2 to 3.6.
TEST_F(Preconditions, OfASynchronisation) {
    expect(world.sync(kContacts, "urn:else"), {403, kDav, "valid-sync-token"});
    expect(world.sync(kContacts, world.sync(kContacts, "").syncToken() + "1"), {403, kDav, "valid-sync-token"});
    expect(world.report(kContacts,
                        "<D:sync-collection xmlns:D=\"DAV:\"><D:sync-token/><D:sync-level>infinite</D:sync-level>"
                        "<D:prop/></D:sync-collection>"),
           {403, kDav, "sync-traversal-supported"});
    expect(world.sync("/books/home/", ""), {403, kDav, "supported-report"});
    const auto cut = world.sync(kContacts, "", "<D:limit><D:nresults>1</D:nresults></D:limit>");
    EXPECT_EQ(cut.responses().back().status, 507);
    EXPECT_EQ(cut.responses().back().href, kContacts);
    EXPECT_THAT(cut.responses().back().text, HasSubstr("<D:error><D:number-of-matches-within-limits/></D:error>"));
    EXPECT_NE(cut.syncToken(), "");
}

// RFC 4918 sections 9.1 and 9.2: of the properties none can be set, and nobody reads the whole tree at once.
TEST_F(Preconditions, OfProperties) {
    for (const std::string name :
         {"<D:displayname/>", "<D:sync-token/>", "<C:addressbook-description/>", "<D:getetag/>"}) {
        const auto answer = world.ask("PROPPATCH", kContacts, {{"Content-Type", "application/xml"}},
                                      std::string("<D:propertyupdate xmlns:D=\"DAV:\" xmlns:C=\"") + kCard +
                                          "\"><D:set><D:prop>" + name + "</D:prop></D:set></D:propertyupdate>");
        EXPECT_EQ(answer.status, 207) << name;
        EXPECT_THAT(answer.body, HasSubstr("<D:status>HTTP/1.1 403 ")) << name;
        EXPECT_THAT(answer.body, Not(HasSubstr("<D:status>HTTP/1.1 200 "))) << name;
    }
    EXPECT_EQ(world.ask("PROPFIND", "/books/", {{"Depth", "infinity"}}).status, 403);
}

} // namespace
} // namespace rolvane
