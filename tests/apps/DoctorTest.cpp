#include "CommandWorld.h"
#include "Neighbour.h"
#include "TerminalSession.h"

#include "engine/pass/PassOutcome.h"
#include "foundation/Paths.h"
#include "foundation/Preferences.h"

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <regex>
#include <unistd.h>

namespace rolvane::test {
namespace {

class TheDoctor : public testing::Test {
protected:
    nlohmann::json examine(int status = kDone) { return world.json({"doctor"}, status); }
    static nlohmann::json of(const nlohmann::json& told, const std::string& check) {
        for (const auto& finding : told["findings"])
            if (finding["check"] == check) return finding;
        return {{"check", check}, {"state", "missing"}};
    }
    // Each failure has a sentence and something to do.
    static void expectFailed(const nlohmann::json& told, const std::string& check, const std::string& toDo) {
        const auto finding = of(told, check);
        EXPECT_EQ(finding["state"], "failed") << told.dump(2);
        EXPECT_FALSE(finding.value("what", "").empty());
        EXPECT_NE(finding["toDo"].is_string() ? finding["toDo"].get<std::string>().find(toDo) : std::string::npos,
                  std::string::npos)
            << finding.dump(2);
    }
    CommandWorld world;
};

TEST_F(TheDoctor, FindsNothingWrongWithAnEmptyHome) {
    const auto told = examine();
    EXPECT_EQ(told["well"], true);
    EXPECT_EQ(of(told, "account")["toDo"], "rolvane setup");
    EXPECT_FALSE(std::filesystem::exists(world.home / "data/rolvane/contacts.db")) << "nothing is made";
}

TEST_F(TheDoctor, LooksAtEverything) {
    world.bus();
    world.makeAccount();
    world.add("Ada");
    ASSERT_EQ(world.rolvane({"publish"}).status, kDone);
    const auto told = examine();
    EXPECT_EQ(told["well"], true) << told.dump(2);
    for (const char* check : {"database", "preferences", "account", "address", "login", "authority", "clock", "rights",
                              "webdav", "structure", "computers", "bus", "launcher", "queue"})
        EXPECT_EQ(of(told, check)["state"], "well") << check << told.dump(2);
    EXPECT_NE(of(told, "unit")["state"], "missing");
    const Ran text = world.rolvane({"doctor"});
    EXPECT_GE(lineCount(text.output), told["findings"].size()) << text;
    EXPECT_NE(text.errors.find("All is well."), std::string::npos) << text;
}

TEST_F(TheDoctor, NamesAStoreThatIsAway) {
    world.makeAccount();
    world.store().stop(PrivateStore::Stop::atOnce);
    const auto told = examine(kFailure);
    expectFailed(told, "address", "rolvane account test");
    EXPECT_EQ(of(told, "login")["state"], "unknown");
    EXPECT_EQ(of(told, "database")["state"], "note") << "the rest is looked at all the same";
    EXPECT_NE(of(told, "launcher")["state"], "missing");
}

TEST_F(TheDoctor, NamesAWrongPasswordAndAMissingOne) {
    world.makeAccount();
    const std::string password = world.json({"account", "show"})["password"]["value"];
    std::ofstream(password) << "wrong\n";
    const auto refused = examine(kFailure);
    EXPECT_EQ(of(refused, "address")["state"], "well");
    expectFailed(refused, "login", "rolvane account set --ask-password");
    std::filesystem::remove(password);
    expectFailed(examine(kFailure), "account", "rolvane account set --ask-password");
}

TEST_F(TheDoctor, NamesAnAuthorityThatIsNotBelieved) {
    world.makeAccount();
    ASSERT_EQ(world.rolvane({"account", "set", "--ca-file", ""}).status, kDone);
    expectFailed(examine(kFailure), "address", "rolvane account test");
}

TEST_F(TheDoctor, NamesADaemonThatShouldRun) {
    world.makeAccount();
    world.add("Ada");
    ASSERT_EQ(world.rolvane({"publish"}).status, kDone);
    ASSERT_EQ(world.rolvane({"daemon", "stop"}).status, kDone);
    expectFailed(examine(kFailure), "launcher", "rolvane daemon start");
}

TEST_F(TheDoctor, NamesATreeThatLacksSomething) {
    world.makeAccount();
    world.add("Ada");
    ASSERT_EQ(world.rolvane({"publish"}).status, kDone);
    ASSERT_EQ(world.rolvane({"daemon", "stop"}).status, kDone);
    std::filesystem::remove(world.treeDirectory() + "/dateFile");
    expectFailed(examine(kFailure), "structure", "rolvane sync");
}

TEST_F(TheDoctor, NamesAnotherComputerThatHasPublished) {
    world.makeAccount();
    world.add("Ada");
    ASSERT_EQ(world.rolvane({"publish"}).status, kDone);
    ASSERT_EQ(world.rolvane({"sync"}).status, kDone); // it learns the tree's number
    EXPECT_EQ(of(examine(), "computers")["state"], "well");
    ASSERT_EQ(world.rolvane({"daemon", "stop"}).status, kDone);
    const std::string info = world.treeDirectory() + "/info";
    std::string text = readFile(info);
    const size_t serial = text.find("<string>") + 8;
    text[serial] = text[serial] == 'A' ? 'B' : 'A';
    std::ofstream(info) << text;
    expectFailed(examine(kFailure), "computers", "rolvane status");
}

// Whoever reads others' contacts and publishes nothing may have a tree on the store all the same: an empty one.
TEST_F(TheDoctor, TellsAReaderWhoPublishesNothingOfNoOtherComputer) {
    world.makeAccount();
    world.add("Ada");
    world.done({"publish"});
    Neighbour bob(world, "bob");
    world.done({"share", "bob"});
    bob.done({"subscribe", "alice"});
    std::filesystem::create_directories(world.store().userDirectory("bob") + "/Contacts");
    bob.done({"daemon", "restart"});
    bob.done({"sync"});
    const auto told = of(bob.json({"doctor"}), "computers");
    EXPECT_EQ(told["what"], "Nothing of this account is published yet.") << told.dump(2);
    EXPECT_EQ(told["state"], "well");
}

// One failure is told once, with the command that goes on; what needs the preferences is not known.
TEST_F(TheDoctor, NamesDamagedPreferences) {
    world.add("Ada");
    ASSERT_EQ(world.rolvane({"defaults", "write", "Key", "word"}).status, kDone);
    const std::string file = world.home / "state/rolvane/preferences.db";
    for (const char* suffix : {"-wal", "-shm"}) std::filesystem::remove(file + suffix);
    std::ofstream(file) << std::string(4096, 'x');
    const auto told = examine(kFailure);
    expectFailed(told, "preferences", "mv ");
    for (const auto& finding : told["findings"])
        EXPECT_TRUE(finding["state"] != "failed" || finding["check"] == "preferences") << finding.dump(2);
    EXPECT_EQ(of(told, "queue")["state"], "unknown");
    const std::string command = of(told, "preferences")["toDo"];
    EXPECT_EQ(world.run({"sh", "-c", command}).status, 0);
    EXPECT_EQ(examine()["well"], true) << "the command cures it";
}

TEST_F(TheDoctor, NamesAQueueThatHasWaitedForMoreThanADay) {
    world.makeAccount();
    world.add("Ada");
    ASSERT_EQ(world.rolvane({"publish"}).status, kDone);
    ASSERT_EQ(world.rolvane({"daemon", "stop"}).status, kDone);
    const auto waitFor = [&](double hours) {
        Preferences preferences(world.home / "state/rolvane/preferences.db");
        PassOutcome outcome = *lastOutcome(preferences);
        for (PassTree& tree : outcome.trees) {
            tree.out.waiting = 3;
            tree.out.waitingSince = Clock::system().now().addingSeconds(-hours * 3600);
        }
        preferences.set(kDaemonDomain, kCXDPassOutcome, encodeOutcome(outcome));
        preferences.synchronize(kDaemonDomain);
    };
    EXPECT_EQ(of(examine(kFailure), "queue")["state"], "well");
    waitFor(23);
    EXPECT_EQ(of(examine(kFailure), "queue")["state"], "note");
    waitFor(25);
    const auto told = examine(kFailure);
    expectFailed(told, "queue", "rolvane sync");
    EXPECT_EQ(of(told, "queue")["what"], "3 changes wait, the oldest for 25 hours.");
}

// One that is believed as well, as behind a change of the store's.
TEST_F(TheDoctor, NamesAnAuthorityThatEndsSoon) {
    world.makeAccount();
    EXPECT_EQ(of(examine(), "authority")["state"], "well");
    const std::string shortly = world.home / "shortly.pem", both = world.home / "both.pem";
    const Ran made =
        world.run({"openssl", "req", "-x509", "-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:P-256", "-nodes", "-days",
                   "20", "-subj", "/CN=shortly", "-keyout", world.home / "key.pem", "-out", shortly});
    ASSERT_EQ(made.status, 0) << made;
    std::ofstream(both) << readFile(world.store().caFile()) << readFile(shortly);
    ASSERT_EQ(world.rolvane({"account", "set", "--ca-file", both}).status, kDone);
    const auto finding = of(examine(), "authority");
    EXPECT_EQ(finding["state"], "note") << finding;
    EXPECT_EQ(finding["what"].get<std::string>().find("The store's authority is good until "), 0U) << finding;
}

// A real server whose certificates have ended two days ago.
TEST(TheDoctorOfAnEndedStore, NamesWhatHasEndedAndWhen) {
    CommandWorld world;
    PrivateStoreOptions options;
    options.stateDirectory = world.home / "ended";
    options.ownsProcess = true;
    options.certificateLifetime = -std::chrono::hours(48);
    PrivateStore store(options);
    store.addUser(UserWorld::kUser, UserWorld::kPassword);
    store.start();
    world.done({"account", "set", "--endpoint", store.endpointTemplate(), "--user", UserWorld::kUser, "--ca-file",
                store.caFile(), "--ask-password"},
               std::string(UserWorld::kPassword) + "\n");
    const auto told = world.json({"doctor"}, kFailure);
    nlohmann::json authority;
    for (const auto& finding : told["findings"])
        if (finding["check"] == "authority") authority = finding;
    EXPECT_EQ(authority["state"], "failed") << told.dump(2);
    EXPECT_TRUE(std::regex_search(authority["what"].get<std::string>(), std::regex("^The store's .* ended on ")))
        << authority;
    EXPECT_EQ(authority["toDo"], "rolvane store stop && rolvane store start");
}

// A store whose administrator has forbidden or switched off a method.
std::vector<std::string> answering(const std::string& method, int status) {
    return {"LoadModule rewrite_module /usr/lib/apache2/modules/mod_rewrite.so", "RewriteEngine On",
            "RewriteCond %{REQUEST_METHOD} =" + method, "RewriteRule ^ - [R=" + std::to_string(status) + ",L]"};
}

TEST_F(TheDoctor, NamesAStoreThatLetsNobodyWrite) {
    world.storeConfiguration = answering("PUT", 403);
    world.makeAccount();
    expectFailed(examine(kFailure), "rights", "rolvane account test");
}

TEST_F(TheDoctor, TellsOfAStoreWithoutLocks) {
    world.storeConfiguration = answering("LOCK", 405);
    world.makeAccount();
    const auto told = examine();
    EXPECT_EQ(of(told, "webdav")["state"], "note") << told.dump(2);
    EXPECT_EQ(of(told, "webdav")["what"].get<std::string>().find("It keeps no locks"), 0U) << told.dump(2);
}

TEST_F(TheDoctor, NamesDirectoriesThatCannotBeWritten) {
    world.add("Ada");
    const std::filesystem::path data = world.home / "data/rolvane";
    std::filesystem::permissions(data, std::filesystem::perms(0500));
    std::vector<std::string> command;
    if (::geteuid() == 0) command = {"setpriv", "--bounding-set=-all", "--inh-caps=-all"};
    command.insert(command.end(), {UserWorld::rolvaneProgram(), "doctor", "--json"});
    const Ran ran = world.run(command);
    std::filesystem::permissions(data, std::filesystem::perms(0700));
    EXPECT_EQ(ran.status, kFailure) << ran;
    expectFailed(nlohmann::json::parse(ran.output), "disk", "ls -ld");
}

TEST_F(TheDoctor, SaysThatThereIsNoBus) {
    EXPECT_EQ(of(examine(), "bus")["state"], "note");
    world.bus();
    EXPECT_EQ(of(examine(), "bus")["state"], "well");
}

TEST_F(TheDoctor, NamesADatabaseThatIsGone) {
    world.makeAccount();
    world.add("Ada");
    ASSERT_EQ(world.rolvane({"publish"}).status, kDone);
    ASSERT_EQ(world.rolvane({"daemon", "stop"}).status, kDone);
    std::filesystem::remove_all(world.home / "data/rolvane");
    expectFailed(examine(kFailure), "database", "rolvane");
}

// Names, numbers, addresses and secrets stand wherever one can.
TEST_F(TheDoctor, ABundleTellsNothingOfAnybody) {
    world.store().addUser("zzuser", UserWorld::kPassword);
    const std::string word = "zzsecretword";
    world.store().addUser("zzuser", word);
    const Ran set = world.rolvane({"account", "set", "--user", "zzuser", "--endpoint", world.store().endpointTemplate(),
                                   "--ca-file", world.store().caFile(), "--ask-password"},
                                  word + "\n");
    ASSERT_EQ(set.status, kDone) << set;
    world.add("Zzfirst", {"--last", "Zzlast", "--phone", "mobile:+49 555 0987654", "--email", "work:zzmail@zz.example",
                          "--note", "zznote"});
    world.group("Zzgroup", {"Zzfirst"});
    ASSERT_EQ(world.rolvane({"publish"}).status, kDone);
    const std::string port = ":" + std::to_string(world.store().status().port);
    const auto expectNothing = [&](const std::string& scene) {
        const std::string path = world.home / "zzbundle.json";
        std::filesystem::remove(path);
        (void)world.rolvane({"doctor", "--bundle", path});
        const std::string text = readFile(path);
        const auto told = nlohmann::json::parse(text);
        EXPECT_GE(told["checks"].size(), 8U) << text;
        std::string lower = text;
        std::transform(lower.begin(), lower.end(), lower.begin(), [](unsigned char c) { return std::tolower(c); });
        for (const std::string& mark :
             {std::string("zz"), std::string("0987654"), word, std::string("localhost"), std::string("127.0.0.1"), port,
              world.home.path(), std::string("http"), std::string("/"), std::string("@")})
            EXPECT_EQ(lower.find(mark), std::string::npos) << scene << ": " << mark << "\n" << text;
    };
    expectNothing("all is well");
    std::ofstream(world.json({"account", "show"})["password"]["value"].get<std::string>()) << "zzwrong\n";
    expectNothing("a wrong password");
    world.store().stop(PrivateStore::Stop::atOnce);
    expectNothing("no store");
    ASSERT_EQ(world.rolvane({"daemon", "stop"}).status, kDone);
    std::ofstream(world.home / "data/rolvane/contacts.db") << "zz no database";
    expectNothing("a damaged database");
    std::ofstream(world.home / "config/rolvane/account.plist") << "zz no account";
    expectNothing("a damaged account");
}

TEST_F(TheDoctor, OnATerminalWithoutColoursAndInTheCLocaleItTellsTheSame) {
    world.home.setVariable("NO_COLOR", "1");
    world.home.setVariable("LANG", "C");
    const Ran piped = world.rolvane({"doctor"});
    TerminalSession session(quotedForShell(UserWorld::rolvaneProgram()) + " doctor", world.home.environment());
    EXPECT_EQ(session.end(), kDone);
    EXPECT_EQ(session.shown().find('\033'), std::string::npos);
    EXPECT_NE(session.shown().find(piped.output.substr(0, piped.output.find('\n'))), std::string::npos)
        << session.shown() << piped;
}

} // namespace
} // namespace rolvane::test
