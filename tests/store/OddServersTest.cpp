// Servers that people have, each with habits of its own.

#include "StoreWorld.h"
#include "store/account/StoreTrial.h"
#include "store/locks/CXWebDAVLock.h"
#include "store/locks/StoreLock.h"
#include "support/OddServer.h"

#include <functional>
#include <gtest/gtest.h>

namespace rolvane {
namespace {

using namespace test;

// Somebody's client of a server with habits.
struct OddClient {
    explicit OddClient(const OddServer& server, const std::string& user = "alice") {
        CXDAVAccount account;
        account.user = UserName(user);
        account.endpoint = account.secureEndpoint = server.endpointTemplate();
        account.nameHost = "contacts.example.org";
        account.plainLoopback = true;
        wire = std::make_shared<RecordingTransport>(std::make_shared<CurlTransport>(CurlTransportOptions()));
        manager = std::make_unique<CXDAVManager>(account, wire);
        base = account.baseLocationFor(UserName("alice"));
    }
    Url at(const std::string& relative) const { return Url(base.absoluteString() + "/" + relative); }
    int write(const std::string& relative, const Dictionary& d) const {
        int code = -1;
        manager->write(PropertyList::toXML(d), at(relative), true, &code);
        return code;
    }
    std::optional<Dictionary> read(const std::string& relative) const {
        return manager->dictionaryAtURL(at(relative), true, nullptr);
    }
    std::optional<FileListing> list() const { return manager->infoForFilesInContainer(base); }

    std::shared_ptr<RecordingTransport> wire;
    std::unique_ptr<CXDAVManager> manager;
    Url base;
};

constexpr const char* kTree = "/alice/Contacts/";

// All that a publisher does and a reader sees; a lock that stays behind, an edit that does not get through or a version
// that is not noticed is a failure.
void servesAPublication(const Oddities& habits) {
    OddServer server(habits);
    OddClient alice(server), bob(server, "bob");
    CXDAVError error;
    ASSERT_TRUE(alice.manager->canReach(error)) << error.reason << "\n" << alice.wire->text();
    ASSERT_TRUE(alice.manager->sanityCheckPublishStructureCreate(true)) << alice.wire->text();
    EXPECT_TRUE(alice.manager->sanityCheckPublishStructureCreate(false)) << alice.wire->text();
    alice.manager->failures().take(); // the folders above the tree had to be made
    auto lock = makeStoreLock(*alice.manager, alice.at("dateFile"));
    ASSERT_TRUE(lock->tryLock()) << alice.wire->text();
    EXPECT_TRUE(lock->locked());
    EXPECT_EQ(alice.write("People/4/A%3ACXPerson", Dictionary{{"a", 1}}), 201) << alice.wire->text();
    EXPECT_EQ(alice.write("G%3ACXGroup", Dictionary{{"a", 1}}), 201) << alice.wire->text();
    EXPECT_TRUE(alice.manager->createDirectoryAtAURL(alice.at("G%3ACXGroup"))) << alice.wire->text();
    EXPECT_TRUE(alice.read("G%3ACXGroup"));
    EXPECT_EQ(alice.write("G%3ACXGroup", Dictionary{{"a", 2}}), 204) << alice.wire->text();
    lock->unlock();
    EXPECT_TRUE(server.locked().empty()) << alice.wire->text();
    EXPECT_TRUE(alice.manager->modDateForURL(alice.at("dateFile"))) << "the clock of the store";

    ASSERT_TRUE(bob.manager->canReach(error)) << error.reason;
    const std::string person = kTree + std::string("People/4/A:CXPerson"), group = kTree + std::string("G:CXGroup");
    const auto isNew = [&](const std::string& path) {
        const auto listing = bob.list();
        EXPECT_TRUE(listing) << bob.wire->text();
        if (!listing || !listing->contains(path)) return false;
        const FileInfo& file = listing->at(path);
        EXPECT_TRUE(file.modificationdate) << path << ": without a date it would be left out";
        const Date sync = Date::fromHTTP("Sat, 21 Nov 2026 10:00:00 GMT").value();
        return !file.seen && file.modificationdate && file.modificationdate->secondsSince(sync) > 4;
    };
    EXPECT_TRUE(isNew(person));
    EXPECT_TRUE(isNew(group));
    EXPECT_EQ(bob.read("People/4/A%3ACXPerson"), (Dictionary{{"a", 1}})) << bob.wire->text();
    EXPECT_EQ(bob.read("G%3ACXGroup"), (Dictionary{{"a", 2}})) << bob.wire->text();
    if (habits.tags) {
        EXPECT_FALSE(isNew(person)) << "what was read is known";
        EXPECT_FALSE(isNew(group));
    }
    EXPECT_EQ(alice.write("People/4/A%3ACXPerson", Dictionary{{"a", 3}}), 204) << alice.wire->text();
    if (habits.tags || !habits.dates) {
        EXPECT_TRUE(isNew(person)) << "another version is not";
    }
    EXPECT_TRUE(alice.manager->removeFileAtURL(alice.at("People/4/A%3ACXPerson"), nullptr)) << alice.wire->text();
    EXPECT_TRUE(alice.manager->removeFileAtURL(alice.at("G%3ACXGroup"), nullptr)) << alice.wire->text();
    EXPECT_FALSE(isNew(person));
    EXPECT_TRUE(alice.manager->removeDirectoryAndContentsAtURL(alice.base)) << alice.wire->text();
    EXPECT_TRUE(server.files().empty());
    EXPECT_TRUE(alice.manager->failures().take().empty()) << alice.wire->text();
}

struct Habit {
    const char* name;
    Oddities odd;
};

Habit with(const char* name, const std::function<void(Oddities&)>& change) {
    Habit habit{name, {}};
    change(habit.odd);
    return habit;
}

class OddServers : public testing::TestWithParam<Habit> {};

TEST_P(OddServers, ServeAPublication) {
    servesAPublication(GetParam().odd);
}

INSTANTIATE_TEST_SUITE_P(
    Each, OddServers,
    testing::Values(
        with("Standard", [](Oddities&) {}), with("RedirectsToTheSlash", [](Oddities& o) { o.redirectsToSlash = true; }),
        with("WantsTheSlash", [](Oddities& o) { o.wantsSlash = true; }),
        with("Class2Alone", [](Oddities& o) { o.davHeaders = "DAV: 2\r\n"; }),
        with("ClassesOverSeveralLines",
             [](Oddities& o) { o.davHeaders = "DAV: extended-mkcol\r\nDAV: 1\r\ndav: 3 , 2\r\n"; }),
        with("RefusesOptionsOfWhatIsMissing", [](Oddities& o) { o.optionsOfMissing = 404; }),
        with("ForbidsOptionsOfWhatIsMissing", [](Oddities& o) { o.optionsOfMissing = 405; }),
        with("NoDates", [](Oddities& o) { o.dates = false; }),
        with("NoDatesAtAll", [](Oddities& o) { o.dates = o.dateHeader = false; }),
        with("IsoDates", [](Oddities& o) { o.isoDates = true; }), with("NoTags", [](Oddities& o) { o.tags = false; }),
        with("NeitherDatesNorTags", [](Oddities& o) { o.tags = o.dates = false; }),
        with("WeakTags", [](Oddities& o) { o.weakTags = true; }),
        with("NoSelfEntry", [](Oddities& o) { o.namesItself = false; }),
        with("NoStatus", [](Oddities& o) { o.statuses = false; }),
        with("Says200", [](Oddities& o) { o.multistatus = 200; }),
        with("Doctype", [](Oddities& o) { o.doctype = "<!DOCTYPE D:multistatus>"; }),
        with("DoctypeWithASystem", [](Oddities& o) { o.doctype = "<!DOCTYPE D:multistatus SYSTEM \"dav.dtd\">"; }),
        with("HrefsOfAnotherScheme", [](Oddities& o) { o.hrefOrigin = "https://store.example.org:8443"; }),
        with("HrefsOfAnotherHost", [](Oddities& o) { o.hrefOrigin = "http://backend"; }),
        with("CompressesAll", [](Oddities& o) { o.encoding = "gzip"; }),
        with("412ToIfWithWeakTags", [](Oddities& o) { o.weakTags = true, o.ifWithTag = 412; }),
        with("501ToIfNoneMatch", [](Oddities& o) { o.ifNoneMatch = 501; }),
        with("LockIs201", [](Oddities& o) { o.lockGranted = 201; }),
        with("DeleteIs207", [](Oddities& o) { o.deleted = 207; }),
        with("DeleteIs200", [](Oddities& o) { o.deleted = 200; }),
        with("Everything",
             [](Oddities& o) {
                 o.redirectsToSlash = true, o.davHeaders = "dav: 2\r\n", o.dates = false, o.weakTags = true;
                 o.namesItself = o.statuses = false, o.multistatus = 200, o.hrefOrigin = "http://backend:1";
                 o.encoding = "gzip", o.ifWithTag = 412, o.ifNoneMatch = 501, o.lockGranted = 201, o.deleted = 207;
             })),
    [](const auto& each) { return std::string(each.param.name); });

// What a server gets wrong of conditions must not become a write over somebody else's version.
TEST(OddServer, ThatGetsConditionsWrongLosesNobodysVersion) {
    Oddities odd;
    odd.weakTags = true;
    odd.ifWithTag = 412;
    odd.ifNoneMatch = 501;
    OddServer server(odd);
    OddClient alice(server);
    ASSERT_TRUE(alice.manager->sanityCheckPublishStructureCreate(true)) << alice.wire->text();
    const std::string path = "/dav/alice/Contacts/G:CXGroup", theirs = PropertyList::toXML(Dictionary{{"b", 2}});
    EXPECT_FALSE(alice.read("G%3ACXGroup"));
    server.write(path, theirs); // after it was found missing
    EXPECT_EQ(alice.write("G%3ACXGroup", Dictionary{{"a", 1}}), 501);
    EXPECT_EQ(server.files().at(path), theirs);
    EXPECT_TRUE(alice.read("G%3ACXGroup"));
    server.write(path, PropertyList::toXML(Dictionary{{"b", 3}})); // after it was read
    EXPECT_EQ(alice.write("G%3ACXGroup", Dictionary{{"a", 1}}), 412);
    EXPECT_EQ(server.files().at(path), PropertyList::toXML(Dictionary{{"b", 3}}));
}

TEST(OddServer, WhoseAnswersCannotBeDecodedIsRefusedByNameAndKeepsNoLock) {
    OddServer server;
    OddClient alice(server);
    ASSERT_TRUE(alice.manager->sanityCheckPublishStructureCreate(true));
    alice.manager->failures().take();
    Oddities odd;
    odd.encoding = "x-squeezed";
    server.be(odd);
    auto lock = makeStoreLock(*alice.manager, alice.at("dateFile"));
    EXPECT_FALSE(lock->tryLock());
    EXPECT_TRUE(server.locked().empty()) << alice.wire->text();
    EXPECT_FALSE(alice.read("info"));
    EXPECT_FALSE(alice.list());
    const auto failures = alice.manager->failures().take();
    ASSERT_FALSE(failures.empty());
    for (const auto& failure : failures)
        EXPECT_NE(failure.words.find("x-squeezed"), std::string::npos)
            << failure.method << " " << failure.name.absoluteString() << " " << failure.words;
    EXPECT_EQ(server.requests().back().headers.count("accept-encoding"), 0u) << "nobody asks for it";
}

TEST(OddServer, ADecodedAnswerKeepsToItsLimit) {
    Oddities odd;
    odd.encoding = "gzip";
    OddServer server(odd);
    server.write("/dav/x", std::string(100000, 'x'));
    CurlTransport transport{CurlTransportOptions()};
    HttpRequest request;
    request.method = "GET";
    request.url = Url(server.origin() + "/dav/x");
    EXPECT_EQ(transport.perform(request).body, std::string(100000, 'x'));
    request.limits.maxBodyBytes = 99999;
    EXPECT_EQ(transport.perform(request).error, TransportError::tooLarge);
}

// A tree that is not there yet, on a server that never answers OPTIONS of what is missing.
TEST(OddServer, ThatHangsOnOptionsOfAMissingTreeIsAskedAbove) {
    OddServer server;
    OddClient alice(server);
    alice.wire->intercept([&](const HttpRequest& r) -> std::optional<HttpResponse> {
        if (r.method != "OPTIONS" || !r.url.encodedPath().starts_with("/dav/alice")) return std::nullopt;
        if (server.collections().contains("/dav/alice/Contacts")) return std::nullopt;
        HttpResponse none;
        none.error = TransportError::timedOut;
        return none;
    });
    CXDAVError error;
    EXPECT_TRUE(alice.manager->canReach(error)) << error.reason;
    EXPECT_TRUE(alice.manager->sanityCheckPublishStructureCreate(true)) << alice.wire->text();
    size_t hung = 0;
    for (const auto& e : alice.wire->exchanges()) hung += e.method == "OPTIONS" && e.status == 0;
    EXPECT_EQ(hung, 1u) << "it is waited for once";
}

TEST(OddServer, ThatIsNoWebDAVServerIsNotAskedWithoutEnd) {
    Oddities odd;
    odd.davHeaders = "";
    odd.optionsOfMissing = 404;
    OddServer server(odd);
    OddClient alice(server);
    CXDAVError error;
    EXPECT_FALSE(alice.manager->canReach(error));
    EXPECT_EQ(server.count("OPTIONS"), 2u) << "the tree and the next collection that is there";
}

// A multistatus that tells of a member that could not be removed is no success.
TEST(OddServer, WhoCouldNotDeleteAllIsNotBelievedToHaveDoneSo) {
    OddServer server;
    OddClient alice(server);
    ASSERT_TRUE(alice.manager->sanityCheckPublishStructureCreate(true));
    for (const char* status : {"HTTP/1.1 423 Locked", "HTTP/1.1 403 Forbidden"}) {
        alice.wire->intercept([&](const HttpRequest& r) {
            return r.method != "DELETE" ? std::nullopt
                                        : std::optional(answerOf(
                                              207, {{"content-type", "application/xml"}},
                                              "<multistatus xmlns=\"DAV:\"><response><href>/dav/alice/Contacts/x</href>"
                                              "<status>" +
                                                  std::string(status) + "</status></response></multistatus>"));
        });
        int code = 0;
        EXPECT_FALSE(alice.manager->removeFileAtURL(alice.at("dateFile"), &code));
        EXPECT_EQ(code, 207);
    }
}

// What a trial finds of a server, and that it leaves nothing behind.
StoreTrial trialOf(const Oddities& habits, bool isPublished = false) {
    OddServer server(habits);
    OddClient alice(server);
    if (isPublished) {
        EXPECT_TRUE(alice.manager->sanityCheckPublishStructureCreate(true));
    }
    const auto files = server.files();
    const auto collections = server.collections();
    CXDAVError error;
    EXPECT_TRUE(alice.manager->canReach(error)) << error.reason;
    const StoreTrial trial = tryStore(*alice.manager);
    EXPECT_EQ(server.files(), files) << alice.wire->text();
    EXPECT_EQ(server.collections(), collections) << alice.wire->text();
    EXPECT_TRUE(server.locked().empty());
    return trial;
}

TEST(StoreTrials, FindWhatAServerDoesAndLeaveNothing) {
    for (const bool isPublished : {false, true}) {
        const StoreTrial all = trialOf({}, isPublished);
        EXPECT_FALSE(all.hindrance) << all.hindrance->what;
        EXPECT_TRUE(all.dates && all.tags && all.locks && all.conditions);
        EXPECT_FALSE(all.accessLists);
    }
    Oddities odd;
    odd.dates = false;
    odd.davHeaders = "DAV: 1, access-control\r\n";
    const StoreTrial some = trialOf(odd);
    EXPECT_FALSE(some.hindrance);
    EXPECT_FALSE(some.dates);
    EXPECT_FALSE(some.locks) << "class 2 is not announced";
    EXPECT_TRUE(some.tags && some.conditions && some.accessLists);
}

// A server may say that it has made what was there: taking that away again would take everybody's trees.
TEST(StoreTrials, TakeNothingAwayThatWasThereBefore) {
    Oddities odd;
    odd.makesAgain = true;
    OddServer server(odd);
    OddClient alice(server), bob(server, "bob");
    CXDAVError error;
    ASSERT_TRUE(alice.manager->canReach(error)) << error.reason;
    ASSERT_TRUE(alice.manager->sanityCheckPublishStructureCreate(true));
    EXPECT_EQ(alice.write("dateFile", Dictionary{{"a", 1}}), 204);
    const auto files = server.files();
    const auto collections = server.collections();
    for (OddClient* client : {&bob, &alice}) {
        ASSERT_TRUE(client->manager->canReach(error)) << error.reason;
        EXPECT_FALSE(tryStore(*client->manager).hindrance);
        EXPECT_EQ(server.files(), files) << client->wire->text();
        EXPECT_EQ(server.collections(), collections) << client->wire->text();
    }
}

// Two people try a store at the same time: what the one has put into a folder of the other's trial stays.
TEST(StoreTrials, TakeNoFolderAwayThatHoldsSomethingByThen) {
    OddServer server;
    OddClient bob(server, "bob");
    CXDAVError error;
    ASSERT_TRUE(bob.manager->canReach(error)) << error.reason;
    bob.wire->intercept([&](const HttpRequest& r) {
        if (r.method == "LOCK") server.write("/dav/bob/of another", "kept");
        return std::optional<HttpResponse>();
    });
    EXPECT_FALSE(tryStore(*bob.manager).hindrance);
    EXPECT_EQ(server.files(), (std::map<std::string, std::string>{{"/dav/bob/of another", "kept"}}));
}

TEST(StoreTrials, SayWhatCannotWork) {
    for (const int status : {403, 405, 501, 507}) {
        Oddities odd;
        odd.mkcol = status;
        const StoreTrial trial = trialOf(odd);
        ASSERT_TRUE(trial.hindrance) << status;
        EXPECT_EQ(trial.hindrance->status, status);
        EXPECT_NE(trial.hindrance->what.find("makes no folders (MKCOL was answered with " + std::to_string(status)),
                  std::string::npos)
            << trial.hindrance->what;
    }
    for (const int status : {400, 403, 409, 415}) { // as servers for address books alone do
        Oddities odd;
        odd.put = status;
        const StoreTrial trial = trialOf(odd);
        ASSERT_TRUE(trial.hindrance) << status;
        EXPECT_EQ(trial.hindrance->status, status);
        EXPECT_NE(trial.hindrance->what.find("takes no files of this kind"), std::string::npos);
    }
}

TEST(StoreTrials, TellAServerForAddressBooksByItsOwnWords) {
    using Remedy = StoreTrial::Hindrance::Remedy;
    Oddities odd;
    odd.mkcol = 403;
    EXPECT_EQ(trialOf(odd).hindrance->remedy, Remedy::rights);
    for (const char* announced : {"DAV: 1, 2, 3, calendar-access, extended-mkcol\r\n", "DAV: 1, addressbook\r\n"}) {
        odd.davHeaders = announced;
        const StoreTrial trial = trialOf(odd);
        ASSERT_TRUE(trial.hindrance);
        EXPECT_EQ(trial.hindrance->remedy, Remedy::endpoint);
        EXPECT_TRUE(trial.hindrance->lasts);
        EXPECT_NE(trial.hindrance->what.find("takes no files of this kind: it is a server for address books"),
                  std::string::npos)
            << trial.hindrance->what;
    }
    odd.mkcol = 0;
    EXPECT_FALSE(trialOf(odd).hindrance) << "some take files, too";
}

TEST(StoreTrials, TellWhatIsOverInAMomentFromWhatLasts) {
    for (const auto& [status, lasts] : {std::pair{403, true},
                                        {405, true},
                                        {501, true},
                                        {409, true},
                                        {423, false},
                                        {429, false},
                                        {500, false},
                                        {503, false},
                                        {507, false}}) {
        Oddities odd;
        odd.mkcol = status;
        const StoreTrial trial = trialOf(odd);
        ASSERT_TRUE(trial.hindrance) << status;
        EXPECT_EQ(trial.hindrance->lasts, lasts) << status;
    }
}

// As a server of Debian's does: the answer fails, and the lock stands for ever.
TEST(StoreTrials, FindLocksThatNobodyIsTold) {
    Oddities odd;
    odd.lockGranted = 502;
    for (const bool told : {false, true}) {
        odd.tellsLocks = told;
        OddServer server(odd);
        OddClient alice(server);
        CXDAVError error;
        ASSERT_TRUE(alice.manager->canReach(error)) << error.reason;
        const StoreTrial trial = tryStore(*alice.manager);
        ASSERT_TRUE(trial.hindrance) << "the file stays locked";
        const bool blamesLocks = trial.hindrance->what.find("does not tell their locks") != std::string::npos;
        EXPECT_EQ(blamesLocks, !told) << trial.hindrance->what;
        EXPECT_EQ(trial.hindrance->lasts, !told) << "a lock that is told was only not answered";
        EXPECT_TRUE(server.files().empty());
    }
}

} // namespace
} // namespace rolvane
