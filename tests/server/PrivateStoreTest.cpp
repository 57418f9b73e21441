#include "RawHttp.h"
#include "StoreTestWorld.h"
#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "server/LoopbackPort.h"
#include "server/StoreConfiguration.h"
#include "server/StoreProcess.h"
#include "support/WaitUntil.h"
#include "support/WithoutInotify.h"

#include <arpa/inet.h>
#include <chrono>
#include <csignal>
#include <filesystem>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <set>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace rolvane {
namespace {

using testing::HasSubstr;
using testing::Not;

// A store with alice and bob, started.
struct World {
    StoreDirectory directory;
    PrivateStore store;

    explicit World(PrivateStoreOptions changes = {}) : store(complete(std::move(changes))) {
        store.addUser("alice", "wonder land");
        store.addUser("bob", "builder");
        store.start();
    }
    PrivateStoreOptions complete(PrivateStoreOptions options) const {
        options.stateDirectory = directory.path("store");
        options.ownsProcess = true;
        return options;
    }
    CurlClient alice(const std::string& scheme = "--basic") const { return {store, "alice", "wonder land", scheme}; }
    CurlClient bob(const std::string& scheme = "--basic") const { return {store, "bob", "builder", scheme}; }
};

std::string reasonOf(const std::function<void()>& operation) {
    try {
        operation();
    } catch (const CXException& e) {
        return e.reason();
    }
    return "";
}

mode_t modeOf(const std::string& path) {
    struct stat info {};
    return stat(path.c_str(), &info) == 0 ? info.st_mode & 07777 : 0;
}

// With its quotes; "" when the answer has none. Header names are in lower case on HTTP/2.
std::string entityTagOf(const HTTPAnswer& answer) {
    std::string lower = answer.headers;
    for (char& c : lower) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    const size_t name = lower.find("\netag: ");
    if (name == std::string::npos) return "";
    const size_t at = answer.headers.find('"', name);
    return answer.headers.substr(at, answer.headers.find('"', at + 1) + 1 - at);
}

constexpr const char* kLockBody = "<?xml version=\"1.0\"?><D:lockinfo xmlns:D=\"DAV:\"><D:lockscope><D:exclusive/>"
                                  "</D:lockscope><D:locktype><D:write/></D:locktype></D:lockinfo>";

TEST(PrivateStoreLife, BeginsWhereThereIsNoWatchOfDirectories) {
    test::withoutInotify([] {
        const World world;
        EXPECT_EQ(world.alice().request("PUT", "/alice/x", {}, "x").status, 201);
    });
}

TEST(PrivateStore, AnswersAsAClassTwoStoreOverTLSFromItsOwnAuthority) {
    const World world;
    const HTTPAnswer answer = world.alice().request("OPTIONS", "/alice/");
    EXPECT_EQ(answer.status, 200) << answer.body;
    EXPECT_THAT(answer.headers, testing::ContainsRegex("[Dd][Aa][Vv]: 1,2"));
    EXPECT_THAT(world.store.baseURL(), testing::StartsWith("https://localhost:"));
    EXPECT_EQ(world.store.endpointTemplate(), world.store.baseURL() + "/{user}/Contacts");
}

TEST(PrivateStore, IsNotTrustedByAClientThatKnowsOnlyThePublicAuthorities) {
    const World world;
    const auto result = runCommand({"curl", "-q", "-sS", "--noproxy", "*", world.store.baseURL() + "/alice/"});
    EXPECT_EQ(result.status, 60) << result.errors; // curl: the peer's certificate cannot be authenticated
}

TEST(PrivateStore, AnswersOnBothLoopbackAddressesByNameAndNumber) {
    const World world;
    const std::string port = std::to_string(world.store.status().port);
    for (const std::string host : {"localhost", "127.0.0.1"}) {
        const auto result =
            runCommand({"curl", "-q", "-sS", "--noproxy", "*", "--cacert", world.store.caFile(), "-o", "/dev/null",
                        "-w", "%{http_code}", "https://" + host + ":" + port + "/dav/alice/"});
        EXPECT_EQ(result.output, "401") << host << ": " << result.errors;
    }
}

TEST(PrivateStore, SpeaksHTTP2WhenAskedAndOnlyThen) {
    World with;
    CurlClient client = with.alice();
    client.extraArguments = {"--http2"};
    EXPECT_THAT(client.request("OPTIONS", "/alice/").headers, HasSubstr("HTTP/2 200"));

    PrivateStoreOptions options;
    options.http2 = false;
    World without(options);
    client = without.alice();
    client.extraArguments = {"--http2"};
    EXPECT_THAT(client.request("OPTIONS", "/alice/").headers, HasSubstr("HTTP/1.1 200"));
}

TEST(PrivateStore, KeepsWhatIsPutAndGivesItBack) {
    const World world;
    const std::string body("a\0b\r\n\xc3\xa9", 7);
    EXPECT_EQ(world.alice().request("MKCOL", "/alice/Contacts").status, 201);
    EXPECT_EQ(world.alice().request("PUT", "/alice/Contacts/x%3AGroup", {}, body).status, 201);
    EXPECT_EQ(world.alice().request("GET", "/alice/Contacts/x%3AGroup").body, body);
    EXPECT_EQ(world.alice().request("PUT", "/alice/Contacts/x%3AGroup", {}, "second").status, 204);
    EXPECT_EQ(world.alice().request("DELETE", "/alice/Contacts/x%3AGroup").status, 204);
    EXPECT_EQ(world.alice().request("GET", "/alice/Contacts/x%3AGroup").status, 404);
}

TEST(PrivateStore, ListsACollectionWithTheEntityTagsOfItsFiles) {
    const World world;
    world.alice().request("PUT", "/alice/x", {}, "one");
    const HTTPAnswer listing = world.alice().request("PROPFIND", "/alice/", {"Depth: 1"});
    EXPECT_EQ(listing.status, 207);
    const std::string tag = entityTagOf(world.alice().request("GET", "/alice/x"));
    EXPECT_THAT(tag, testing::MatchesRegex("\".+\""));
    EXPECT_THAT(listing.body, HasSubstr(">" + tag + "</"));
}

TEST(PrivateStore, GivesTwoVersionsOfOneSizeWithinASecondDifferentEntityTags) {
    const World world;
    std::set<std::string> tags;
    for (const char* body : {"one", "two", "six"}) {
        world.alice().request("PUT", "/alice/x", {}, body);
        tags.insert(entityTagOf(world.alice().request("GET", "/alice/x")));
    }
    EXPECT_EQ(tags.size(), 3u);
}

TEST(PrivateStore, AcceptsAConditionalWriteRightAfterTheVersionThatItNames) {
    const World world;
    world.alice().request("PUT", "/alice/x", {}, "one");
    const std::string tag = entityTagOf(world.alice().request("GET", "/alice/x"));
    EXPECT_EQ(world.alice().request("PUT", "/alice/x", {"If-Match: " + tag}, "two").status, 204);
    EXPECT_EQ(world.alice().request("PUT", "/alice/x", {"If-Match: " + tag}, "six").status, 412);
    EXPECT_EQ(world.alice().request("PUT", "/alice/x", {"If-None-Match: *"}, "six").status, 412);
    EXPECT_EQ(world.alice().request("PUT", "/alice/new", {"If-None-Match: *"}, "new").status, 201);
    EXPECT_EQ(world.alice().request("GET", "/alice/x").body, "two");
}

TEST(PrivateStore, KeepsALockFromEverybodyWithoutItsToken) {
    const World world;
    world.alice().request("PUT", "/alice/dateFile", {}, "x");
    const HTTPAnswer locked = world.alice().request("LOCK", "/alice/dateFile", {"Timeout: Second-90"}, kLockBody);
    ASSERT_EQ(locked.status, 200) << locked.body;
    const size_t at = locked.headers.find("<opaquelocktoken");
    const std::string token = locked.headers.substr(at, locked.headers.find('>', at) + 1 - at);

    EXPECT_EQ(world.alice().request("PUT", "/alice/dateFile", {}, "y").status, 423);
    EXPECT_EQ(world.alice().request("PUT", "/alice/dateFile", {"If: (" + token + ")"}, "y").status, 204);
    EXPECT_EQ(world.alice().request("UNLOCK", "/alice/dateFile", {"Lock-Token: " + token}).status, 204);
    EXPECT_EQ(world.alice().request("PUT", "/alice/dateFile", {}, "z").status, 204);
}

TEST(PrivateStore, RefusesAWrongPasswordAndNoPassword) {
    const World world;
    EXPECT_EQ(CurlClient(world.store, "alice", "builder").request("GET", "/alice/").status, 401);
    EXPECT_EQ(CurlClient(world.store, "carol", "builder").request("GET", "/alice/").status, 401);
    EXPECT_EQ(CurlClient(world.store, "", "").request("PROPFIND", "/alice/", {"Depth: 0"}).status, 401);
}

TEST(PrivateStore, ServesWithDigestAuthentication) {
    PrivateStoreOptions options;
    options.authentication = StoreAuthentication::digest;
    const World world(options);
    EXPECT_EQ(world.alice("--digest").request("PUT", "/alice/x", {}, "x").status, 201);
    EXPECT_EQ(world.alice("--digest").request("PUT", "/bob/x", {}, "x").status, 403);
    EXPECT_EQ(world.alice("--basic").request("GET", "/alice/x").status, 401);
    EXPECT_EQ(CurlClient(world.store, "alice", "no", "--digest").request("GET", "/alice/x").status, 401);
}

TEST(PrivateStore, ServesInClearAndWithoutAccountsWhenTold) {
    PrivateStoreOptions options;
    options.tls = false;
    options.authentication = StoreAuthentication::none;
    const World world(options);
    EXPECT_THAT(world.store.baseURL(), testing::StartsWith("http://localhost:"));
    const CurlClient anybody(world.store, "", "");
    EXPECT_EQ(anybody.request("PUT", "/alice/x", {}, "x").status, 201);
    EXPECT_EQ(anybody.request("PUT", "/carol/x", {}, "x").status, 403);
}

// Each way into bob's tree, tried by alice: what she may not do, and that nothing came of it.
struct Intrusion {
    const char* name;
    const char* method;
    const char* path;
    const char* destination; // of COPY and MOVE, below the base
};

class ForeignTree : public testing::TestWithParam<Intrusion> {};

TEST_P(ForeignTree, IsClosedTo) {
    const World world;
    ASSERT_EQ(world.bob().request("PUT", "/bob/secret", {}, "bob's").status, 201);
    ASSERT_EQ(world.alice().request("PUT", "/alice/own", {}, "alice's").status, 201);

    const Intrusion& way = GetParam();
    std::vector<std::string> headers = {"Depth: 0"};
    if (way.destination) headers = {"Destination: " + world.store.baseURL() + way.destination};
    const bool hasBody = std::string(way.method) == "PUT" || std::string(way.method) == "LOCK";
    const HTTPAnswer answer = world.alice().request(
        way.method, way.path, headers,
        hasBody ? std::optional<std::string>(std::string(way.method) == "LOCK" ? kLockBody : "alice was here")
                : std::nullopt);

    EXPECT_TRUE(answer.status == 403 || answer.status == 404 || answer.status == 400 || answer.status == 502)
        << answer.status << "\n"
        << answer.body;
    EXPECT_THAT(answer.body, Not(HasSubstr("bob's")));
    const HTTPAnswer listing = world.bob().request("PROPFIND", "/bob/", {"Depth: 1"});
    EXPECT_EQ(listing.status, 207);
    EXPECT_THAT(listing.body, Not(testing::AnyOf(HasSubstr("stolen"), HasSubstr("lockdiscovery><D:active"))));
    EXPECT_EQ(world.bob().request("GET", "/bob/secret").body, "bob's");
    EXPECT_EQ(world.alice().request("GET", "/alice/own").body, "alice's");
}

INSTANTIATE_TEST_SUITE_P(
    Ways, ForeignTree,
    testing::Values(Intrusion{"Reading", "GET", "/bob/secret", nullptr},
                    Intrusion{"Listing", "PROPFIND", "/bob/", nullptr},
                    Intrusion{"Writing", "PUT", "/bob/stolen", nullptr},
                    Intrusion{"Overwriting", "PUT", "/bob/secret", nullptr},
                    Intrusion{"Deleting", "DELETE", "/bob/secret", nullptr},
                    Intrusion{"DeletingTheTree", "DELETE", "/bob/", nullptr},
                    Intrusion{"MakingACollection", "MKCOL", "/bob/stolen", nullptr},
                    Intrusion{"Locking", "LOCK", "/bob/secret", nullptr},
                    Intrusion{"CopyingIn", "COPY", "/alice/own", "/bob/stolen"},
                    Intrusion{"CopyingOver", "COPY", "/alice/own", "/bob/secret"},
                    Intrusion{"CopyingOverTheTree", "COPY", "/alice/", "/bob/"},
                    Intrusion{"CopyingOut", "COPY", "/bob/secret", "/alice/stolen"},
                    Intrusion{"MovingIn", "MOVE", "/alice/own", "/bob/stolen"},
                    Intrusion{"MovingOut", "MOVE", "/bob/secret", "/alice/stolen"},
                    Intrusion{"CopyingInThroughDots", "COPY", "/alice/own", "/alice/../bob/stolen"},
                    Intrusion{"CopyingInThroughEncodedDots", "COPY", "/alice/own", "/alice/%2e%2e/bob/stolen"},
                    Intrusion{"CopyingInThroughAnEncodedName", "COPY", "/alice/own", "/%62ob/stolen"},
                    Intrusion{"CopyingInThroughDoubleSlashes", "COPY", "/alice/own", "//bob//stolen"},
                    Intrusion{"ReadingThroughDots", "GET", "/alice/../bob/secret", nullptr},
                    Intrusion{"ReadingThroughEncodedDots", "GET", "/alice/%2e%2e/bob/secret", nullptr},
                    Intrusion{"ReadingThroughAnEncodedSlash", "GET", "/alice/..%2fbob/secret", nullptr},
                    Intrusion{"ReadingThroughAnEncodedName", "GET", "/%62ob/secret", nullptr},
                    Intrusion{"ReadingThroughDoubleSlashes", "GET", "//bob//secret", nullptr},
                    Intrusion{"MakingATree", "MKCOL", "/carol", nullptr},
                    Intrusion{"WritingBesideTheTrees", "PUT", "/stolen", nullptr},
                    Intrusion{"CopyingBesideTheTrees", "COPY", "/alice/own", "/carol"}),
    [](const auto& intrusion) { return intrusion.param.name; });

TEST(PrivateStore, IsReadyWellWithinASecond) {
    const StoreDirectory directory;
    PrivateStore store(optionsIn(directory));
    store.addUser("alice", "a");
    const auto before = std::chrono::steady_clock::now();
    store.start();
    EXPECT_LT(std::chrono::steady_clock::now() - before,
              std::chrono::seconds(5)); // a loaded machine; figures are in bench
    EXPECT_EQ(CurlClient(store, "alice", "a").request("OPTIONS", "/alice/").status, 200);
}

TEST(PrivateStore, KeepsPortAndDataOverStopAndStart) {
    const StoreDirectory directory;
    int port = 0;
    {
        PrivateStore store(optionsIn(directory));
        store.addUser("alice", "a");
        store.start();
        port = store.status().port;
        ASSERT_EQ(CurlClient(store, "alice", "a").request("PUT", "/alice/x", {}, "kept").status, 201);
        store.stop(PrivateStore::Stop::gracefully);
        EXPECT_FALSE(store.status().running);
        EXPECT_EQ(store.status().pid, 0);
    }
    PrivateStore again(optionsIn(directory));
    again.start();
    EXPECT_EQ(again.status().port, port);
    EXPECT_EQ(CurlClient(again, "alice", "a").request("GET", "/alice/x").body, "kept");
}

TEST(PrivateStore, OutlivesItsLauncherUnlessOwned) {
    const StoreDirectory directory;
    PrivateStoreOptions options = optionsIn(directory);
    options.ownsProcess = false;
    pid_t pid = 0;
    {
        PrivateStore launcher(options);
        launcher.start();
        pid = launcher.status().pid;
    }
    PrivateStore other(optionsIn(directory));
    EXPECT_EQ(other.status().pid, pid);
    other.start(); // runs already: nothing happens
    EXPECT_EQ(other.status().pid, pid);
    other.stop();
    EXPECT_FALSE(other.status().running);

    {
        PrivateStore owner(optionsIn(directory));
        owner.start();
    }
    EXPECT_FALSE(PrivateStore(options).status().running);
}

TEST(PrivateStore, RemembersTheOptionsOfItsLastStart) {
    const StoreDirectory directory;
    EXPECT_FALSE(PrivateStore::savedOptions(directory.path("store")));
    PrivateStoreOptions options = optionsIn(directory);
    options.tls = false;
    options.authentication = StoreAuthentication::digest;
    options.documentRoot = directory.path("elsewhere");
    PrivateStore store(options);
    store.start();
    const auto saved = PrivateStore::savedOptions(directory.path("store"));
    ASSERT_TRUE(saved);
    EXPECT_FALSE(saved->tls);
    EXPECT_EQ(saved->authentication, StoreAuthentication::digest);
    EXPECT_EQ(saved->documentRoot, store.documentRoot());
    EXPECT_EQ(PrivateStore(*saved).baseURL(), store.baseURL());
    EXPECT_FALSE(saved->ownsProcess);
}

TEST(PrivateStore, KeepsItsFilesInTheDocumentRootThatItIsGiven) {
    PrivateStoreOptions options;
    const StoreDirectory elsewhere;
    options.documentRoot = elsewhere.path("files");
    const World world(options);
    ASSERT_EQ(world.alice().request("PUT", "/alice/x", {}, "here").status, 201);
    EXPECT_EQ(readFile(elsewhere.path("files/dav/alice/x")), "here");
    EXPECT_EQ(world.store.userDirectory("alice"), elsewhere.path("files/dav/alice"));
}

TEST(PrivateStore, RunsInADirectoryThatIsReachedThroughALink) {
    const StoreDirectory directory;
    std::filesystem::create_directory(directory.path("real"));
    std::filesystem::create_symlink(directory.path("real"), directory.path("link"));
    PrivateStore store(optionsIn(directory, "link/my store"));
    store.addUser("alice", "a");
    store.start();
    EXPECT_TRUE(store.status().running);
    EXPECT_EQ(CurlClient(store, "alice", "a").request("PUT", "/alice/x", {}, "x").status, 201);
}

TEST(PrivateStore, RunsBesideOthersWithoutSharingAnything) {
    const World one, two;
    EXPECT_NE(one.store.status().port, two.store.status().port);
    ASSERT_EQ(one.alice().request("PUT", "/alice/x", {}, "one").status, 201);
    EXPECT_EQ(two.alice().request("GET", "/alice/x").status, 404);
    const auto result = runCommand(
        {"curl", "-q", "-sS", "--noproxy", "*", "--cacert", two.store.caFile(), one.store.baseURL() + "/alice/"});
    EXPECT_EQ(result.status, 60) << "one store's authority must not vouch for another's";
}

TEST(PrivateStore, SeveralStartAtTheSameTime) {
    const StoreDirectory directory;
    std::vector<std::thread> launchers;
    std::vector<PrivateStore> stores;
    for (int i = 0; i < 3; ++i) stores.emplace_back(optionsIn(directory, "store" + std::to_string(i)));
    for (auto& store : stores) launchers.emplace_back([&store] { store.start(); });
    for (auto& launcher : launchers) launcher.join();
    std::set<int> ports;
    for (auto& store : stores) {
        EXPECT_TRUE(store.status().running);
        ports.insert(store.status().port);
    }
    EXPECT_EQ(ports.size(), 3u);
}

TEST(PrivateStore, StartsOnceWhenTwoLaunchersRace) {
    const StoreDirectory directory;
    PrivateStore first(optionsIn(directory)), second(optionsIn(directory));
    std::thread other([&] { second.start(); });
    first.start();
    other.join();
    EXPECT_TRUE(first.status().running);
    EXPECT_EQ(first.status().pid, second.status().pid);
    EXPECT_THAT(readFile(first.errorLog()), Not(HasSubstr("Address already in use")));
}

TEST(PrivateStore, IsNotDeceivedByTheProcessNumberOfADeadStore) {
    const StoreDirectory directory;
    PrivateStore store(optionsIn(directory));
    store.start();
    const PrivateStoreStatus before = store.status();
    kill(-before.pid, SIGKILL);
    waitpid(before.pid, nullptr, 0);
    ASSERT_TRUE(test::waitUntil([&] { return LoopbackPort::isFree(before.port); }, "the last worker's end"));
    // The number now belongs to this very program.
    writeFileDurably(directory.path("store/run/httpd.pid"), std::to_string(getpid()) + "\n");
    EXPECT_FALSE(store.status().running);
    store.stop(); // must not touch this program
    writeFileDurably(directory.path("store/run/httpd.pid"), std::to_string(getpid()) + "\n");
    store.start();
    EXPECT_TRUE(store.status().running);
    EXPECT_NE(store.status().pid, getpid());
}

TEST(PrivateStore, TakesOverFromTheWorkersOfAMasterThatWasKilled) {
    const StoreDirectory directory;
    PrivateStore store(optionsIn(directory));
    store.start();
    const pid_t master = store.status().pid;
    kill(master, SIGKILL); // its workers go on and hold the port
    waitpid(master, nullptr, 0);
    store.start();
    EXPECT_TRUE(store.status().running);
}

TEST(PrivateStore, SaysThatItsPortIsTaken) {
    const int taken = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ASSERT_EQ(bind(taken, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    ASSERT_EQ(listen(taken, 1), 0);
    socklen_t size = sizeof address;
    getsockname(taken, reinterpret_cast<sockaddr*>(&address), &size);

    const StoreDirectory directory;
    PrivateStoreOptions options = optionsIn(directory);
    options.port = ntohs(address.sin_port);
    PrivateStore store(options);
    const std::string reason = reasonOf([&] { store.start(); });
    EXPECT_THAT(reason, HasSubstr("port " + std::to_string(options.port) + " is taken by another program"));
    EXPECT_FALSE(store.status().running);
    close(taken);
    store.start();
    EXPECT_EQ(store.status().port, options.port);
}

TEST(PrivateStore, NamesThePackageWhenHttpdIsMissing) {
    const StoreDirectory directory;
    PrivateStoreOptions options = optionsIn(directory);
    options.httpdProgram = directory.path("no-httpd");
    EXPECT_THAT(reasonOf([&] { PrivateStore(options).start(); }), HasSubstr("Install the package apache2-bin"));
    options = optionsIn(directory);
    options.httpdModules = directory.path();
    EXPECT_THAT(reasonOf([&] { PrivateStore(options).start(); }), HasSubstr("mod_mpm_event.so"));
}

TEST(PrivateStore, ReportsHttpdsOwnWordsWhenItDoesNotStart) {
    const StoreDirectory directory;
    PrivateStoreOptions options = optionsIn(directory);
    options.extraConfiguration = {"NoSuchDirective on"};
    PrivateStore store(options);
    EXPECT_THAT(reasonOf([&] { store.start(); }), HasSubstr("Invalid command 'NoSuchDirective'"));
    EXPECT_FALSE(store.status().running);
}

TEST(PrivateStore, RefusesADirectoryThatAConfigurationCannotName) {
    const StoreDirectory directory;
    EXPECT_THAT(reasonOf([&] { PrivateStore(optionsIn(directory, "a\"b")).start(); }),
                HasSubstr("Choose another directory"));
}

TEST(PrivateStore, HasNoAddressBeforeItsFirstStart) {
    const StoreDirectory directory;
    const PrivateStore store(optionsIn(directory));
    EXPECT_FALSE(store.status().running);
    EXPECT_EQ(store.status().port, 0);
    EXPECT_THAT(reasonOf([&] { store.baseURL(); }), HasSubstr("rolvane store start"));
}

TEST(PrivateStore, AUserWhoIsAddedWhileItRunsIsServedAtOnce) {
    World world;
    const int port = world.store.status().port;
    world.store.addUser("carol", "c");
    EXPECT_EQ(CurlClient(world.store, "carol", "c").request("PUT", "/carol/x", {}, "x").status, 201);
    EXPECT_EQ(world.store.status().port, port);
    EXPECT_THAT(world.store.users(), testing::ElementsAre("alice", "bob", "carol"));
}

TEST(PrivateStore, UsersComeAndGoWithoutARestart) {
    const StoreDirectory directory;
    PrivateStoreOptions options = optionsIn(directory);
    options.tls = false;
    PrivateStore store(options);
    store.addUser("alice", rawPasswordOf("alice"));
    store.start();
    const PrivateStoreStatus before = store.status();
    RawUpload upload(before.port, {"alice", "PUT", "/dav/alice/x", {{"Expect", "100-continue"}}, "slow"}, 0);
    ASSERT_TRUE(upload.awaitContinue());
    store.addUser("carol", rawPasswordOf("carol"));
    EXPECT_EQ(rawRequest(before.port, {"carol", "PUT", "/dav/carol/x", {}, "x"}).status, 201);
    EXPECT_EQ(rawRequest(before.port, {"carol", "PUT", "/dav/alice/y", {}, "x"}).status, 403);
    EXPECT_EQ(rawRequest(before.port, {"alice", "GET", "/dav/carol/x"}).status, 403);
    EXPECT_EQ(rawRequest(before.port, {"alice", "COPY", "/dav/alice/", {{"Destination", "/dav/carol/stolen"}}}).status,
              403);
    EXPECT_TRUE(store.removeUser("carol"));
    EXPECT_EQ(rawRequest(before.port, {"carol", "GET", "/dav/carol/x"}).status, 401);
    EXPECT_EQ(upload.finish().status, 201) << "what is under way is not disturbed";
    EXPECT_EQ(store.status().pid, before.pid);
}

TEST(PrivateStore, WithoutAccessListsAUserWhoIsAddedHasATreeNobodyElseMayEnter) {
    const StoreDirectory directory;
    PrivateStoreOptions options = optionsIn(directory);
    options.tls = false;
    options.accessLists = false;
    PrivateStore store(options);
    store.addUser("alice", rawPasswordOf("alice"));
    store.start();
    store.addUser("carol", rawPasswordOf("carol"));
    const int port = store.status().port;
    EXPECT_EQ(rawRequest(port, {"carol", "PUT", "/dav/carol/x", {}, "x"}).status, 201);
    EXPECT_EQ(rawRequest(port, {"alice", "GET", "/dav/carol/x"}).status, 403);
}

TEST(PrivateStore, ANewPasswordReplacesTheOldOneWithoutARestart) {
    World world;
    const pid_t pid = world.store.status().pid;
    world.store.addUser("alice", "other");
    EXPECT_EQ(world.alice().request("GET", "/alice/").status, 401);
    EXPECT_NE(CurlClient(world.store, "alice", "other").request("PROPFIND", "/alice/", {"Depth: 0"}).status, 401);
    EXPECT_EQ(world.store.status().pid, pid);
}

TEST(PrivateStore, ARemovedUserIsRefusedAndTheFilesStay) {
    World world;
    world.bob().request("PUT", "/bob/x", {}, "x");
    EXPECT_TRUE(world.store.removeUser("bob"));
    EXPECT_FALSE(world.store.removeUser("bob"));
    EXPECT_EQ(world.bob().request("GET", "/bob/x").status, 401);
    EXPECT_EQ(readFile(world.store.userDirectory("bob") + "/x"), "x");
    EXPECT_EQ(world.alice().request("PROPFIND", "/alice/", {"Depth: 0"}).status, 207);
}

TEST(PrivateStore, MakesATreeAnewThatItsUserDeleted) {
    World world;
    EXPECT_EQ(world.alice().request("DELETE", "/alice/").status, 204);
    EXPECT_EQ(world.bob().request("MKCOL", "/alice").status, 403);
    world.store.stop();
    world.store.start();
    EXPECT_EQ(world.alice().request("PUT", "/alice/x", {}, "x").status, 201);
}

TEST(PrivateStore, RefusesUsersThatCannotBePathsAndEmptyPasswords) {
    const StoreDirectory directory;
    PrivateStore store(optionsIn(directory));
    for (const std::string name : {"", ".", "..", ".x", "a/b", "a:b", "a b", "a\nb", "\xc3\xa9", "-x"})
        EXPECT_THAT(reasonOf([&] { store.addUser(name, "p"); }), HasSubstr("cannot be a user")) << name;
    EXPECT_THAT(reasonOf([&] { store.addUser("a", ""); }), HasSubstr("password"));
    EXPECT_THAT(reasonOf([&] { store.addUser("a", "x\ny"); }), HasSubstr("password"));
    EXPECT_TRUE(store.users().empty());
}

TEST(PrivateStore, KeepsKeysAndPasswordsFromOtherUsersWhateverTheUmask) {
    const mode_t before = umask(0);
    const World world;
    umask(before);
    const std::string state = world.store.stateDirectory();
    EXPECT_EQ(modeOf(state) & 066u, 0u) << "others list or write it";
    for (const char* file : {"/tls/server.key", "/conf/passwords", "/conf/httpd.conf", "/store.plist"})
        EXPECT_EQ(modeOf(state + file) & 07u, 0u) << file;
    EXPECT_THAT(readFile(state + "/conf/passwords"), Not(HasSubstr("wonder land")));
}

// Root's tests say nothing about ordinary users: a child becomes one and does it all again.
TEST(PrivateStore, RunsForAnOrdinaryUser) {
    const StoreDirectory directory;
    PrivateStoreOptions options = optionsIn(directory);
    // What was built may lie where ordinary users cannot look.
    options.configurationTemplate = directory.path("httpd.conf.in");
    options.accessModule = directory.path("mod_davacl.so");
    std::filesystem::copy_file(storeTemplatePath(), options.configurationTemplate);
    std::filesystem::copy_file(storeAccessModulePath(options.httpdModules), options.accessModule);
    if (geteuid() == 0) {
        for (const std::string& path : {directory.path(), options.configurationTemplate, options.accessModule})
            ASSERT_EQ(chown(path.c_str(), 65534, 65534), 0);
    }
    const pid_t child = fork();
    if (child == 0) {
        int result = 1;
        if (geteuid() != 0 || (setgid(65534) == 0 && setuid(65534) == 0)) {
            try {
                PrivateStore store(options);
                store.addUser("alice", "a");
                store.start();
                const bool put = CurlClient(store, "alice", "a").request("PUT", "/alice/x", {}, "x").status == 201;
                const bool refused = CurlClient(store, "alice", "a").request("GET", "/bob/x").status == 403;
                store.stop();
                result = put && refused && !store.status().running ? 0 : 2;
            } catch (const CXException& e) {
                std::fprintf(stderr, "%s\n", e.what());
            }
        }
        _exit(result);
    }
    int status = 0;
    waitpid(child, &status, 0);
    EXPECT_EQ(status, 0);
}

TEST(PrivateStore, StartsFromAProgramWithoutStandardDescriptors) {
    const StoreDirectory directory;
    const pid_t child = fork();
    if (child == 0) {
        for (int fd : {0, 1, 2}) close(fd);
        int result = 1;
        try {
            PrivateStore store(optionsIn(directory));
            store.start();
            result = store.status().running ? 0 : 2;
        } catch (const CXException&) {
            result = 3;
        }
        _exit(result);
    }
    int status = 0;
    waitpid(child, &status, 0);
    EXPECT_EQ(status, 0);
}

// Who serves others' requests need not know what the person who started it has in the environment.
TEST(PrivateStore, TheServerHasNothingOfTheEnvironmentThatItWasStartedIn) {
    setenv("ROLVANE_TEST_SECRET", "a key of the person's", 1);
    const World world;
    unsetenv("ROLVANE_TEST_SECRET");
    const auto processes = StoreProcess::findAll(world.store.stateDirectory() + "/conf/httpd.conf");
    ASSERT_GE(processes.size(), 2u);
    for (const auto& process : processes) {
        const std::string number = std::to_string(process.pid());
        const std::string environment = readFile("/proc/" + number + "/environ");
        EXPECT_NE(environment.find("PATH="), std::string::npos);
        for (const char* name : {"SECRET", "HOME=", "USER=", "LD_", "DBUS_"})
            EXPECT_EQ(environment.find(name), std::string::npos) << environment;
        EXPECT_NE(readFile("/proc/" + number + "/limits").find("Max core file size        0                    0"),
                  std::string::npos);
    }
}

TEST(PrivateStore, NeverServesAsRoot) {
    const World world;
    struct stat info {};
    ASSERT_EQ(stat(("/proc/" + std::to_string(world.store.status().pid)).c_str(), &info), 0);
    EXPECT_NE(info.st_uid, 0u);
}

} // namespace
} // namespace rolvane
