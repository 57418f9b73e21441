#include "BooksWorld.h"

#include "contacts/records/PersonJoining.h"
#include "contacts/vcard/VCardFields.h"
#include "foundation/Sqlite.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

// What a client writes, by raw HTTP, against the database that it changes.

namespace rolvane {
namespace {

using testing::HasSubstr;
using testing::Not;

const std::string kUUID = "6F0C1B2A-8B7E-4B53-9B7E-0B8C3D1E2F3A";

std::string at(const std::string& name, const std::string& book = kContacts) {
    return book + name;
}
std::string bookOf(const CXGroupRef& group) {
    return "/books/home/group-" + BooksWorld::uuidOf(group) + "/";
}
UniqueId personCalled(const std::string& uuid) {
    return UniqueId(uuid + ":CXPerson");
}
CXPersonRef person(BooksWorld& world, const std::string& uuid = kUUID) {
    return std::dynamic_pointer_cast<CXPerson>(world.rolvane().recordForUniqueId(personCalled(uuid)));
}
std::vector<std::string> phonesOf(const CXPersonRef& who) {
    std::vector<std::string> all;
    if (const auto multi = who->multiValueForProperty(kCXPhoneProperty))
        for (const auto& entry : multi->entries()) all.push_back(entry.value.string());
    return all;
}

// Nothing of what the database holds is another one than before.
struct Unchanged {
    explicit Unchanged(BooksWorld& theWorld) : world(theWorld), position(world.rolvane().journalPosition()) {}
    ~Unchanged() { EXPECT_EQ(world.rolvane().journalPosition(), position) << "something was saved"; }
    BooksWorld& world;
    int64_t position;
};

TEST(Put, MakesAPersonWhoIsServedByTheClientsOwnBytes) {
    BooksWorld world;
    const std::string card =
        cardOf("urn:uuid:" + kUUID, "Ann", "Lee", "TEL;TYPE=CELL:+1 555\r\nX-COLOUR:red\r\nNOTE:so\r\n");
    const auto made = world.put(at("ann.vcf"), card, {{"If-None-Match", "*"}});
    ASSERT_EQ(made.status, 201) << made.body << world.log();
    const auto got = world.ask("GET", at("ann.vcf"));
    EXPECT_EQ(got.body, card);
    EXPECT_EQ(got.tag(), made.tag()) << "the client's bytes were whole, so it was told the tag";
    ASSERT_TRUE(person(world));
    EXPECT_EQ(person(world)->displayName(), "Ann Lee");
    EXPECT_EQ(person(world)->valueForProperty(kCXNoteProperty).string(), "so");
    EXPECT_EQ(world.put(at("ann.vcf"), card, {{"If-None-Match", "*"}}).status, 412);
    EXPECT_THAT(world.ask("GET", at("ann.vcf"), {{"Accept", "text/vcard; version=4.0"}}).body,
                HasSubstr("VERSION:4.0"));
    EXPECT_EQ(world.multiget(kContacts, {at("ann.vcf")}).responses().at(0).card(), card);
    world.restart(true);
    EXPECT_EQ(world.ask("GET", at("ann.vcf")).body, card) << "over restarts";
    person(world)->setValue("else", kCXNoteProperty);
    world.rolvane().save();
    const auto edited = world.ask("GET", at("ann.vcf"));
    EXPECT_THAT(edited.body, HasSubstr("NOTE:else"));
    EXPECT_THAT(edited.body, HasSubstr("X-COLOUR:red"));
    EXPECT_NE(edited.tag(), made.tag());
    EXPECT_EQ(world.rolvane().journalEntries(0).front().program, "books");
}

TEST(Put, KeepsAUIDAsItsClientSpellsIt) {
    BooksWorld world;
    for (const char* uid : {"abc-1", "6f0c1b2a-8b7e-4b53-9b7e-0b8c3d1e2f3b", "6F0C1B2A-8B7E-4B53-9B7E-0B8C3D1E2F3C"}) {
        const std::string name = at(std::string(uid) + ".vcf");
        ASSERT_EQ(world.put(name, cardOf(uid, "Ann", uid)).status, 201);
        const auto changed = world.put(name, cardOf(uid, "Ann", "Changed", "X-A:1\r\n"));
        EXPECT_EQ(changed.status, 204) << changed.body;
        const auto record = world.rolvane().recordForUniqueId(world.rolvane().peopleOfTable("CXPerson").back());
        record->setValue("more", kCXNoteProperty);
        world.rolvane().save();
        EXPECT_THAT(world.ask("GET", name).body, HasSubstr(std::string("UID:") + uid + "\r\n"));
    }
    EXPECT_EQ(world.rolvane().countPeople(RemoteLocation("")), 3u);
}

TEST(Put, WithATagChangesWhatTheClientChangedAndKeepsWhatItDoesNotKnow) {
    BooksWorld world;
    CXMutableMultiValue phones;
    phones.addValue("1", kCXHomeLabel);
    const std::string chosen = phones.addValue("2", kCXWorkLabel);
    const auto ann = world.addPerson("Ann", "Lee",
                                     {{kCXPhoneProperty, phones.toValue()},
                                      {kCXPhotoProperty, Bytes{0xff, 0xd8, 0xff, 0xe0, 1, 2}},
                                      {kCXPhotoTypeProperty, "image/jpeg"},
                                      {kCXVCardExtraProperty, Array{"X-COLOUR:red"}}});
    const auto group = world.addGroup("Friends", {ann});
    group->setDistributionIdentifier(chosen, kCXPhoneProperty, ann);
    world.rolvane().save();
    const std::string path = at(BooksWorld::uuidOf(ann) + ".vcf"), uid = "urn:uuid:" + BooksWorld::uuidOf(ann);
    const std::string tag = world.ask("GET", path).tag();
    // A phone that knows neither photos nor other programs' lines takes one number away and adds one.
    const auto written = world.put(path, cardOf(uid, "Ann", "Leigh", "TEL;TYPE=WORK:2\r\nTEL;TYPE=CELL:3\r\n"),
                                   {{"If-Match", tag}}, "phone");
    EXPECT_EQ(written.status, 204) << written.body << world.log();
    EXPECT_EQ(written.tag(), "") << "the card is not what the client sent";
    EXPECT_EQ(ann->valueForProperty(kCXLastNameProperty).string(), "Leigh");
    EXPECT_THAT(phonesOf(ann), testing::UnorderedElementsAre("2", "3"));
    EXPECT_EQ(ann->valueForProperty(kCXPhotoProperty).data().size(), 6u);
    EXPECT_EQ(ann->valueForProperty(kCXVCardExtraProperty), Value(Array{"X-COLOUR:red"}));
    EXPECT_EQ(group->distributionIdentifierForProperty(kCXPhoneProperty, ann), chosen);
    EXPECT_EQ(world.put(path, cardOf(uid, "Ann", "Old"), {{"If-Match", tag}}).status, 412);
    EXPECT_EQ(ann->valueForProperty(kCXLastNameProperty).string(), "Leigh");
    // A program that has written photos before takes this one away by leaving it out.
    const std::string again = world.ask("GET", path).body;
    const auto whole = world.put(path, again, {{"If-Match", world.ask("GET", path).tag()}});
    EXPECT_EQ(whole.status, 204);
    EXPECT_NE(whole.tag(), "") << again;
    world.put(path, cardOf(uid, "Ann", "Leigh", "TEL;TYPE=WORK:2\r\n"), {{"If-Match", world.ask("GET", path).tag()}});
    EXPECT_FALSE(ann->valueForProperty(kCXPhotoProperty));
    EXPECT_FALSE(ann->valueForProperty(kCXVCardExtraProperty));
    EXPECT_THAT(phonesOf(ann), testing::ElementsAre("2"));
}

// A client that writes without a tag may have had an older version: its edit and the newer one are both kept.
TEST(Put, WithoutATagOverAnOlderVersionIsMergedByProperty) {
    BooksWorld world;
    CXMutableMultiValue phones;
    phones.addValue("1", kCXHomeLabel);
    const auto ann = world.addPerson("Ann", "Lee", {{kCXPhoneProperty, phones.toValue()}, {kCXNoteProperty, "first"}});
    const std::string path = at(BooksWorld::uuidOf(ann) + ".vcf"), uid = "urn:uuid:" + BooksWorld::uuidOf(ann);
    world.multiget(kContacts, {path});
    ann->setValue("newer", kCXNoteProperty);
    world.rolvane().save();
    const auto written = world.put(path, cardOf(uid, "Ann", "Leigh", "NOTE:first\r\n"));
    EXPECT_EQ(written.status, 204) << written.body;
    EXPECT_EQ(written.tag(), "");
    EXPECT_EQ(ann->valueForProperty(kCXNoteProperty).string(), "newer") << "what the client did not touch";
    EXPECT_EQ(ann->valueForProperty(kCXLastNameProperty).string(), "Leigh") << "what it changed";
    EXPECT_THAT(phonesOf(ann), testing::IsEmpty()) << "what it took away";
    EXPECT_TRUE(world.rolvane().conflicts().empty());
    // Both change one value: the later stays and the other one is noted.
    world.multiget(kContacts, {path});
    ann->setValue("theirs", kCXNoteProperty);
    world.rolvane().save();
    world.put(path, cardOf(uid, "Ann", "Leigh", "NOTE:mine\r\n"));
    EXPECT_EQ(ann->valueForProperty(kCXNoteProperty).string(), "mine");
    ASSERT_EQ(world.rolvane().conflicts().size(), 1u);
    EXPECT_EQ(world.rolvane().conflicts()[0].merge.lost["Note"].string(), "theirs");
    // A device that never saw the card takes nothing away.
    world.put(path, cardOf(uid, "Ann", "Leigh", "TEL;TYPE=CELL:9\r\n"), {}, "phone");
    EXPECT_EQ(ann->valueForProperty(kCXNoteProperty).string(), "mine");
    EXPECT_THAT(phonesOf(ann), testing::ElementsAre("9"));
}

// What the device was told of is not what it has: the answer with the cards may never have come.
TEST(Put, WithoutATagByADeviceThatReadTagsAloneTakesNothingAway) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee");
    const std::string path = at(BooksWorld::uuidOf(ann) + ".vcf"), uid = "urn:uuid:" + BooksWorld::uuidOf(ann);
    world.multiget(kContacts, {path});
    ann->setValue("newer", kCXNoteProperty);
    world.rolvane().save();
    world.sync(kContacts, "");
    world.propfind(kContacts, 1, "<D:getetag/>");
    world.ask("HEAD", path);
    world.multiget(kContacts, {path}, "<C:address-data><C:prop name=\"FN\"/></C:address-data>");
    EXPECT_EQ(world.put(path, cardOf(uid, "Ann", "Leigh")).status, 204);
    EXPECT_EQ(ann->valueForProperty(kCXNoteProperty).string(), "newer");
    EXPECT_EQ(ann->valueForProperty(kCXLastNameProperty).string(), "Leigh");
}

TEST(Put, WithoutATagTakesAwayWhatTheDeviceHasReadByWhateverRequest) {
    const auto query = [](const std::string& conditions) {
        return "<C:addressbook-query xmlns:D=\"DAV:\" xmlns:C=\"urn:ietf:params:xml:ns:carddav\"><D:prop>"
               "<C:address-data/></D:prop><C:filter>" +
               conditions + "</C:filter></C:addressbook-query>";
    };
    const auto sync = [](const std::string& token) {
        return "<D:sync-collection xmlns:D=\"DAV:\" xmlns:C=\"urn:ietf:params:xml:ns:carddav\"><D:sync-token>" + token +
               "</D:sync-token><D:sync-level>1</D:sync-level><D:prop><C:address-data/></D:prop></D:sync-collection>";
    };
    for (int way = 0; way < 6; ++way) {
        BooksWorld world;
        const std::string begun = world.sync(kContacts, "").syncToken(); // of tags alone
        const auto ann = world.addPerson("Ann", "Lee", {{kCXNoteProperty, "so"}});
        const std::string path = at(BooksWorld::uuidOf(ann) + ".vcf"), uid = "urn:uuid:" + BooksWorld::uuidOf(ann);
        if (way == 0) world.ask("GET", path);
        if (way == 1) world.multiget(kContacts, {path});
        if (way == 2) world.report(kContacts, query(""));
        if (way == 3) world.report(kContacts, sync(""));
        if (way == 4) world.report(kContacts, query("<C:prop-filter name=\"FN\"/>"));
        if (way == 5) world.report(kContacts, sync(begun));
        EXPECT_EQ(world.put(path, cardOf(uid, "Ann", "Lee")).status, 204);
        EXPECT_FALSE(ann->valueForProperty(kCXNoteProperty)) << way;
    }
}

// Its answer had no tag, so the device does not know what the card says now.
TEST(Put, WithoutATagTwiceTakesNothingAwayThatTheFirstWasMergedWith) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee");
    const std::string path = at(BooksWorld::uuidOf(ann) + ".vcf"), uid = "urn:uuid:" + BooksWorld::uuidOf(ann);
    world.multiget(kContacts, {path});
    ann->setValue("newer", kCXNoteProperty);
    world.rolvane().save();
    EXPECT_EQ(world.put(path, cardOf(uid, "Ann", "Lee", "TEL;TYPE=CELL:1\r\n")).tag(), "");
    world.put(path, cardOf(uid, "Ann", "Lee", "TEL;TYPE=CELL:1\r\nTEL;TYPE=WORK:2\r\n"));
    EXPECT_EQ(ann->valueForProperty(kCXNoteProperty).string(), "newer");
    EXPECT_THAT(phonesOf(ann), testing::UnorderedElementsAre("1", "2"));
}

// If-Match: * says that there is a card, If-Unmodified-Since names a second: neither says which version the device had.
TEST(Put, UnderAConditionThatNamesNoVersionIsMergedByProperty) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee");
    const std::string path = at(BooksWorld::uuidOf(ann) + ".vcf"), uid = "urn:uuid:" + BooksWorld::uuidOf(ann);
    world.multiget(kContacts, {path});
    ann->setValue("newer", kCXNoteProperty);
    world.rolvane().save();
    const std::string date = world.ask("GET", path, {}, {}, "phone").header("Last-Modified");
    for (const BooksWorld::Headers& condition :
         {BooksWorld::Headers{{"If-Match", "*"}}, BooksWorld::Headers{{"If-None-Match", "\"else\""}},
          BooksWorld::Headers{{"If-Unmodified-Since", "Fri, 01 Jan 2100 00:00:00 GMT"}}}) {
        EXPECT_EQ(world.put(path, cardOf(uid, "Ann", "Leigh"), condition).status, 204) << condition[0].first;
        EXPECT_EQ(ann->valueForProperty(kCXNoteProperty).string(), "newer") << condition[0].first;
        EXPECT_EQ(ann->valueForProperty(kCXLastNameProperty).string(), "Leigh");
    }
    EXPECT_NE(date, "");
}

TEST(Put, RefusesWhatIsNoCardAndChangesNothing) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee");
    const std::string path = at(BooksWorld::uuidOf(ann) + ".vcf"), uid = "urn:uuid:" + BooksWorld::uuidOf(ann);
    world.propfind(kContacts, 1, "<D:getetag/>");
    const Unchanged unchanged(world);
    const auto refused = [&](const std::string& name, const std::string& body, const std::string& precondition,
                             int status = 403, const BooksWorld::Headers& headers = {}) {
        const auto answer = headers.empty() ? world.put(name, body) : world.ask("PUT", name, headers, body);
        EXPECT_EQ(answer.status, status) << body.substr(0, 80) << answer.body;
        EXPECT_EQ(answer.precondition(), precondition) << answer.body;
        return answer;
    };
    const std::string fresh = at("new.vcf"), good = cardOf("a", "A", "B");
    for (const std::string& body :
         {std::string("hello"), std::string("BEGIN:VCARD\r\nVERSION:3.0\r\nFN:x\r\n"), good + cardOf("b", "C", "D"),
          cardOf("", "No", "UID"), std::string("BEGIN:VCARD\r\nVERSION:3.0\r\nUID:a\r\nFN:\xff\xfe\r\nEND:VCARD\r\n"),
          std::string("BEGIN:VCALENDAR\r\nEND:VCALENDAR\r\n")})
        refused(fresh, body, "valid-address-data");
    refused(fresh, "BEGIN:VCARD\r\nVERSION:2.1\r\nUID:a\r\nFN:x\r\nN:x\r\nEND:VCARD\r\n", "supported-address-data");
    refused(fresh, good, "supported-address-data", 403, {{"Content-Type", "text/calendar"}});
    refused(fresh, good, "", 400, {{"Content-Range", "bytes 0-3/9"}});
    const auto conflict = refused(fresh, cardOf(uid, "Ann", "Lee"), "no-uid-conflict", 409);
    EXPECT_THAT(conflict.body, HasSubstr("<D:href>" + path + "</D:href>"));
    refused(path, good, "no-uid-conflict", 409);
    refused("/books/home/x.vcf", good, "", 409);
    refused("/books/home/nothing/x.vcf", good, "addressbook-collection-location-ok");
    EXPECT_EQ(world.ask("GET", fresh).status, 404);
}

// A program that still has the card of somebody who was joined with another person would double that person.
TEST(Put, OfSomebodyWhoWasJoinedNamesThePersonWhoRemained) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee");
    ASSERT_EQ(world.put(at("annie.vcf"), cardOf("annie's own", "Annie", "Lee")).status, 201);
    const auto annie = person(world, vcardUUIDForUID("annie's own"));
    ASSERT_TRUE(annie);
    joinPeople(world.rolvane(), ann, annie);
    world.rolvane().save();
    const Unchanged unchanged(world);
    for (const char* name : {"annie.vcf", "another.vcf"}) {
        const auto answer = world.put(at(name), cardOf("annie's own", "Annie", "Lee"));
        EXPECT_EQ(answer.status, 409) << answer.body;
        EXPECT_EQ(answer.precondition(), "no-uid-conflict");
        EXPECT_THAT(answer.body, HasSubstr(at(BooksWorld::uuidOf(ann) + ".vcf"))) << "the card to read instead";
    }
    EXPECT_EQ(world.rolvane().countPeople(RemoteLocation("")), 1u);
}

TEST(Put, IsBoundedInItsBytes) {
    BooksWorld::Options options;
    options.directives = "CardBookMaxCard 20000";
    BooksWorld world(options);
    const Unchanged unchanged(world);
    const std::string big = cardOf("a", "A", "B", "NOTE:" + std::string(50000, 'x') + "\r\n");
    const auto answer = world.put(at("a.vcf"), big);
    EXPECT_EQ(answer.status, 403);
    EXPECT_EQ(answer.precondition(), "max-resource-size");
    EXPECT_THAT(world.propfind(kContacts, 0, "<C:max-resource-size/>").body, HasSubstr(">20000<"));
}

TEST(Put, OfAPhotoOf50MBIsRefusedByTheDefaultBound) {
    BooksWorld world;
    const Unchanged unchanged(world);
    const auto answer = world.put(
        at("a.vcf"), cardOf("a", "A", "B", "PHOTO;ENCODING=b;TYPE=JPEG:" + std::string(50 << 20, 'A') + "\r\n"));
    EXPECT_EQ(answer.status, 403);
    EXPECT_EQ(answer.precondition(), "max-resource-size");
}

TEST(Put, OnALockedDatabaseIsToBeTriedAgain) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee");
    world.propfind(kContacts, 1, "<D:getetag/>");
    const Unchanged unchanged(world);
    Sqlite other(world.database(), 1000);
    const SqliteTransaction transaction(other);
    const auto answer = world.put(at("x.vcf"), cardOf("x", "A", "B"));
    EXPECT_EQ(answer.status, 503) << answer.body;
    EXPECT_EQ(answer.header("Retry-After"), "5");
    EXPECT_EQ(world.ask("GET", at(BooksWorld::uuidOf(ann) + ".vcf")).status, 200) << "reading goes on";
}

TEST(Delete, TakesAPersonAwayUnlessTheCardHasChanged) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee"), bob = world.addPerson("Bob", "May");
    const std::string path = at(BooksWorld::uuidOf(ann) + ".vcf");
    const std::string tag = world.ask("GET", path).tag();
    ann->setValue("else", kCXNoteProperty);
    world.rolvane().save();
    EXPECT_EQ(world.ask("DELETE", path, {{"If-Match", tag}}).status, 412);
    EXPECT_TRUE(ann->isAttached());
    EXPECT_EQ(world.ask("DELETE", path, {{"If-Match", world.ask("GET", path).tag()}}).status, 204);
    EXPECT_FALSE(ann->isAttached());
    EXPECT_EQ(world.ask("DELETE", path).status, 404);
    EXPECT_EQ(world.ask("DELETE", at(BooksWorld::uuidOf(bob) + ".vcf")).status, 204);
    for (const char* collection : {kContacts, "/books/home/", "/books/principal/", "/books/"})
        EXPECT_EQ(world.ask("DELETE", collection).status, 403) << collection;
}

TEST(Books, HaveNoLocksSoNoIfHeaderIsEverMet) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee");
    const std::string path = at(BooksWorld::uuidOf(ann) + ".vcf");
    for (const char* header : {"(<x:1>)", "(Not <DAV:no-lock>)", "([\"a\"] <x:1>)", "</books/> (<x:1>)", "(<x:1"})
        for (const char* method : {"DELETE", "PUT", "MOVE", "LOCK", "PROPPATCH"})
            for (const std::string& target : {path, std::string("/books/home/")})
                EXPECT_EQ(world.ask(method, target, {{"If", header}}).status, 412) << method << " " << header;
    const std::string tag = world.ask("GET", path).tag();
    for (const std::string& each : {std::string("\"other\""), tag})
        EXPECT_EQ(world.ask("DELETE", path, {{"If", "([" + each + "])"}}).status, 412);
    EXPECT_TRUE(ann->isAttached());
    EXPECT_EQ(world.ask("DELETE", path, {{"If-Match", tag}}).status, 204);
}

TEST(Collections, AreNotMadeNorChangedHere) {
    BooksWorld world;
    const Unchanged unchanged(world);
    EXPECT_EQ(world.ask("MKCOL", "/books/home/mine/").status, 403);
    EXPECT_EQ(world.ask("MKCOL", kContacts).status, 405);
    const auto patched = world.ask("PROPPATCH", kContacts, {},
                                   "<D:propertyupdate xmlns:D=\"DAV:\"><D:set><D:prop><D:displayname>x</D:displayname>"
                                   "</D:prop></D:set></D:propertyupdate>");
    EXPECT_THAT(patched.body, HasSubstr("403"));
    EXPECT_THAT(world.propfind(kContacts, 0, "<D:displayname/>").body, HasSubstr(">Contacts<"));
    EXPECT_GE(world.ask("LOCK", at("a.vcf")).status, 400);
}

TEST(Groups, AreCardsInContacts) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee"), bob = world.addPerson("Bob", "May");
    const auto card = [&](const std::string& name, const std::vector<CXPersonRef>& members) {
        std::string text =
            "BEGIN:VCARD\r\nVERSION:4.0\r\nUID:urn:uuid:" + kUUID + "\r\nKIND:group\r\nFN:" + name + "\r\n";
        for (const auto& member : members) text += "MEMBER:urn:uuid:" + BooksWorld::uuidOf(member) + "\r\n";
        return text + "END:VCARD\r\n";
    };
    const auto made = world.put(at("g.vcf"), card("Friends", {ann}), {{"If-None-Match", "*"}});
    ASSERT_EQ(made.status, 201) << made.body << world.log();
    const auto group =
        std::dynamic_pointer_cast<CXGroup>(world.rolvane().recordForUniqueId(UniqueId(kUUID + ":CXGroup")));
    ASSERT_TRUE(group);
    EXPECT_EQ(group->memberUniqueIds(), std::vector<UniqueId>{ann->uniqueId()});
    EXPECT_EQ(world.ask("GET", at("g.vcf")).body, card("Friends", {ann}));
    EXPECT_EQ(world.put(at("g.vcf"), card("Pals", {bob}), {{"If-Match", world.ask("GET", at("g.vcf")).tag()}}).status,
              204);
    EXPECT_EQ(group->name(), "Pals");
    EXPECT_EQ(group->memberUniqueIds(), std::vector<UniqueId>{bob->uniqueId()});
    EXPECT_THAT(world.propfind("/books/home/", 1, "<D:displayname/>").body, HasSubstr(">Pals<"));
    EXPECT_EQ(world.put(at("g.vcf"), cardOf("urn:uuid:" + kUUID, "A", "Person")).status, 409);
    EXPECT_EQ(world.ask("DELETE", at("g.vcf")).status, 204);
    EXPECT_FALSE(group->isAttached());
    EXPECT_TRUE(ann->isAttached());
}

// Programs that send many cards send them in any order.
TEST(Groups, AreJoinedByMembersWhoseCardsComeLater) {
    BooksWorld world;
    const std::string head = "BEGIN:VCARD\r\nVERSION:4.0\r\nKIND:group\r\n";
    const std::string inner = head + "UID:inner\r\nFN:Inner\r\nMEMBER:bob\r\nEND:VCARD\r\n";
    const std::string outer =
        head + "UID:outer\r\nFN:Outer\r\nMEMBER:urn:uuid:" + kUUID + "\r\nMEMBER:inner\r\nEND:VCARD\r\n";
    ASSERT_EQ(world.put(at("outer.vcf"), outer, {{"If-None-Match", "*"}}).status, 201);
    ASSERT_EQ(world.put(at("inner.vcf"), inner).status, 201) << "without a condition, too";
    EXPECT_EQ(world.ask("GET", at("inner.vcf")).body, inner);
    ASSERT_EQ(world.put(at("bob.vcf"), cardOf("bob", "Bob", "May")).status, 201);
    ASSERT_EQ(world.put(at("ann.vcf"), cardOf("urn:uuid:" + kUUID, "Ann", "Lee")).status, 201);
    const auto group = [&](const std::string& uid) {
        return std::dynamic_pointer_cast<CXGroup>(
            world.rolvane().recordForUniqueId(UniqueId(vcardUUIDForUID(uid) + ":CXGroup")));
    };
    ASSERT_TRUE(group("outer") && group("inner"));
    EXPECT_EQ(group("outer")->memberUniqueIds(), std::vector<UniqueId>{personCalled(kUUID)});
    EXPECT_EQ(group("inner")->memberUniqueIds(), std::vector<UniqueId>{personCalled(vcardUUIDForUID("bob"))});
    ASSERT_EQ(group("outer")->subgroups().size(), 1u);
    EXPECT_EQ(group("outer")->subgroups().front()->uniqueId(), group("inner")->uniqueId());
    EXPECT_EQ(world.ask("GET", at("ann.vcf", bookOf(group("outer")))).status, 200);
    const std::string served = world.ask("GET", at("outer.vcf")).body;
    EXPECT_EQ(served.find("MEMBER:inner"), served.rfind("MEMBER:inner")) << served;
    EXPECT_THAT(served, HasSubstr("MEMBER:urn:uuid:" + kUUID + "\r\n"));
}

TEST(GroupBooks, TakeTheVeryMemberThatTheGroupWaitsFor) {
    BooksWorld world;
    const std::string card = "BEGIN:VCARD\r\nVERSION:4.0\r\nKIND:group\r\nUID:urn:uuid:" + kUUID +
                             "\r\nFN:Friends\r\nMEMBER:late\r\nEND:VCARD\r\n";
    ASSERT_EQ(world.put(at("friends.vcf"), card).status, 201);
    const auto group =
        std::dynamic_pointer_cast<CXGroup>(world.rolvane().recordForUniqueId(UniqueId(kUUID + ":CXGroup")));
    ASSERT_TRUE(group);
    EXPECT_EQ(world.put(at("late.vcf", bookOf(group)), cardOf("late", "Late", "Comer")).status, 201) << world.log();
    EXPECT_EQ(group->memberCount(), 1u);
    EXPECT_EQ(world.ask("GET", at("friends.vcf")).body, card);
}

// Of each member, what one of the two has changed since the device read the card stands.
TEST(Groups, AreMergedMemberByMemberWithAnOlderCardThatComesWithoutATag) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee"), bob = world.addPerson("Bob", "May"),
               cleo = world.addPerson("Cleo", "Fox"), dora = world.addPerson("Dora", "Ray"),
               eve = world.addPerson("Eve", "Sun"), finn = world.addPerson("Finn", "Roe");
    const auto group = world.addGroup("Friends", {ann, bob, cleo, finn}), inner = world.addGroup("Inner", {});
    group->addSubgroup(inner);
    world.rolvane().save();
    const std::string path = at(BooksWorld::uuidOf(group) + ".vcf");
    const auto card = [&](const std::string& name, const std::vector<CXRecordRef>& members) {
        std::string text = "BEGIN:VCARD\r\nVERSION:4.0\r\nUID:urn:uuid:" + BooksWorld::uuidOf(group) +
                           "\r\nKIND:group\r\nFN:" + name + "\r\n";
        for (const auto& member : members) text += "MEMBER:urn:uuid:" + BooksWorld::uuidOf(member) + "\r\n";
        return text + "END:VCARD\r\n";
    };
    world.multiget(kContacts, {path});
    group->removeMember(bob);
    group->removeSubgroup(inner);
    group->addMember(dora);
    world.rolvane().removeRecord(finn);
    world.rolvane().save();
    EXPECT_EQ(world.put(path, card("Pals", {ann, bob, eve, finn, inner})).status, 204) << world.log();
    EXPECT_EQ(group->name(), "Pals");
    EXPECT_THAT(group->memberUniqueIds(),
                testing::UnorderedElementsAre(ann->uniqueId(), dora->uniqueId(), eve->uniqueId()));
    EXPECT_TRUE(group->subgroups().empty());
    EXPECT_THAT(world.ask("GET", path).body, Not(HasSubstr(BooksWorld::uuidOf(finn))))
        << "nor is a name kept for later";
    // A device that has read the group since may put them in again, and one that never read it takes nobody out.
    EXPECT_EQ(world.put(path, card("Pals", {ann, bob})).status, 204);
    EXPECT_THAT(group->memberUniqueIds(), testing::UnorderedElementsAre(ann->uniqueId(), bob->uniqueId()));
    EXPECT_EQ(world.put(path, card("Pals", {cleo}), {}, "phone").status, 204);
    EXPECT_EQ(group->memberCount(), 3u);
}

TEST(GroupBooks, LetPeopleJoinAndLeaveWhoStayInContacts) {
    BooksWorld world;
    const auto ann = world.addPerson("Ann", "Lee");
    const auto group = world.addGroup("Friends", {ann}), other = world.addGroup("Others", {});
    const std::string book = bookOf(group), name = BooksWorld::uuidOf(ann) + ".vcf";
    EXPECT_EQ(world.ask("GET", at(name, book)).status, 200);
    EXPECT_EQ(world.put(at("bob.vcf", book), cardOf("bob", "Bob", "May")).status, 201);
    EXPECT_EQ(group->memberCount(), 2u);
    EXPECT_EQ(world.ask("GET", at("bob.vcf")).status, 200) << "in Contacts by the same name";
    EXPECT_EQ(world.ask("DELETE", at(name, book)).status, 204);
    EXPECT_EQ(group->memberCount(), 1u);
    EXPECT_EQ(world.ask("GET", at(name)).status, 200);
    EXPECT_EQ(world.ask("GET", at(name, book)).status, 404);
    const auto joined = world.put(at(name, book), world.ask("GET", at(name)).body);
    EXPECT_EQ(joined.status, 201) << "somebody of Contacts joins by the same card: " << joined.body;
    EXPECT_EQ(group->memberCount(), 2u);
    EXPECT_EQ(world.rolvane().countPeople(RemoteLocation("")), 2u);
    EXPECT_EQ(world.ask("DELETE", at("bob.vcf")).status, 204);
    EXPECT_EQ(group->memberCount(), 1u) << "who leaves Contacts leaves the groups";
    // From book to book.
    const auto to = [&](const std::string& target) { return BooksWorld::Headers{{"Destination", target}}; };
    const std::string elsewhere = at(name, bookOf(other));
    EXPECT_EQ(world.ask("COPY", at(name), to(elsewhere)).status, 201) << world.log();
    EXPECT_EQ(other->memberCount(), 1u);
    EXPECT_EQ(world.ask("DELETE", elsewhere).status, 204);
    EXPECT_EQ(world.ask("MOVE", at(name, book), to(elsewhere)).status, 201);
    EXPECT_EQ(group->memberCount(), 0u);
    EXPECT_EQ(other->memberCount(), 1u);
    EXPECT_EQ(world.ask("MOVE", elsewhere, to(at(name))).status, 204) << "out of the group, to where it is anyway";
    EXPECT_EQ(other->memberCount(), 0u);
    EXPECT_TRUE(ann->isAttached());
    EXPECT_EQ(world.ask("MOVE", at(name), to(elsewhere)).precondition(), "addressbook-collection-location-ok");
    const std::string token = world.sync(kContacts, "").syncToken();
    EXPECT_EQ(world.ask("MOVE", at(name), to(at("renamed.vcf"))).status, 201);
    const auto told = world.sync(kContacts, token).responses();
    ASSERT_EQ(told.size(), 2u);
    EXPECT_EQ(told[0].href, at(name));
    EXPECT_EQ(told[0].status, 404);
    EXPECT_EQ(told[1].href, at("renamed.vcf"));
    EXPECT_EQ(world.rolvane().countPeople(RemoteLocation("")), 1u);
}

TEST(SharedBooks, AreWrittenWhereTheRightStands) {
    BooksWorld world;
    const auto read = world.addSubscription("https://a.example/dav/ann", false, "Zoe");
    const auto write = world.addSubscription("https://a.example/dav/walter", true, "Yan");
    const auto path = [](const CXSubscriptionRef& of) { return "/books/home/shared-" + BooksWorld::uuidOf(of) + "/"; };
    const auto cardIn = [&](const std::string& book) {
        for (const auto& each : world.propfind(book, 1, "<D:getetag/>").responses())
            if (each.href != book) return each.href;
        return std::string();
    };
    const auto privileges = [&](const std::string& book) {
        return world.propfind(book, 0, "<D:current-user-privilege-set/>").body;
    };
    EXPECT_THAT(privileges(path(read)), Not(HasSubstr("write")));
    EXPECT_THAT(privileges(path(write)), HasSubstr("<D:write-content/>"));
    const std::string zoe = cardIn(path(read)), yan = cardIn(path(write));
    EXPECT_THAT(world.ask("GET", zoe).body, HasSubstr("Zoe"));
    {
        const Unchanged unchanged(world);
        for (const auto& answer : {world.put(at("n.vcf", path(read)), cardOf("n", "New", "One")),
                                   world.put(zoe, world.ask("GET", zoe).body + ""), world.ask("DELETE", zoe)}) {
            EXPECT_EQ(answer.status, 403);
            EXPECT_EQ(answer.precondition(), "need-privileges") << answer.body;
        }
        EXPECT_EQ(world.ask("MOVE", zoe, {{"Destination", at("zoe.vcf")}}).status, 403);
    }
    EXPECT_EQ(world.put(at("n.vcf", path(write)), cardOf("n", "New", "One")).status, 201) << world.log();
    EXPECT_EQ(world.rolvane().countPeople(RemoteLocation("https://a.example/dav/walter")), 2u);
    EXPECT_EQ(world.rolvane().countPeople(RemoteLocation("")), 0u);
    EXPECT_EQ(world.ask("DELETE", yan).status, 204);
    EXPECT_EQ(world.rolvane().countPeople(RemoteLocation("https://a.example/dav/walter")), 1u);
    const std::string token = world.sync(path(write), "").syncToken();
    world.rolvane().removeRecord(write);
    world.rolvane().save();
    EXPECT_EQ(world.sync(path(write), token).status, 404);
    EXPECT_THAT(world.propfind("/books/home/", 1, "<D:displayname/>").body, Not(HasSubstr(path(write))));
}

} // namespace
} // namespace rolvane
