// How a pass went, as the commands tell it.

#include "FaultyStore.h"
#include "Neighbour.h"

#include <atomic>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>

namespace rolvane::test {
namespace {

bool says(const Ran& ran, const std::string& part) {
    return ran.errors.find(part) != std::string::npos || ran.output.find(part) != std::string::npos;
}

testing::AssertionResult claimsSuccess(const Ran& ran) {
    for (const char* claim : {"Everything is up to date", "Everything is on the store", "The store has it", "are here"})
        if (says(ran, claim)) return testing::AssertionSuccess() << claim << "\n" << ran;
    return testing::AssertionFailure();
}

// Alice publishes, and bob is subscribed to her by way of a server that does what the test says.
class Outcomes : public testing::Test {
protected:
    // The store refuses every PUT with a status while that is asked for.
    Outcomes() {
        world.storeConfiguration = {"LoadModule rewrite_module /usr/lib/apache2/modules/mod_rewrite.so",
                                    "RewriteEngine on"};
        for (const int status : kStatuses) {
            const std::string number = std::to_string(status);
            for (const std::string& line : std::vector<std::string>{
                     "RewriteCond %{REQUEST_METHOD} =PUT", "RewriteCond " + faultPath(status) + " -f",
                     "RewriteRule ^ - [R=" + number + ",L]", "ErrorDocument " + number + " \"the server's own words\""})
                world.storeConfiguration.push_back(line);
        }
        world.bus();
        world.makeAccount();
        world.add("Ada");
    }
    testing::AssertionResult comesTrue(const std::function<bool()>& test) {
        for (int i = 0; i < 1500; ++i) {
            if (test()) return testing::AssertionSuccess();
            world.run({"sleep", "0.02"});
        }
        return testing::AssertionFailure() << "it did not within half a minute";
    }
    static constexpr int kStatuses[] = {403, 409, 413, 503, 507};
    std::string faultPath(int status) { return world.home / ("store/root/dav/fault-" + std::to_string(status)); }
    void refusePuts(int status) {
        mend();
        ASSERT_TRUE(std::ofstream(faultPath(status)));
    }
    void mend() {
        for (const int status : kStatuses) std::filesystem::remove(faultPath(status));
    }
    CommandWorld world;
};

// Which requests are refused, and how often, before all are let through.
struct Busy {
    const char *path, *methods;
    int status;
    const char* headers;
};

TEST_F(Outcomes, ASubscriptionWaitsForAStoreThatIsBusyForAMoment) {
    world.done({"publish"});
    FaultyStore faulty(world.store());
    Neighbour bob(world, "bob");
    world.done({"share", "bob"});
    bob.done(faulty.account());
    const Busy cases[] = {{"/alice/Contacts/info", "GET", 503, ""},          // the first question
                          {"", "", 503, ""},                                 // all of them
                          {"", "", 0, ""},                                   // each connection ends
                          {"/alice/Contacts/", "REPORT PROPFIND", 503, ""}}; // a listing, in the daemon's pass
    for (const Busy& busy : cases) {
        std::atomic<int> refused = 0;
        faulty.set([&](const FakeRequest& request) -> std::optional<FakeAnswer> {
            constexpr int kOften = 3; // requests are repeated by themselves once
            const bool meant = request.target.find(busy.path) != std::string::npos &&
                               (*busy.methods == 0 || std::strstr(busy.methods, request.method.c_str()));
            if (!meant || refused >= kOften) return std::nullopt;
            ++refused;
            return busy.status ? FakeAnswer::status(busy.status, "", busy.headers) : FakeAnswer::raw({});
        });
        const Ran ran = bob.rolvane({"subscribe", "alice"});
        EXPECT_EQ(ran.status, kDone) << busy.path << " " << busy.status << "\n" << ran;
        EXPECT_TRUE(says(ran, "asked again in")) << busy.path << " " << busy.status << "\n" << ran;
        EXPECT_EQ(refused, 3);
        EXPECT_EQ(bob.json({"list"}).size(), 1U);
        bob.done({"unsubscribe", "alice"});
        bob.done({"daemon", "stop"});
        faulty.set({});
    }
}

TEST_F(Outcomes, ASubscriptionDoesNotWaitForAnAnswerThatLasts) {
    world.done({"publish"});
    FaultyStore faulty(world.store());
    Neighbour bob(world, "bob");
    bob.done(faulty.account());
    for (const int status : {500, 507}) {
        faulty.answerAll(status, "no");
        const Ran ran = bob.rolvane({"subscribe", "alice"});
        EXPECT_NE(ran.status, kDone) << ran;
        EXPECT_FALSE(says(ran, "asked again in")) << ran;
        EXPECT_TRUE(says(ran, "Nothing was subscribed to")) << ran;
    }
}

TEST_F(Outcomes, ASyncOfASubscriberSaysWhyTheStoreWasNotReached) {
    world.done({"publish"});
    FaultyStore faulty(world.store());
    Neighbour bob(world, "bob");
    world.done({"share", "bob"});
    bob.done(faulty.account());
    bob.done({"subscribe", "alice"});
    bob.done({"daemon", "stop"});
    const Ran well = bob.rolvane({"sync"});
    EXPECT_EQ(well.status, kDone) << well;
    EXPECT_TRUE(says(well, "Everything is up to date.")) << well;

    const struct {
        int status;
        const char *body, *headers;
        int code;
        const char *what, *toDo;
    } cases[] = {
        {500, "broken", "Content-Type: text/plain\r\n", kNotReached, "500", "tries again"},
        {503, "later", "Retry-After: 1\r\n", kNotReached, "503", "asked again at"},
        {401, "", "WWW-Authenticate: Basic realm=\"x\"\r\n", kNotAllowed, "refused the user name or the password",
         "rolvane account set --ask-password"},
        {403, "", "", kNotAllowed, "403", "administrator"},
        {200, "<html><body>Please sign in</body></html>", "Content-Type: text/html\r\n", kNotReached,
         "is no WebDAV server", "sign in there"},
    };
    for (const auto& each : cases) {
        SCOPED_TRACE(each.status);
        faulty.answerAll(each.status, each.body, each.headers);
        const Ran ran = bob.rolvane({"sync"});
        EXPECT_EQ(ran.status, each.code) << ran;
        EXPECT_FALSE(claimsSuccess(ran));
        EXPECT_TRUE(says(ran, each.what)) << ran;
        EXPECT_TRUE(says(ran, each.toDo)) << ran;
        const auto told = bob.json({"sync", "--json"}, each.code);
        EXPECT_EQ(told["upToDate"], false);
        EXPECT_EQ(told["storeReached"], false);
        EXPECT_EQ(told["trees"][0]["user"], "alice");
        EXPECT_EQ(told["trees"][0]["in"]["reached"], false);
        EXPECT_FALSE(told["messages"].empty());
    }
    faulty.set({});
    EXPECT_TRUE(says(bob.rolvane({"sync"}), "Everything is up to date."));

    // Nobody there.
    world.store().stop(PrivateStore::Stop::atOnce);
    const Ran away = bob.rolvane({"sync"});
    EXPECT_EQ(away.status, kNotReached) << away;
    EXPECT_FALSE(claimsSuccess(away));
    const auto status = bob.json({"status"});
    EXPECT_EQ(status["pass"]["upToDate"], false);
    EXPECT_FALSE(status["pass"]["trees"][0]["in"]["waitingSince"].is_null());
    EXPECT_FALSE(status["pass"]["trees"][0]["in"]["inStep"].is_null());
    world.store().start();
}

TEST_F(Outcomes, AnAuthorityThatDidNotSignTheStoresCertificateIsNotReached) {
    world.done({"publish"});
    Neighbour bob(world, "bob");
    world.done({"share", "bob"});
    bob.done({"subscribe", "alice"});
    bob.done({"daemon", "stop"});
    const std::string other = world.write("other.pem", contentsOf("/etc/ssl/certs/ca-certificates.crt"));
    bob.done({"account", "set", "--ca-file", other});
    const Ran ran = bob.rolvane({"sync"});
    EXPECT_EQ(ran.status, kNotReached) << ran;
    EXPECT_FALSE(claimsSuccess(ran));
    EXPECT_TRUE(says(ran, "no secure connection")) << ran;
    EXPECT_TRUE(says(ran, "--ca-file")) << ran;
}

TEST_F(Outcomes, AFirstPublicationThatTheStoreRefusesIsNotOnTheStore) {
    refusePuts(403);
    const Ran ran = world.rolvane({"publish"});
    EXPECT_EQ(ran.status, kNotAllowed) << ran;
    EXPECT_FALSE(claimsSuccess(ran));
    EXPECT_TRUE(says(ran, "403") || says(ran, "refused")) << ran;
}

TEST_F(Outcomes, WhatWaitsIsToldWithTheMethodTheStatusAndWhatToDo) {
    world.done({"publish"});
    const struct {
        int status, code;
        const char* toDo;
    } cases[] = {{507, kFailure, "Make room"},
                 {413, kFailure, "photo smaller"},
                 {503, kNotReached, "tries again"},
                 {409, kFailure, "makes the tree whole"}};
    int number = 0;
    for (const auto& each : cases) {
        SCOPED_TRACE(each.status);
        refusePuts(each.status);
        world.done({"edit", "Ada", "--note", "number " + std::to_string(++number)});
        const Ran ran = world.rolvane({"sync"});
        EXPECT_EQ(ran.status, each.code) << ran;
        EXPECT_FALSE(claimsSuccess(ran));
        for (const std::string& part : {std::string("PUT"), std::to_string(each.status),
                                        std::string("the server's own words"), std::string(each.toDo)})
            EXPECT_TRUE(says(ran, part)) << part << "\n" << ran;
        const Ran status = world.rolvane({"status"});
        EXPECT_TRUE(says(status, "PUT with " + std::to_string(each.status))) << status;
        EXPECT_TRUE(says(status, each.toDo)) << status;
        EXPECT_TRUE(says(status, "waits since")) << status;
    }
    mend();
    EXPECT_TRUE(says(world.rolvane({"sync"}), "Everything is up to date."));
    EXPECT_EQ(world.json({"status"})["pending"], 0);
}

TEST_F(Outcomes, AnAccountThatIsDamagedIsToldByASync) {
    world.done({"publish"});
    world.done({"daemon", "stop"});
    world.write("config/rolvane/account.plist", "<plist");
    const Ran ran = world.rolvane({"sync"});
    EXPECT_EQ(ran.status, kFailure) << ran;
    EXPECT_FALSE(claimsSuccess(ran));
    EXPECT_TRUE(says(ran, "account.plist")) << ran;
}

TEST_F(Outcomes, OnAFullDiskNothingIsCalledDoneThatIsNot) {
    world.done({"publish"});
    world.done({"daemon", "stop"});
    int wellDone = 0, number = 0;
    for (const int blocks : {0, 32, 64, 80, 96, 128, 160, 256, 1024, 4096}) {
        SCOPED_TRACE(blocks);
        const std::string name = "Edit" + std::to_string(++number);
        world.add(name);
        const Ran ran = world.run(
            {"bash", "-c",
             "trap '' XFSZ; ulimit -f " + std::to_string(blocks) + "; exec " + UserWorld::rolvaneProgram() + " sync"});
        const bool there = world.namedTree().contains("People/" + name);
        if (ran.status == kDone || claimsSuccess(ran)) {
            EXPECT_TRUE(there) << ran;
            EXPECT_EQ(ran.status, kDone) << ran;
            ++wellDone;
        } else {
            EXPECT_NE(ran.errors, "");
        }
    }
    EXPECT_GT(wellDone, 0);
    EXPECT_LT(wellDone, number);
    EXPECT_TRUE(says(world.rolvane({"sync"}), "Everything is up to date."));
    for (int i = 1; i <= number; ++i) EXPECT_TRUE(world.namedTree().contains("People/Edit" + std::to_string(i)));
}

TEST_F(Outcomes, APasswordThatWasChangedIsToldAndAfterTheNewOneTheDaemonGoesOn) {
    world.done({"publish"});
    world.done({"store", "user", "add", "alice", "--directory", world.store().stateDirectory()}, "another word\n");
    world.done({"daemon", "restart"});
    ASSERT_TRUE(comesTrue([&] { return !world.daemon(); }));
    world.add("Bob");
    const Ran status = world.rolvane({"status"});
    EXPECT_TRUE(says(status, "1 record was edited since the daemon looked last")) << status;
    EXPECT_TRUE(says(status, "rolvane account set --ask-password")) << status;
    const Ran sync = world.rolvane({"sync"});
    EXPECT_EQ(sync.status, kNotAllowed) << sync;
    EXPECT_FALSE(claimsSuccess(sync));
    EXPECT_TRUE(says(sync, "rolvane account set --ask-password")) << sync;
    world.done({"account", "set", "--ask-password"}, "another word\n");
    EXPECT_TRUE(comesTrue([&] { return world.namedTree().contains("People/Bob"); }));
    EXPECT_TRUE(comesTrue([&] { return world.json({"status"})["pass"]["upToDate"] == true; }));
}

TEST_F(Outcomes, AWatchEndsWithThePassAndItsExitCode) {
    world.done({"publish"});
    refusePuts(507);
    const auto watching = world.startRolvane({"watch", "--json", "--once", "--seconds", "60"});
    ASSERT_TRUE(watching->waitForLine("watching")) << watching->errors();
    world.done({"edit", "Ada", "--note", "new"});
    const auto ending = watching->wait();
    ASSERT_TRUE(ending);
    EXPECT_NE(watching->output().find("\"event\":\"ended\""), std::string::npos) << watching->output();
    EXPECT_NE(watching->output().find("507"), std::string::npos) << watching->output();
}

} // namespace
} // namespace rolvane::test
