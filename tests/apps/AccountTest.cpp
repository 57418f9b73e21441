#include "CommandWorld.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane::test {
namespace {

class Account : public testing::Test {
protected:
    Ran set(std::vector<std::string> options, const std::string& input = {}) {
        options.insert(options.begin(), {"account", "set"});
        return world.rolvane(options, input);
    }
    Ran test() { return world.rolvane({"account", "test"}); }
    std::string passwordFile(const std::string& password, mode_t mode = 0600) {
        const std::string path = world.write("secret", password + "\n");
        ::chmod(path.c_str(), mode);
        return path;
    }
    CommandWorld world;
};

TEST_F(Account, WithoutOneEveryCommandThatNeedsItSaysSo) {
    EXPECT_TRUE(saysOnce(world.rolvane({"account", "show"}), kNoSuchThing, "rolvane setup"));
    EXPECT_TRUE(saysOnce(test(), kNoSuchThing, "rolvane setup"));
    EXPECT_TRUE(saysOnce(world.rolvane({"publish"}), kNoSuchThing, "rolvane setup"));
    EXPECT_TRUE(saysOnce(world.rolvane({"unpublish", "--yes"}), kNoSuchThing, "rolvane setup"));
    EXPECT_TRUE(saysOnce(set({"--endpoint", "https://dav.example.org/{user}/Contacts"}), kWrongLine, "--user"));
}

TEST_F(Account, ItIsShownAsItWasSetAndThePasswordIsNeverShown) {
    world.makeAccount();
    const auto shown = world.json({"account", "show"});
    EXPECT_EQ(shown["user"], UserWorld::kUser);
    EXPECT_EQ(shown["endpoint"], world.store().endpointTemplate());
    EXPECT_EQ(shown["caFile"], world.store().caFile());
    EXPECT_EQ(shown["password"]["source"], "file");
    EXPECT_EQ(shown["authentication"], "automatic");
    EXPECT_EQ(shown["plainLoopback"], false);
    EXPECT_EQ(shown.dump().find(UserWorld::kPassword), std::string::npos);
    EXPECT_NE(world.done({"account", "show"}).find(UserWorld::kUser), std::string::npos);
    struct stat status = {};
    ASSERT_EQ(::stat(shown["password"]["value"].get<std::string>().c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777U, 0600U);
}

TEST_F(Account, WhatIsNotGivenStays) {
    world.makeAccount();
    ASSERT_EQ(set({"--host", "dav.example.org"}).status, kDone);
    const auto shown = world.json({"account", "show"});
    EXPECT_EQ(shown["location"], "http://dav.example.org/alice/Contacts");
    EXPECT_EQ(shown["endpoint"], world.store().endpointTemplate());
}

TEST_F(Account, AWorkingOneIsReachable) {
    world.makeAccount();
    const auto result = world.json({"account", "test"});
    EXPECT_EQ(result["reachable"], true);
    EXPECT_EQ(result["published"], false);
    EXPECT_TRUE(result["reason"].is_null());
    for (const char* able : {"usable", "dates", "tags", "locks", "conditions", "accessLists"})
        EXPECT_EQ(result["trial"][able], true) << able;
    EXPECT_TRUE(world.tree().empty()) << "the trial leaves nothing";
}

TEST_F(Account, AWrongPasswordIsNotAllowed) {
    world.makeAccount();
    ASSERT_EQ(set({"--ask-password"}, "wrong\n").status, kDone);
    EXPECT_TRUE(saysOnce(test(), kNotAllowed, "refused the user name or the password"));
    const auto result = world.json({"account", "test"}, kNotAllowed);
    EXPECT_EQ(result["reachable"], false);
    EXPECT_NE(result["reason"], "");
}

TEST_F(Account, NothingIsPublishedWithAWrongPassword) {
    world.makeAccount();
    world.add("Ada");
    ASSERT_EQ(set({"--ask-password"}, "wrong\n").status, kDone);
    EXPECT_TRUE(saysOnce(world.rolvane({"publish"}), kNotAllowed, "Nothing was published"));
    EXPECT_FALSE(world.json({"status"})["published"]["everything"].get<bool>());
    EXPECT_FALSE(world.daemon());
}

TEST_F(Account, NothingIsPublishedOnAStoreThatMakesNoFolders) {
    world.storeConfiguration = {"<Location \"/dav\">\nAuthMerging And\nAuthzSendForbiddenOnFailure On\n"
                                "<Limit MKCOL>\nRequire all denied\n</Limit>\n</Location>"};
    world.makeAccount();
    world.add("Ada");
    const std::string why = "The store makes no folders (MKCOL was answered with 403";
    EXPECT_TRUE(saysOnce(test(), kNotAllowed, why));
    EXPECT_TRUE(saysOnce(world.rolvane({"publish"}), kNotAllowed, why));
    EXPECT_TRUE(saysOnce(world.rolvane({"publish"}), kNotAllowed, "Nothing was published."));
    EXPECT_FALSE(world.json({"status"})["published"]["everything"].get<bool>());
    EXPECT_FALSE(world.daemon());
}

TEST_F(Account, AnUnknownHostIsNotReached) {
    ASSERT_EQ(
        set({"--user", "a", "--endpoint", "https://no-such-host.invalid/{user}/Contacts", "--no-password"}).status,
        kDone);
    EXPECT_TRUE(saysOnce(test(), kNotReached, "no-such-host.invalid"));
}

TEST_F(Account, AStoreThatIsDownIsNotReached) {
    world.makeAccount();
    world.store().stop(PrivateStore::Stop::atOnce);
    EXPECT_TRUE(saysOnce(test(), kNotReached, "localhost"));
}

TEST_F(Account, AStoreWhoseAuthorityIsUnknownIsNotTrusted) {
    world.makeAccount();
    ASSERT_EQ(set({"--ca-file", ""}).status, kDone);
    EXPECT_TRUE(saysOnce(test(), kNotReached, "certificate"));
}

TEST_F(Account, OffTheMachineOnlyHttpsIsAccepted) {
    for (const char* endpoint : {"http://dav.example.org/{user}/Contacts", "http://192.0.2.1/{user}/Contacts",
                                 "ftp://localhost/{user}/Contacts", "dav.example.org/{user}/Contacts"})
        EXPECT_TRUE(saysOnce(set({"--user", "a", "--endpoint", endpoint, "--no-password"}), kWrongLine, endpoint));
    EXPECT_TRUE(saysOnce(set({"--user", "a", "--endpoint", "http://dav.example.org/{user}/Contacts", "--no-password",
                              "--plain-loopback"}),
                         kWrongLine, "not encrypted"));
    EXPECT_TRUE(saysOnce(world.rolvane({"account", "show"}), kNoSuchThing, "no account"));
}

TEST_F(Account, PlainHttpOnThisMachineNeedsAnHttpsEndpointBesideIt) {
    const std::vector<std::string> plain{
        "--user", "a", "--endpoint", "http://localhost:8080/{user}/Contacts", "--plain-loopback", "--no-password"};
    EXPECT_TRUE(saysOnce(set(plain), kWrongLine, "https endpoint"));
    auto both = plain;
    both.insert(both.end(), {"--secure-endpoint", "https://localhost:8443/{user}/Contacts"});
    EXPECT_EQ(set(both).status, kDone);
    EXPECT_EQ(world.json({"account", "show"})["secureEndpoint"], "https://localhost:8443/{user}/Contacts");
}

TEST_F(Account, AnEndpointWithoutAPlaceForTheUserIsRefused) {
    EXPECT_TRUE(saysOnce(set({"--user", "a", "--endpoint", "https://dav.example.org/Contacts", "--no-password"}),
                         kWrongLine, "{user}"));
}

TEST_F(Account, ThePasswordMayComeFromACommand) {
    world.makeAccount();
    ASSERT_EQ(set({"--password-command", "cat '" + passwordFile(UserWorld::kPassword) + "'"}).status, kDone);
    EXPECT_EQ(test().status, kDone);
    ASSERT_EQ(set({"--password-command", "exit 3"}).status, kDone);
    EXPECT_TRUE(saysOnce(test(), kNotAllowed, "exit code 3"));
    EXPECT_TRUE(saysOnce(world.rolvane({"publish"}), kNotAllowed, "exit code 3"));
}

TEST_F(Account, ThePasswordMayComeFromAFileThatIsNobodyElses) {
    world.makeAccount();
    const std::string path = passwordFile(UserWorld::kPassword);
    ASSERT_EQ(set({"--password-file", path}).status, kDone);
    EXPECT_EQ(test().status, kDone);
    ::chmod(path.c_str(), 0644);
    EXPECT_TRUE(saysOnce(test(), kNotAllowed, "chmod 600"));
    EXPECT_TRUE(saysOnce(set({"--password-file", path}), kNotAllowed, "chmod 600"));
    EXPECT_TRUE(saysOnce(set({"--password-file", world.home / "missing"}), kNotAllowed, "missing"));
}

TEST_F(Account, ARelativePathIsKeptAsAnAbsoluteOne) {
    world.makeAccount();
    passwordFile(UserWorld::kPassword);
    const Ran ran = world.run({"/bin/sh", "-c", "cd \"$HOME\" && exec \"$0\" account set --password-file secret",
                               UserWorld::rolvaneProgram()});
    ASSERT_EQ(ran.status, kDone) << ran;
    EXPECT_EQ(world.json({"account", "show"})["password"]["value"], world.home / "secret");
}

TEST_F(Account, OnlyOnePasswordSourceIsTaken) {
    EXPECT_TRUE(saysOnce(set({"--user", "a", "--no-password", "--password-command", "true"}), kWrongLine, "password"));
    EXPECT_TRUE(saysOnce(set({"--user", "a", "--password", "secret"}), kWrongLine, "--password"));
    EXPECT_TRUE(
        saysOnce(set({"--user", "a", "--endpoint", "https://dav.example.org/{user}/Contacts", "--ask-password"}, "\n"),
                 kWrongLine, "empty"));
}

} // namespace
} // namespace rolvane::test
