#include "Participant.h"

#include "support/CapturingLog.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <gtest/gtest.h>
#include <mutex>
#include <set>

namespace rolvane::test {
namespace {

using Members = std::vector<CXPersonRef>;

// Alice publishes; Bob subscribes. Both have everything that a daemon has, and a real store between them.
class Subscribing : public testing::Test {
protected:
    static void SetUpTestSuite() { world = new StoreWorld; }
    static void TearDownTestSuite() {
        delete world;
        world = nullptr;
    }
    Subscribing() {
        std::filesystem::remove_all(world->file());
        std::filesystem::remove_all(world->file("", "bob"));
        people = {alice.add("Ada"), alice.add("Ben"), alice.add("Cleo")};
        friends = alice.group("Friends", {people[0], people[2]});
        alice.publish();
        alice.pass();
        bob.subscribe(alice);
    }
    std::map<std::string, std::string> copies() { return bob.view(alice.base); }
    // Passes on both sides until nothing more can travel.
    void settle() {
        for (int i = 0; i < 2; ++i) {
            alice.pass();
            bob.pass();
        }
    }
    // Fails every request of Bob's that the test picks.
    void answerBob(std::function<std::optional<HttpResponse>(const HttpRequest&)> answer) {
        bob.wire->intercept(std::move(answer));
    }
    std::filesystem::path fileOf(const CXPersonRef& person) {
        const std::string bucket = CXACLManager::bucketNameForUID(person->uniqueId());
        return world->file("People/" + bucket + "/" + person->uniqueId().str());
    }
    static std::string encoded(const CXPersonRef& person) {
        return Url::percentEncodeComponent(person->uniqueId().str());
    }

    static StoreWorld* world;
    CapturingLog log;
    Participant alice{*world, "alice"}, bob{*world, "bob"};
    Members people;
    CXGroupRef friends;
};
StoreWorld* Subscribing::world = nullptr;

} // namespace

TEST_F(Subscribing, TheFirstPassBringsEverybodyFieldByFieldWithTheirGroups) {
    bob.pass();
    EXPECT_EQ(copies(), alice.view());
    EXPECT_EQ(copies().size(), 4u) << log.text();
    EXPECT_EQ(bob.countPeople(), 0u) << "they are copies, not Bob's own";
    EXPECT_TRUE(bob.engine->getPendingChanges().empty());
}

// Requests are noted when they are begun; each has its place only once.
TEST_F(Subscribing, TheFirstPassAsksForEverythingOnceAndForContactsBeforeItHasReadTheGroups) {
    std::mutex lock;
    std::vector<std::string> begun;
    answerBob([&](const HttpRequest& request) {
        const std::lock_guard guard(lock);
        const auto depth = std::find_if(request.headers.begin(), request.headers.end(),
                                        [](const auto& header) { return header.first == "Depth"; });
        if (request.url.path().find("/alice/") != std::string::npos)
            begun.push_back(request.method + " " + request.url.path() +
                            (depth == request.headers.end() ? "" : " Depth " + depth->second));
        return std::nullopt;
    });
    bob.pass();
    answerBob(nullptr);
    EXPECT_EQ(copies(), alice.view());
    std::set<std::string> once(begun.begin(), begun.end());
    EXPECT_EQ(once.size(), begun.size()) << bob.wire->text();
    const auto first = [&](std::string_view what) {
        return std::find_if(begun.begin(), begun.end(),
                            [&](const std::string& each) {
                                return each.starts_with("GET ") && each.find(what) != std::string::npos;
                            }) -
               begun.begin();
    };
    EXPECT_EQ(bob.reads("CXPerson"), people.size());
    EXPECT_LT(first("CXPerson"), first("CXGroup")) << bob.wire->text();
    EXPECT_LT(first("/info"), first("CXPerson")) << bob.wire->text();
}

TEST_F(Subscribing, TheFirstPassReadsWhileItsOwnTreeIsMade) {
    std::promise<void> reading;
    const auto mayMake = reading.get_future().share();
    std::atomic<bool> inTime{true}, told{false};
    answerBob([&, mayMake](const HttpRequest& request) -> std::optional<HttpResponse> {
        if (request.method == "MKCOL" && mayMake.wait_for(std::chrono::seconds(10)) != std::future_status::ready)
            inTime = false;
        if (request.method == "GET" && request.url.path().ends_with("CXPerson") && !told.exchange(true))
            reading.set_value();
        return std::nullopt;
    });
    bob.pass();
    answerBob(nullptr);
    EXPECT_TRUE(inTime) << "no contact was read before the tree was made";
    EXPECT_EQ(copies(), alice.view());
    EXPECT_TRUE(std::filesystem::is_directory(world->file("People/31", "bob")));
    EXPECT_TRUE(std::filesystem::is_regular_file(world->file("info", "bob")));
}

TEST_F(Subscribing, NothingComesByAFirstListingThatFailedAndAllByTheNextOne) {
    const std::string bucket = "/People/" + CXACLManager::bucketNameForUID(people[1]->uniqueId()) + "/";
    answerBob([&](const HttpRequest& request) {
        return request.method == "PROPFIND" && request.url.path().ends_with(bucket) ? std::optional(answerOf(500))
                                                                                    : std::nullopt;
    });
    bob.pass();
    EXPECT_TRUE(copies().empty());
    answerBob(nullptr);
    people[0]->setValue(Value("Adelheid"), kCXFirstNameProperty); // read early, and in vain
    alice.application->save();
    alice.pass();
    bob.pass();
    EXPECT_EQ(copies(), alice.view());
}

TEST_F(Subscribing, AStoreThatForbidsTheInformationGivesNoContactsHoweverMuchWasBegun) {
    std::atomic<int> contacts{0};
    answerBob([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        contacts += request.url.path().ends_with("CXPerson");
        if (request.method == "GET" && request.url.path().ends_with("/alice/Contacts/info")) return answerOf(403);
        return std::nullopt;
    });
    EXPECT_THROW(bob.pass(), Ended) << "nothing is left to do";
    EXPECT_TRUE(copies().empty());
    EXPECT_EQ(contacts, 0);
}

TEST_F(Subscribing, ASecondPassWritesNothingAndReadsNoMoreThanTheListing) {
    bob.pass();
    for (Participant* each : {&bob, &alice, &bob}) {
        each->wire->clear();
        each->pass();
        EXPECT_EQ(each->writes(), 0u) << each->name << "\n" << each->wire->text();
        EXPECT_EQ(each->reads("People"), 0u) << each->name << "\n" << each->wire->text();
        EXPECT_EQ(each->reads("CXGroup"), 0u) << each->name << "\n" << each->wire->text();
    }
    EXPECT_EQ(copies(), alice.view());
}

TEST_F(Subscribing, EveryKindOfChangeArrivesWithTheNextPassHoweverSoonItComes) {
    bob.pass();
    people[0]->setValue(Value("Adelheid"), kCXFirstNameProperty);
    alice.application->save();
    alice.pass();
    bob.pass();
    EXPECT_EQ(copies(), alice.view()) << "an edit\n" << log.text();

    people.push_back(alice.add("Dora"));
    friends->addMember(people[1]);
    friends->setValue(Value("Old friends"), kCXGroupNameProperty);
    alice.group("Family", {people[3]});
    alice.application->save();
    alice.pass();
    bob.pass();
    EXPECT_EQ(copies(), alice.view()) << "additions and a rename\n" << log.text();
    EXPECT_EQ(copies().size(), 6u);

    friends->removeMember(people[0]);
    alice.application->save();
    alice.pass();
    bob.pass();
    EXPECT_EQ(copies(), alice.view()) << "a member less\n" << log.text();

    alice.application->removeRecord(people[2]);
    alice.application->removeRecord(friends);
    alice.application->save();
    alice.pass();
    bob.pass();
    EXPECT_EQ(copies(), alice.view()) << "removals\n" << log.text();
    EXPECT_EQ(copies().size(), 4u);
}

TEST_F(Subscribing, AWritingSubscribersEditReachesTheOwner) {
    bob.pass();
    const CXPersonRef copy = bob.copyOf(people[1]);
    ASSERT_TRUE(copy);
    copy->setValue(Value("Benjamin"), kCXFirstNameProperty);
    bob.application->save();
    bob.pass();
    alice.application->allGroup()->setValue(
        [] {
            CXMutableMultiValue writers;
            writers.addValue("bob", "bob");
            return writers;
        }(),
        kCXReadWriteSharingACLProperty);
    alice.application->save();
    alice.start(); // the list of writers is looked at once
    alice.pass();
    EXPECT_EQ(people[1]->valueForProperty(kCXFirstNameProperty), Value("Benjamin")) << log.text();
    settle();
    EXPECT_EQ(copies(), alice.view());
}

TEST_F(Subscribing, AnOwnerWhoGrantedNobodyWritingTakesNoEdits) {
    bob.pass();
    bob.copyOf(people[1])->setValue(Value("Benjamin"), kCXFirstNameProperty);
    bob.application->save();
    bob.pass();
    alice.pass();
    EXPECT_EQ(people[1]->valueForProperty(kCXFirstNameProperty), Value("Ben"));
}

// -- a store that misbehaves

TEST_F(Subscribing, ContactsThatCannotBeReadComeLaterWithTheirGroupsAndNobodyLosesAny) {
    std::atomic<bool> broken = true;
    answerBob([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        if (broken && request.method == "GET" && request.url.encodedPath().ends_with(encoded(people[2])))
            return answerOf(500);
        return std::nullopt;
    });
    bob.pass();
    EXPECT_EQ(copies().size(), 3u);
    bob.pass(); // looks at what Bob's database has and the store does not say
    alice.pass();
    EXPECT_EQ(alice.countPeople(), 3u) << "what never came was taken for removed\n" << log.text();
    EXPECT_TRUE(std::filesystem::exists(fileOf(people[2])));
    broken = false;
    bob.pass();
    EXPECT_EQ(copies(), alice.view()) << log.text();
}

TEST_F(Subscribing, AnEditThatCannotBeReadLeavesTheCopyAsItIsAndComesLater) {
    bob.pass();
    people[0]->setValue(Value("Adelheid"), kCXFirstNameProperty);
    alice.application->save();
    alice.pass();
    std::atomic<bool> broken = true;
    answerBob([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        return broken && request.method == "GET" && request.url.encodedPath().find("People") != std::string::npos
                   ? std::optional(answerOf(503))
                   : std::nullopt;
    });
    bob.pass();
    EXPECT_EQ(bob.copyOf(people[0])->valueForProperty(kCXFirstNameProperty), Value("Ada"));
    broken = false;
    bob.pass();
    EXPECT_EQ(bob.copyOf(people[0])->valueForProperty(kCXFirstNameProperty), Value("Adelheid"));
}

TEST_F(Subscribing, AContactFileThatIsNoPropertyListIsLeftOutWithOneLineAndTheRestGoesOn) {
    std::ofstream(fileOf(people[0])) << "<html>not a contact</html>";
    bob.pass();
    EXPECT_EQ(copies().size(), 3u);
    size_t lines = 0;
    for (const std::string& each : log.lines()) lines += each.find("is no dictionary") != std::string::npos;
    EXPECT_EQ(lines, 1u) << log.text();
    alice.pass();
    EXPECT_EQ(alice.countPeople(), 3u);
}

TEST_F(Subscribing, NoFaultOfTheStoreRemovesAContactAnywhere) {
    bob.pass();
    const auto before = copies();
    const HttpResponse portal = answerOf(200, {{"content-type", "text/html"}}, "<html>Please log in</html>");
    const std::vector<std::pair<const char*, std::function<std::optional<HttpResponse>(const HttpRequest&)>>> faults{
        {"a captive portal", [&](const HttpRequest&) { return std::optional(portal); }},
        {"a portal that forbids", [&](const HttpRequest&) { return std::optional(answerOf(403, {}, "<html/>")); }},
        {"an empty listing",
         [](const HttpRequest& r) {
             return r.method == "PROPFIND"
                        ? std::optional(answerOf(207, {}, "<D:multistatus xmlns:D=\"DAV:\"></D:multistatus>"))
                        : std::nullopt;
         }},
        {"a truncated listing",
         [](const HttpRequest& r) {
             return r.method == "PROPFIND"
                        ? std::optional(answerOf(207, {}, "<D:multistatus xmlns:D=\"DAV:\"><D:response>"))
                        : std::nullopt;
         }},
        {"one bucket that fails",
         [](const HttpRequest& r) {
             return r.method == "PROPFIND" && r.url.encodedPath().find("/7/") != std::string::npos
                        ? std::optional(answerOf(500))
                        : std::nullopt;
         }},
        {"group files that fail",
         [](const HttpRequest& r) {
             return r.method == "GET" && r.url.encodedPath().ends_with("CXGroup") ? std::optional(answerOf(500))
                                                                                  : std::nullopt;
         }},
        {"no answers",
         [](const HttpRequest&) {
             HttpResponse none;
             none.error = TransportError::timedOut;
             return std::optional(none);
         }},
    };
    for (const auto& [fault, answer] : faults) {
        answerBob(answer);
        bob.pass();
        EXPECT_EQ(copies(), before) << fault << "\n" << log.text();
        answerBob({});
        bob.pass();
        alice.pass();
        EXPECT_EQ(copies(), before) << "after " << fault;
        EXPECT_EQ(alice.countPeople(), 3u) << "after " << fault;
    }
    EXPECT_TRUE(bob.alert.told.empty());
}

TEST_F(Subscribing, AContactFileThatVanishedFromTheStoreStaysWithTheSubscriber) {
    bob.pass();
    std::filesystem::remove(fileOf(people[0]));
    bob.pass();
    EXPECT_EQ(copies(), alice.view());
}

// -- the end of a subscription

TEST_F(Subscribing, AWithdrawnTreeRemovesTheCopiesKeepsThemInAFileAndTellsThePersonOnce) {
    bob.add("Own");
    bob.publish(); // a reason to live on
    bob.pass();
    std::filesystem::remove_all(world->file());
    bob.pass();
    EXPECT_EQ(bob.countPeople(alice.base), 0u) << log.text();
    EXPECT_EQ(bob.application->subscriptions().size(), 1u);
    EXPECT_EQ(bob.countPeople(), 1u);
    ASSERT_EQ(bob.alert.told.size(), 1u);
    EXPECT_NE(bob.alert.told[0].header.find("alice"), std::string::npos);
    EXPECT_NE(bob.alert.told[0].message.find("3 contacts"), std::string::npos) << bob.alert.told[0].message;
    const auto kept = bob.withdrawn.list();
    ASSERT_EQ(kept.size(), 1u);
    EXPECT_EQ(kept[0].user, UserName("alice"));
    EXPECT_EQ(kept[0].people, 3u);
    EXPECT_EQ(kept[0].groups, 1u);
    EXPECT_NE(bob.alert.told[0].message.find(kept[0].file), std::string::npos);
    bob.pass();
    EXPECT_EQ(bob.alert.told.size(), 1u);
    EXPECT_EQ(bob.withdrawn.list().size(), 1u);
    EXPECT_FALSE(bob.engine->conduitObjectForKey("CXDVaultra", "priorState").contains("alice"));
}

TEST_F(Subscribing, CopiesThatCannotBeKeptStayUntilTheyCan) {
    bob.publish();
    bob.pass();
    std::filesystem::remove_all(world->file());
    std::ofstream(bob.withdrawn.directory()) << "in the way";
    bob.pass();
    EXPECT_EQ(bob.countPeople(alice.base), 3u);
    EXPECT_TRUE(bob.alert.told.empty());
    std::filesystem::remove(bob.withdrawn.directory());
    bob.pass();
    EXPECT_EQ(bob.countPeople(alice.base), 0u);
    EXPECT_EQ(bob.alert.told.size(), 1u);
}

TEST_F(Subscribing, ASubscriptionThatWasForbiddenFromTheStartEndsWithAWord) {
    bob.publish();
    std::filesystem::remove_all(world->file());
    bob.pass();
    EXPECT_EQ(bob.application->subscriptions().size(), 1u);
    ASSERT_EQ(bob.alert.told.size(), 1u);
    EXPECT_NE(bob.alert.told[0].message.find("nothing to remove"), std::string::npos) << bob.alert.told[0].message;
}

TEST_F(Subscribing, AReplacedStoreEndsTheSharingAndKeepsTheCopies) {
    bob.publish();
    bob.pass();
    bob.pass(); // the serial number is known from the second pass on
    std::ofstream(world->file("info")) << PropertyList::toXML(Dictionary{{"SerialNumber", "another"}});
    bob.pass();
    EXPECT_EQ(bob.countPeople(alice.base), 0u) << log.text();
    EXPECT_EQ(bob.alert.told.size(), 1u);
    EXPECT_EQ(bob.withdrawn.list().size(), 1u);
}

} // namespace rolvane::test
