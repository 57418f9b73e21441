#include "CommandWorld.h"
#include "Neighbour.h"
#include "TerminalSession.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "store/account/CertificateChain.h"
#include "store/account/Invitation.h"
#include "support/PseudoTerminal.h"
#include "support/WaitUntil.h"

#include <filesystem>
#include <future>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane::test {
namespace {

class SettingUp : public testing::Test {
protected:
    Ran setup(std::vector<std::string> options, const std::string& input = {}) {
        options.insert(options.begin(), "setup");
        return world.rolvane(options, input);
    }
    std::vector<std::string> forTheStore(const std::vector<std::string>& more) {
        std::vector<std::string> all{"--endpoint", world.store().endpointTemplate(), "--user", UserWorld::kUser};
        all.insert(all.end(), more.begin(), more.end());
        return all;
    }
    std::string fingerprint() { return certificatesIn(readFile(world.store().caFile())).front().fingerprint; }
    // What somebody else's rolvane would say with this home.
    TerminalSession terminal(const std::string& arguments) {
        return TerminalSession(quotedForShell(UserWorld::rolvaneProgram()) + " " + arguments, world.home.environment());
    }
    bool hasAccount() { return world.rolvane({"account", "show"}).status == kDone; }
    CommandWorld world;
    const std::string line = std::string(UserWorld::kPassword) + "\n";
};

TEST_F(SettingUp, WithOptionsAlonePutsEverythingInItsPlace) {
    const std::string card = world.write("friends.vcf", "BEGIN:VCARD\r\nVERSION:4.0\r\nFN:Ada\r\nEND:VCARD\r\n");
    const Ran ran = setup(
        forTheStore({"--ca-file", world.store().caFile(), "--ask-password", "--import", card, "--no-input"}), line);
    ASSERT_EQ(ran.status, kDone) << ran;
    EXPECT_NE(ran.errors.find("is set up, and the store can be used"), std::string::npos) << ran;
    EXPECT_NE(ran.errors.find("Nothing of this account is published yet."), std::string::npos) << ran;
    EXPECT_EQ(world.rolvane({"account", "test"}).status, kDone);
    EXPECT_EQ(world.json({"status"})["people"], 1);
    struct stat info {};
    ASSERT_EQ(::stat(world.json({"account", "show"})["password"]["value"].get<std::string>().c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 0777U, 0600U);
    EXPECT_FALSE(std::filesystem::exists(world.home / "config/rolvane/password.next"));
}

TEST_F(SettingUp, IsNamedToWhoeverHasNoAccount) {
    EXPECT_NE(world.done({"status"}).find("no account yet (`rolvane setup`)"), std::string::npos);
    EXPECT_TRUE(saysOnce(world.rolvane({"publish"}), kNoSuchThing,
                         "There is no account on a store yet. `rolvane setup` makes one."));
}

TEST_F(SettingUp, TakesAnAuthorityByItsFingerprint) {
    ASSERT_EQ(setup(forTheStore({"--fingerprint", fingerprint(), "--ask-password"}), line).status, kDone);
    const std::string file = world.json({"account", "show"})["caFile"];
    EXPECT_NE(file, world.store().caFile());
    EXPECT_EQ(readFile(file), readFile(world.store().caFile()));
}

TEST_F(SettingUp, WithAnotherAuthorityAsksNobodyForAPasswordAndSavesNothing) {
    std::string other = fingerprint();
    other[0] = other[0] == 'A' ? 'B' : 'A';
    const Ran ran = setup(forTheStore({"--fingerprint", other, "--ask-password"}), line);
    EXPECT_TRUE(saysOnce(ran, kNotAllowed, "No password was sent, and nothing was saved"));
    EXPECT_FALSE(hasAccount());
    EXPECT_EQ(readFile(world.store().stateDirectory() + "/logs/access.log"), "") << "no request was made at all";
}

TEST_F(SettingUp, SavesNothingThatDoesNotWork) {
    EXPECT_TRUE(saysOnce(setup(forTheStore({"--ca-file", world.store().caFile(), "--ask-password"}), "wrong\n"),
                         kNotAllowed, "refused the user name or the password"));
    EXPECT_TRUE(saysOnce(setup(forTheStore({"--ask-password"}), line), kNotReached, "--fingerprint"));
    EXPECT_TRUE(saysOnce(setup({"--endpoint", "https://no-such-host.invalid/{user}/C", "--user", "a", "--no-password"}),
                         kNotReached, "no-such-host.invalid"));
    EXPECT_TRUE(saysOnce(setup({"--no-input"}), kWrongLine, "--here"));
    EXPECT_TRUE(saysOnce(setup(forTheStore({"--ca-file", world.store().caFile(), "--no-input"})), kWrongLine,
                         "--password-command"));
    EXPECT_FALSE(hasAccount());
    EXPECT_FALSE(std::filesystem::exists(world.home / "config/rolvane/password.next"));
}

TEST_F(SettingUp, LeavesAnotherAccountAloneUnlessItIsTold) {
    world.makeAccount();
    const std::vector<std::string> other{"--endpoint", world.store().endpointTemplate(), "--user",        "carol",
                                         "--ca-file",  world.store().caFile(),           "--ask-password"};
    world.store().addUser("carol", UserWorld::kPassword);
    EXPECT_TRUE(saysOnce(setup(other, line), kNotAllowed, "--replace"));
    EXPECT_EQ(world.json({"account", "show"})["user"], UserWorld::kUser);
    auto replacing = other;
    replacing.emplace_back("--replace");
    EXPECT_EQ(setup(replacing, line).status, kDone);
    EXPECT_EQ(world.json({"account", "show"})["user"], "carol");
}

TEST_F(SettingUp, SaysWhetherThisComputerOrAnotherHasPublished) {
    world.makeAccount();
    world.add("Ada");
    ASSERT_EQ(world.rolvane({"publish"}).status, kDone);
    const auto again = world.json({"setup", "--endpoint", world.store().endpointTemplate(), "--user", UserWorld::kUser,
                                   "--ca-file", world.store().caFile(), "--ask-password"},
                                  kDone, line);
    EXPECT_EQ(again["published"]["by"], "thisComputer");
    // Another database of the same person.
    const auto elsewhere = [&](const std::string& command) {
        return world.run({"/bin/sh", "-c",
                          "export HOME=\"$HOME/second\"; unset XDG_DATA_HOME XDG_STATE_HOME XDG_CONFIG_HOME "
                          "XDG_CACHE_HOME XDG_RUNTIME_DIR; mkdir -p \"$HOME\"; exec " +
                              command},
                         line);
    };
    const Ran ran = elsewhere(quotedForShell(UserWorld::rolvaneProgram()) + " setup --endpoint " +
                              quotedForShell(world.store().endpointTemplate()) + " --user alice --ca-file " +
                              quotedForShell(world.store().caFile()) + " --ask-password");
    ASSERT_EQ(ran.status, kDone) << ran;
    EXPECT_NE(ran.errors.find("published already, from another computer"), std::string::npos) << ran;
}

TEST_F(SettingUp, OnATerminalAsksForWhatIsNotGiven) {
    TerminalSession session = terminal("setup");
    EXPECT_TRUE(session.answer("Number [1]: ", "2"));
    EXPECT_TRUE(session.answer("/Contacts: ", world.store().endpointTemplate()));
    EXPECT_TRUE(session.answer("Your user name there", UserWorld::kUser));
    EXPECT_TRUE(session.answer("Are they the same? [y/N] ", "perhaps"));
    EXPECT_TRUE(session.answer("Are they the same? [y/N] ", "y"));
    EXPECT_TRUE(session.answer("Number [2]: ", "9"));
    EXPECT_TRUE(session.answer("Number [2]: ", ""));
    EXPECT_TRUE(session.answer("Password of alice: ", "wrong"));
    EXPECT_TRUE(session.answer("Password of alice: ", UserWorld::kPassword));
    EXPECT_TRUE(session.answer("or nothing to go on without: ", ""));
    EXPECT_EQ(session.end(), kDone) << session.shown();
    EXPECT_NE(session.shown().find(fingerprint()), std::string::npos) << session.shown();
    EXPECT_EQ(session.shown().find(UserWorld::kPassword), std::string::npos) << "it is not shown";
    EXPECT_EQ(session.shown().find('\033'), std::string::npos) << "no colours";
    EXPECT_EQ(world.rolvane({"account", "test"}).status, kDone);
}

TEST_F(SettingUp, OnATerminalAnAuthorityThatIsAnotherIsNotTrusted) {
    TerminalSession session =
        terminal("setup --user alice --endpoint " + quotedForShell(world.store().endpointTemplate()));
    EXPECT_TRUE(session.answer("Are they the same? [y/N] ", ""));
    EXPECT_EQ(session.end(), kNotReached) << session.shown();
    EXPECT_FALSE(hasAccount());
}

// A keyring as a desktop has it, on the test's own bus.
TEST_F(SettingUp, ThePasswordMayStayInTheKeyring) {
    world.bus();
    ChildProcess keyring({.arguments = {"gnome-keyring-daemon", "--foreground", "--unlock", "--components=secrets"},
                          .environment = world.home.environment(),
                          .input = "word of the keyring\n"});
    const auto isThere = [&] {
        return world
                   .run({"dbus-send", "--session", "--print-reply", "--dest=org.freedesktop.DBus", "/",
                         "org.freedesktop.DBus.GetNameOwner", "string:org.freedesktop.secrets"})
                   .status == 0;
    };
    ASSERT_TRUE(waitUntil(isThere, "the keyring on the bus", 60)) << keyring.errors();
    const Ran ran = setup(forTheStore({"--ca-file", world.store().caFile(), "--keyring"}), line);
    ASSERT_EQ(ran.status, kDone) << ran << keyring.errors();
    EXPECT_EQ(world.json({"account", "show"})["password"]["source"], "keyring");
    EXPECT_EQ(world.rolvane({"account", "test"}).status, kDone);
    EXPECT_FALSE(std::filesystem::exists(world.home / "config/rolvane/password"));
    // The daemon takes it from there, too.
    world.add("Ada");
    EXPECT_EQ(world.rolvane({"publish"}).status, kDone);
    keyring.kill();
    EXPECT_TRUE(saysOnce(world.rolvane({"account", "test"}), kNotAllowed, "--ask-password"));
}

TEST_F(SettingUp, WithoutABusThereIsNoKeyring) {
    EXPECT_TRUE(saysOnce(setup(forTheStore({"--ca-file", world.store().caFile(), "--keyring"}), line), kFailure,
                         "There is no session bus"));
    EXPECT_FALSE(hasAccount());
}

TEST_F(SettingUp, AStoreOnThisMachineIsMadeWithItsUser) {
    const Ran ran = setup({"--here", "--user", "dora", "--no-input"});
    ASSERT_EQ(ran.status, kDone) << ran;
    EXPECT_EQ(world.rolvane({"account", "test"}).status, kDone);
    EXPECT_EQ(world.json({"store", "user", "list"}), nlohmann::json::array({"dora"}));
    EXPECT_EQ(setup({"--here", "--user", "dora", "--no-input"}).status, kDone) << "again changes nothing";
    EXPECT_EQ(world.rolvane({"store", "stop", "--now"}).status, kDone);
}

// Invitations --------------------------------------------------------------------------------------------------------

class Inviting : public SettingUp {
protected:
    std::string directory() { return world.store().stateDirectory(); }
    std::string invited(const std::string& user, const std::vector<std::string>& more = {}) {
        std::vector<std::string> command{"store", "user", "add", user, "--invite", "--directory", directory()};
        command.insert(command.end(), more.begin(), more.end());
        const std::string text = world.done(command);
        return text.substr(0, text.find('\n'));
    }
    // Somebody else's computer.
    Ran elsewhere(const std::string& home, const std::string& arguments) {
        return world.run({"/bin/sh", "-c",
                          "export HOME=\"$HOME/" + home +
                              "\"; unset XDG_DATA_HOME XDG_STATE_HOME XDG_CONFIG_HOME XDG_CACHE_HOME XDG_RUNTIME_DIR; "
                              "mkdir -p \"$HOME\"; exec " +
                              quotedForShell(UserWorld::rolvaneProgram()) + " " + arguments});
    }
};

TEST_F(Inviting, OneLineSetsEverythingUpAndWorksOnce) {
    const std::string invitation = invited("bob");
    const Invitation read = Invitation::fromLine(invitation);
    EXPECT_EQ(read.user, "bob");
    EXPECT_EQ(read.fingerprint, fingerprint());
    const Ran first = elsewhere("bob", "setup " + quotedForShell(invitation) + " --no-input");
    ASSERT_EQ(first.status, kDone) << first;
    const std::string kept = readFile(world.home / "bob/.config/rolvane/password");
    EXPECT_EQ(kept.find(read.password), std::string::npos) << "the password was changed";
    EXPECT_EQ(elsewhere("bob", "account test").status, kDone);
    EXPECT_EQ(elsewhere("bob", "setup " + quotedForShell(invitation) + " --no-input").status, kDone)
        << "the same line on the same computer finds everything in its place";
    EXPECT_TRUE(saysOnce(elsewhere("thief", "setup " + quotedForShell(invitation) + " --no-input"), kNotAllowed,
                         "the line works once"));
    EXPECT_EQ(elsewhere("bob", "account test").status, kDone);
    // A second line ends the password of the first computer, and only when it is wanted.
    EXPECT_TRUE(saysOnce(world.rolvane({"store", "user", "add", "bob", "--invite", "--directory", directory()}),
                         kNotAllowed, "--renew"));
    const std::string second = invited("bob", {"--renew"});
    EXPECT_EQ(elsewhere("bob", "account test").status, kNotAllowed);
    EXPECT_EQ(elsewhere("bob", "setup " + quotedForShell(second) + " --no-input").status, kDone);
    EXPECT_EQ(elsewhere("bob", "account test").status, kDone);
}

// Somebody else has read the line and uses it at the same moment: one of both has the account, and the other is told.
TEST_F(Inviting, OfTwoWhoUseALineAtOnceOneHasTheAccount) {
    const std::string command = "setup " + quotedForShell(invited("bob")) + " --no-input";
    auto thief = std::async(std::launch::async, [&] { return elsewhere("thief", command); });
    const Ran bob = elsewhere("bob", command), other = thief.get();
    ASSERT_NE(bob.status == kDone, other.status == kDone) << bob << other;
    const char* const loser = bob.status == kDone ? "thief" : "bob";
    const char* const winner = bob.status == kDone ? "bob" : "thief";
    EXPECT_EQ(elsewhere(winner, "account test").status, kDone);
    EXPECT_NE(elsewhere(loser, "account test").status, kDone);
    EXPECT_TRUE(saysOnce(elsewhere(loser, command), kNotAllowed, "the line works once"));
    EXPECT_EQ(elsewhere(winner, "account test").status, kDone);
}

TEST_F(Inviting, ALineThatNamesAnotherAuthoritySendsNoPassword) {
    Invitation altered = Invitation::fromLine(invited("bob"));
    altered.fingerprint[0] = altered.fingerprint[0] == 'A' ? 'B' : 'A';
    EXPECT_TRUE(saysOnce(elsewhere("bob", "setup " + quotedForShell(altered.line()) + " --no-input"), kNotAllowed,
                         "No password was sent"));
    EXPECT_EQ(readFile(world.store().stateDirectory() + "/logs/access.log").find("bob"), std::string::npos);
}

// Killed between the change of the password and its keeping.
TEST_F(Inviting, ARunThatWasKilledIsGoneOnWith) {
    const std::string invitation = invited("bob");
    ASSERT_EQ(elsewhere("bob", "setup " + quotedForShell(invitation) + " --no-input").status, kDone);
    const std::string config = world.home / "bob/.config/rolvane";
    const std::string password = readFile(config + "/password");
    const Invitation read = Invitation::fromLine(invitation);
    writeFileDurably(config + "/password.next", password + "bob " + read.endpoint + "\n", 0600);
    std::filesystem::remove(config + "/password");
    std::filesystem::remove(config + "/account.plist");
    const Ran again = elsewhere("bob", "setup " + quotedForShell(invitation) + " --no-input");
    EXPECT_EQ(again.status, kDone) << again;
    EXPECT_EQ(readFile(config + "/password"), password);
    EXPECT_FALSE(std::filesystem::exists(config + "/password.next"));
}

TEST_F(Inviting, TheInviterIsSubscribedToWhereThatIsWanted) {
    world.makeAccount();
    world.add("Ada");
    ASSERT_EQ(world.rolvane({"publish"}).status, kDone);
    const std::string invitation = invited("bob");
    ASSERT_EQ(world.rolvane({"share", "bob"}).status, kDone);
    const Ran ran = elsewhere("bob", "setup " + quotedForShell(invitation) + " --no-input --subscribe");
    EXPECT_EQ(ran.status, kDone) << ran;
    EXPECT_NE(elsewhere("bob", "list --of alice").output.find("Ada"), std::string::npos);
    EXPECT_EQ(elsewhere("bob", "daemon stop").status, kDone);
}

TEST_F(Inviting, ForAStoreOfSomebodyElsesTheLineHasTheAddressAndTheAuthority) {
    world.makeAccount();
    world.store().addUser("bob", "bobs own word");
    const std::string bare = world.done({"invite", "bob"});
    const Invitation read = Invitation::fromLine(bare);
    EXPECT_EQ(read.password, "");
    EXPECT_EQ(read.inviter, UserWorld::kUser);
    EXPECT_EQ(read.fingerprint, fingerprint());
    EXPECT_TRUE(saysOnce(elsewhere("bob", "setup " + quotedForShell(read.line()) + " --no-input"), kWrongLine,
                         "--ask-password"));
    const auto whole = world.json({"invite", "bob", "--ask-password"}, kDone, "bobs own word\n");
    EXPECT_EQ(elsewhere("bob", "setup " + quotedForShell(whole["invitation"]) + " --no-input").status, kDone);
    EXPECT_EQ(readFile(world.home / "bob/.config/rolvane/password"), "bobs own word\n") << "there it stays as it is";
}

TEST_F(Inviting, ALineIsTheSameAsAQRCode) {
    const Ran ran = world.rolvane({"store", "user", "add", "bob", "--invite", "--qr", "--directory", directory()});
    ASSERT_EQ(ran.status, kDone) << ran;
    EXPECT_GT(lineCount(ran.output), 20U) << ran;
}

TEST_F(Inviting, AQRCodeHasNoColoursWhereNoneAreWantedAndSaysHowWideItIs) {
    std::vector<std::string> environment = world.home.environment();
    environment.emplace_back("NO_COLOR=1");
    const auto shown = [&](const std::string& user, unsigned short columns) {
        PseudoTerminal terminal(
            {UserWorld::rolvaneProgram(), "store", "user", "add", user, "--invite", "--qr", "--directory", directory()},
            environment, {.columns = columns, .rows = 24});
        return terminal.readToEnd();
    };
    const std::string wide = shown("bob", 120), narrow = shown("carol", 40);
    EXPECT_EQ(wide.find('\x1B'), std::string::npos) << wide;
    EXPECT_EQ(wide.find("columns wide"), std::string::npos) << wide;
    EXPECT_NE(narrow.find("The QR code is "), std::string::npos) << narrow;
    EXPECT_NE(narrow.find("columns wide, and this terminal has 40"), std::string::npos) << narrow;
}

TEST(InvitationLine, IsReadWhateverMailProgramsMakeOfIt) {
    const Invitation made{
        "https://dav.example.org/dav/{user}/Contacts", "bob", "", "ab cd", "/principals/users/bob", "alice"};
    const std::string line = made.line();
    EXPECT_EQ(Invitation::fromLine(line), made);
    EXPECT_EQ(Invitation::fromLine(" '" + line.substr(0, 40) + "\r\n  " + line.substr(40) + "'\n"), made);
    EXPECT_EQ(Invitation::fromLine("<" + line + ">"), made);
}

TEST(InvitationLine, IsRefusedWhenAnythingIsMissingOrAltered) {
    const Invitation made{"https://dav.example.org/dav/{user}/Contacts", "bob", "", "word", "", ""};
    const std::string line = made.line();
    for (size_t size = 0; size < line.size(); ++size)
        EXPECT_THROW(Invitation::fromLine(line.substr(0, size)), CXException) << size;
    for (size_t i = 0; i < line.size(); ++i) {
        std::string altered = line;
        altered[i] = altered[i] == 'x' ? 'y' : 'x';
        EXPECT_THROW(Invitation::fromLine(altered), CXException) << i;
    }
    EXPECT_THROW(Invitation::fromLine("rolvane:2:" + line.substr(10)), CXException);
    EXPECT_THROW(Invitation::fromLine("https://example.org"), CXException);
    for (const char* endpoint : {"http://dav.example.org/{user}/Contacts", "https://dav.example.org/", "file:///etc"})
        EXPECT_THROW(Invitation::fromLine(Invitation{endpoint, "bob", "", "w", "", ""}.line()), CXException)
            << endpoint;
    EXPECT_THROW((Invitation{"https://a/{user}/C", "bob", "", "a\nb", "", ""}.line()), CXException);
}

TEST(InvitationLine, ItsPasswordsAreNotAlike) {
    std::set<std::string> made;
    for (int i = 0; i < 100; ++i) made.insert(makePassword());
    EXPECT_EQ(made.size(), 100U);
    EXPECT_LE(made.begin()->size(), 72U);
}

} // namespace
} // namespace rolvane::test
