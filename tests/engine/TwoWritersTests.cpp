// Two people who write to one tree at the same time.

#include "TwoUsers.h"
#include "engine/EngineState.h"

namespace rolvane::test {

class TwoWriters : public TwoUsers {
protected:
    static constexpr size_t kPeople = 50, kGroups = 5;

    CXPersonRef personOf(Participant& user, size_t i) { return &user == &bob ? bob.copyOf(crowd[i]) : crowd[i]; }
    CXGroupRef groupOf(Participant& user, size_t i) {
        if (&user == &alice) return circles[i];
        return std::dynamic_pointer_cast<CXGroup>(
            bob.application->recordForUniqueId(cxUIDWithTableName(circles[i]->uniqueId(), kCXSubscribedGroupTable)));
    }
    void edit(Participant& user, int number, std::mt19937& random) {
        const size_t who = random() % kPeople;
        const CXPersonRef person = personOf(user, who);
        ASSERT_TRUE(person);
        if (random() % 5 != 0) {
            const std::string value = user.name + " " + std::to_string(number);
            written[cxNormalizedUID(person->uniqueId()).str()].insert(value);
            person->setValue(Value(value), kCXFirstNameProperty);
        } else {
            const CXGroupRef group = groupOf(user, random() % kGroups);
            ASSERT_TRUE(group);
            if (random() % 2)
                group->addMember(person);
            else
                group->removeMember(person);
        }
        user.application->save();
    }

    std::vector<CXPersonRef> crowd;
    std::vector<CXGroupRef> circles;
    std::map<std::string, std::set<std::string>> written; // by contact: every name that somebody gave it
};

// Both edit one contact, and one of the two writes cannot be made in the pass that reads the other's.
TEST_F(TwoWriters, AnEditThatWaitsAndAnotherOneThatArrivesMeanwhileEndWithOneValueEverywhere) {
    bob.pass();
    bob.copyOf(people[0])->setValue(Value("Bob's"), kCXFirstNameProperty);
    bob.application->save();
    writeElsewhere(people[0], "Alice's");
    std::atomic<bool> fails = true;
    bob.wire->intercept([&](const HttpRequest& request) {
        const bool writes = request.method == "PUT" && request.url.encodedPath().find("/People/") != std::string::npos;
        return fails && writes ? std::optional(answerOf(503)) : std::nullopt;
    });
    for (int pass = 0; pass < 2; ++pass) {
        bob.pass();
        EXPECT_EQ(bob.engine->getPendingChanges().size(), 1u) << log.text();
        EXPECT_EQ(firstName(bob.copyOf(people[0])), Value("Bob's")) << "his edit is not taken from him";
    }
    fails = false;
    for (Participant* each : {&bob, &alice, &bob, &alice}) each->pass();
    EXPECT_EQ(copies(), alice.view()) << log.text();
    EXPECT_EQ(contentOf(fileOf(people[0]))[kCXFirstNameProperty], firstName(people[0]));
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

TEST_F(TwoWriters, AGroupThatItsPublisherDeletedIsNotMadeAgainByTheOthersChange) {
    const CXGroupRef circle = alice.group("Circle", {people[0]});
    const UniqueId uid = circle->uniqueId();
    alice.pass();
    bob.pass();
    const auto copy = std::dynamic_pointer_cast<CXGroup>(
        bob.application->recordForUniqueId(cxUIDWithTableName(uid, kCXSubscribedGroupTable)));
    ASSERT_TRUE(copy);
    alice.application->removeRecord(circle);
    alice.application->save();
    alice.pass();
    copy->addMember(bob.copyOf(people[1]));
    copy->setValue(Value("Bob's circle"), kCXGroupNameProperty);
    bob.application->save();
    for (Participant* each : {&bob, &alice, &bob, &alice}) each->pass();
    EXPECT_FALSE(alice.application->recordForUniqueId(uid)) << log.text();
    EXPECT_EQ(copies(), alice.view());
    EXPECT_FALSE(std::filesystem::exists(world->file(cxNormalizedUID(uid).str())));
    const Array told = bob.preferences.get(kDaemonDomain, kCXDRefusedChanges).array();
    ASSERT_EQ(told.count(), 1u) << log.text();
    const Dictionary refused = told[0].dictionary();
    EXPECT_EQ(refused[kRefusedUser], Value("alice"));
    EXPECT_EQ(refused[kRefusedWhy], Value(kRefusedAsGroupIsGone));
    EXPECT_EQ(refused[kRefusedGroup], Value("Circle"));
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

TEST_F(TwoWriters, AfterFiveHundredEditsEachBothDatabasesAndTheStoreAreEqual) {
    constexpr int kEdits = 500;
    std::mt19937 random(20260611);
    for (size_t i = 0; i < kPeople; ++i) crowd.push_back(alice.add("Person " + std::to_string(i)));
    for (size_t i = 0; i < kGroups; ++i)
        circles.push_back(alice.group("Circle " + std::to_string(i), {crowd[i * 7], crowd[i * 7 + 1]}));
    for (const CXPersonRef& each : crowd)
        written[cxNormalizedUID(each->uniqueId()).str()].insert(firstName(each).string());
    alice.pass();
    bob.pass();
    ASSERT_EQ(copies(), alice.view());

    for (int left[2] = {kEdits, kEdits}; left[0] + left[1] > 0;) {
        const size_t who = left[0] == 0 ? 1 : left[1] == 0 ? 0 : random() % 2;
        Participant& user = who == 0 ? alice : bob;
        edit(user, left[who]--, random);
        if (random() % 20 == 0) (random() % 2 ? alice : bob).pass();
    }
    for (Participant* each : {&alice, &bob, &alice, &bob}) each->pass();

    const auto ours = alice.view(), theirs = copies();
    ASSERT_EQ(ours.size(), theirs.size());
    for (const auto& [name, value] : ours)
        EXPECT_EQ(theirs.contains(name) ? theirs.at(name) : "nothing", value) << name;
    for (const CXPersonRef& each : crowd) {
        const std::string uid = cxNormalizedUID(each->uniqueId()).str();
        EXPECT_EQ(contentOf(fileOf(each))[kCXFirstNameProperty], firstName(each)) << uid;
        EXPECT_TRUE(written[uid].contains(firstName(each).string())) << uid << " " << firstName(each).string();
    }
    for (const CXGroupRef& each : circles) {
        const std::filesystem::path place = world->file(each->uniqueId().str());
        const Dictionary state =
            contentOf(std::filesystem::is_directory(place) ? place / CXDAVManager::kStateName : place);
        std::set<std::string> here, there;
        for (const UniqueId& member : each->memberUniqueIds()) here.insert(cxNormalizedUID(member).str());
        for (const Value& member : state["memberUIDState"].array()) there.insert(member.string());
        EXPECT_EQ(here, there) << each->name();
        EXPECT_EQ(state["memberUIDState"].array().count(), there.size()) << "doubled in " << each->name();
        EXPECT_EQ(each->memberUniqueIds().size(), here.size()) << "doubled in " << each->name();
    }
    for (Participant* each : {&alice, &bob}) {
        EXPECT_TRUE(each->engine->getPendingChanges().empty()) << each->name;
        expectQuietPass(*each);
    }
}

} // namespace rolvane::test
