// Two people who write to one tree at the same time.

#include "conduits/store/TreeCondition.h"

#include "TwoUsers.h"
#include "Writes.h"
#include "engine/memory/EngineState.h"
#include "foundation/CXException.h"
#include "model/PayloadKeys.h"

namespace rolvane::test {

class TwoWriters : public TwoUsers {
protected:
    static constexpr size_t kPeople = 50, kGroups = 5;

    CXPersonRef personOf(Participant& user, size_t i) { return &user == &bob ? bob.copyOf(crowd[i]) : crowd[i]; }
    CXGroupRef groupOf(Participant& user, size_t i) {
        if (&user == &alice) return circles[i];
        return copyOf(circles[i]);
    }
    CXGroupRef copyOf(const CXGroupRef& group) {
        return std::dynamic_pointer_cast<CXGroup>(
            bob.application->recordForUniqueId(cxUIDWithTableName(group->uniqueId(), kCXSubscribedGroupTable)));
    }
    Dictionary stateOf(const UniqueId& group) {
        const std::filesystem::path place = world->file(group.str());
        return contentOf(std::filesystem::is_directory(place) ? place / CXDAVManager::kStateName : place);
    }
    CXGroupRef circleOfBoth() {
        const CXGroupRef circle = alice.group("Circle", {people[0]});
        alice.pass();
        bob.pass();
        return circle;
    }
    void expectGoneAfterPasses(const UniqueId& uid, const std::vector<Participant*>& passes) {
        for (Participant* each : passes) each->pass();
        EXPECT_FALSE(alice.application->recordForUniqueId(uid)) << log.text();
        EXPECT_EQ(copies(), alice.view());
        EXPECT_FALSE(std::filesystem::exists(world->file(cxNormalizedUID(uid).str())));
        for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
    }
    void expectToldThatCircleIsGone(Participant& user, const std::string& whose) {
        const Array told = user.preferences.get(kDaemonDomain, kCXDRefusedChanges).array();
        ASSERT_EQ(told.count(), 1u) << log.text();
        const Dictionary refused = told[0].dictionary();
        EXPECT_EQ(refused[kRefusedUser], Value(whose));
        EXPECT_EQ(refused[kRefusedWhy], Value(kRefusedAsGroupIsGone));
        EXPECT_EQ(refused[kRefusedGroup], Value("Circle"));
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
    setDate(fileOf(people[0]), dateOf(fileOf(people[0])) - 10); // so Bob's is the later one
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
    const CXGroupRef circle = circleOfBoth();
    const UniqueId uid = circle->uniqueId();
    const CXGroupRef copy = copyOf(circle);
    ASSERT_TRUE(copy);
    alice.application->removeRecord(circle);
    alice.application->save();
    alice.pass();
    copy->addMember(bob.copyOf(people[1]));
    copy->setValue(Value("Bob's circle"), kCXGroupNameProperty);
    bob.application->save();
    expectGoneAfterPasses(uid, {&bob, &alice, &bob, &alice});
    expectToldThatCircleIsGone(bob, "alice");
}

// One deletes a group, the other one changes it before having heard of that: it is gone, and nobody gets a part of it
// back.
TEST_F(TwoWriters, AGroupThatAWriterDeletedIsGoneWhateverItsOwnerChangesInIt) {
    const CXGroupRef circle = circleOfBoth();
    const UniqueId uid = circle->uniqueId();
    bob.application->removeRecord(copyOf(circle));
    bob.application->save();
    bob.pass();
    circle->addMember(people[1]);
    circle->setValue(Value("Alice's circle"), kCXGroupNameProperty);
    circle->setDistributionIdentifier(people[1]->multiValueForProperty(kCXPhoneProperty)->identifierAtIndex(0),
                                      kCXPhoneProperty, people[1]);
    alice.application->save();
    expectGoneAfterPasses(uid, {&alice, &bob, &alice, &bob});
    expectToldThatCircleIsGone(alice, kSelf.str());
}

TEST_F(TwoWriters, AGroupThatItsOwnerDeletedIsGoneWhateverAWriterHasChangedInIt) {
    const CXGroupRef circle = circleOfBoth();
    const UniqueId uid = circle->uniqueId();
    copyOf(circle)->addMember(bob.copyOf(people[1]));
    copyOf(circle)->setValue(Value("Bob's circle"), kCXGroupNameProperty);
    bob.application->save();
    bob.pass();
    alice.application->removeRecord(circle);
    alice.application->save();
    expectGoneAfterPasses(uid, {&alice, &bob, &alice, &bob});
}

TEST_F(TwoWriters, AGroupThatAWriterDeletesIsGoneWhateverItsOwnerHasChangedInIt) {
    const CXGroupRef circle = circleOfBoth();
    const UniqueId uid = circle->uniqueId();
    circle->addMember(people[1]);
    alice.application->save();
    alice.pass();
    bob.application->removeRecord(copyOf(circle));
    bob.application->save();
    expectGoneAfterPasses(uid, {&bob, &alice, &bob, &alice});
}

// The owner's change is written without a look at what else is new on the store, as after each save.
TEST_F(TwoWriters, AnOwnersChangeDoesNotMakeAPartOfAGroupThatAWriterDeletedInTheMeantime) {
    const CXGroupRef circle = circleOfBoth();
    const UniqueId uid = circle->uniqueId();
    std::filesystem::remove(world->file(uid.str()));
    auto change =
        std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDAddRecordToGroup, kSelf, people[1]->uniqueId(), uid);
    change->setAppliesToSources(CXDSyncSourceVaultra);
    alice.engine->applyChangeRecords({change}, true);
    EXPECT_FALSE(std::filesystem::exists(world->file(uid.str())));
    EXPECT_TRUE(alice.engine->getPendingChanges().empty());
    expectToldThatCircleIsGone(alice, kSelf.str());
}

TEST_F(TwoWriters, AContactThatIsDeletedHereWhileAnEditOfItArrivesStaysDeletedAndIsDeletedThere) {
    bob.pass();
    const UniqueId uid = people[0]->uniqueId();
    people[0]->setValue(Value("Adah"), kCXFirstNameProperty);
    alice.application->save();
    alice.pass();
    std::atomic<bool> deleted = false;
    bob.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        const bool reads = request.url.encodedPath().find(std::string(cxUUIDPart(uid))) != std::string::npos;
        if (request.method == "GET" && reads && !deleted.exchange(true)) {
            bob.application->removeRecord(bob.copyOf(people[0]));
            bob.application->save();
        }
        return std::nullopt;
    });
    bob.pass();
    ASSERT_TRUE(deleted) << bob.wire->text();
    EXPECT_FALSE(bob.application->recordForUniqueId(cxUIDWithTableName(uid, kCXSubscribedPersonTable))) << log.text();
    for (Participant* each : {&bob, &alice, &bob, &alice}) each->pass();
    EXPECT_FALSE(alice.application->recordForUniqueId(uid)) << log.text();
    EXPECT_FALSE(std::filesystem::exists(fileOf(uid)));
    EXPECT_EQ(copies(), alice.view());
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

// The deletion waits, and the contact that is still there has been changed meanwhile.
TEST_F(TwoWriters, AContactWhoseDeletionWaitsDoesNotComeBackWithSomebodysEdit) {
    bob.pass();
    const UniqueId uid = people[0]->uniqueId(), copy = bob.copyOf(people[0])->uniqueId();
    people[0]->setValue(Value("Adah"), kCXFirstNameProperty);
    alice.application->save();
    alice.pass();
    bob.application->removeRecord(bob.copyOf(people[0]));
    bob.application->save();
    std::atomic<bool> fails = true;
    bob.wire->intercept([&](const HttpRequest& request) {
        return fails && request.method == "DELETE" ? std::optional(answerOf(503)) : std::nullopt;
    });
    bob.pass();
    EXPECT_EQ(bob.engine->getPendingChanges().size(), 1u) << log.text();
    EXPECT_FALSE(bob.application->recordForUniqueId(copy)) << log.text();
    fails = false;
    for (Participant* each : {&bob, &alice, &bob, &alice}) each->pass();
    EXPECT_FALSE(alice.application->recordForUniqueId(uid)) << log.text();
    EXPECT_EQ(copies(), alice.view());
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

// The writer's daemon could not look at the tree, and sends what has been edited without knowing of the deletion.
TEST_F(TwoWriters, AnEditThatGoesOutWithoutALookAtTheTreeDoesNotBringADeletedContactBack) {
    bob.pass();
    alice.pass();
    for (const bool byOwner : {true, false}) {
        SCOPED_TRACE(byOwner ? "deleted by the owner" : "deleted by the writer");
        const CXPersonRef person = people[byOwner ? 0 : 1];
        const UniqueId gone = person->uniqueId();
        Participant &first = byOwner ? alice : bob, &second = byOwner ? bob : alice;
        first.application->removeRecord(byOwner ? person : bob.copyOf(person));
        first.application->save();
        first.pass();
        ASSERT_FALSE(std::filesystem::exists(fileOf(gone)));
        (byOwner ? bob.copyOf(person) : person)->setValue(Value("Late"), kCXNicknameProperty);
        second.application->save();
        std::atomic<bool> fails = true;
        second.wire->intercept([&](const HttpRequest& request) {
            return fails && (request.method == "PROPFIND" || request.method == "REPORT") ? std::optional(answerOf(503))
                                                                                         : std::nullopt;
        });
        second.pass();
        EXPECT_FALSE(std::filesystem::exists(fileOf(gone))) << log.text();
        EXPECT_TRUE(second.engine->getPendingChanges().empty()) << log.text();
        fails = false;
        for (int round = 0; round < 2; ++round)
            for (Participant* each : {&second, &first}) each->pass();
        EXPECT_FALSE(alice.application->recordForUniqueId(gone)) << log.text();
        EXPECT_FALSE(std::filesystem::exists(fileOf(gone))) << log.text();
        EXPECT_EQ(copies(), alice.view());
        for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
    }
}

// A writer who did not know that the contact is deleted has written it once more.
TEST_F(TwoWriters, AContactThatLiesInTheTreeAndIsInNoListIsTakenInByNobodyAndTakenAway) {
    bob.pass();
    const UniqueId uid("5C0FFEE5-0000-4000-8000-000000000001:CXPerson");
    const auto file = fileOf(uid);
    std::filesystem::create_directories(file.parent_path());
    rewrite(file, textOf(fileOf(people[0])));
    setDate(file, dateOf(fileOf(people[0])) + 10);
    bob.pass();
    EXPECT_FALSE(bob.application->recordForUniqueId(cxUIDWithTableName(uid, kCXSubscribedPersonTable))) << log.text();
    for (int look = 0; look < 2; ++look) alice.pass();
    EXPECT_FALSE(alice.application->recordForUniqueId(uid)) << log.text();
    EXPECT_TRUE(std::filesystem::exists(file)) << "whoever has written it may still list it";
    alice.clock.ahead = kPatience + 1;
    alice.pass();
    EXPECT_FALSE(std::filesystem::exists(file));
    EXPECT_EQ(copies(), alice.view());
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

// A pass reads one list after the other, and somebody writes both in between: a group names a new contact, and the list
// of everybody that was read a moment before does not. The contact comes with the group, and goes with it.
TEST_F(TwoWriters, AContactThatCameByAGroupAloneAndIsDeletedGoes) {
    bob.pass();
    const CXGroupRef circle = alice.group("Circle", {people[0]});
    alice.pass();
    const std::filesystem::path place = world->file(std::string(kCXAllGroupUID));
    const std::string before = textOf(std::filesystem::is_directory(place) ? place / CXDAVManager::kStateName : place);
    ASSERT_FALSE(before.empty());
    const CXPersonRef dora = alice.add("Dora");
    circle->addMember(dora);
    alice.application->save();
    alice.pass();
    bob.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        if (request.method != "GET" || request.url.path().find("/AllCXGroup") == std::string::npos) return std::nullopt;
        return answerOf(200, {{"content-type", "text/plain"}, {"etag", "\"of-before\""}}, before);
    });
    bob.pass();
    bob.wire->intercept({});
    ASSERT_TRUE(bob.copyOf(dora)) << log.text();
    alice.application->removeRecord(dora);
    alice.application->save();
    for (Participant* each : {&alice, &bob}) each->pass();
    EXPECT_FALSE(bob.copyOf(dora)) << log.text();
    EXPECT_EQ(copies(), alice.view());
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

// Half of a writer's new contact is on the store when its owner looks, more than once, and the other half comes later.
TEST_F(TwoWriters, AWritersNewContactIsKeptWhicheverHalfOfItIsLate) {
    bob.pass();
    for (const bool listIsLate : {true, false}) {
        const auto person =
            CXPerson::initWithUniqueId(cxUIDWithTableName(CXPerson::create()->uniqueId(), kCXSubscribedPersonTable));
        CXMutableMultiValue location;
        location.addValue(alice.base, kCXSubscribeLabel);
        person->setValue(location, kCXRemoteLocationProperty);
        bob.application->addRecord(person);
        person->setValue(Value("Late"), kCXFirstNameProperty);
        bob.application->save();
        const std::string late = listIsLate ? "/AllCXGroup" : std::string(cxUUIDPart(person->uniqueId()));
        bob.wire->intercept([late](const HttpRequest& request) -> std::optional<HttpResponse> {
            if (request.method != "PUT" || request.url.path().find(late) == std::string::npos) return std::nullopt;
            return answerOf(503);
        });
        bob.pass();
        bob.wire->intercept({});
        const UniqueId shared = cxNormalizedUID(person->uniqueId());
        const auto isListed = [&] {
            return stateOf(UniqueId(kCXAllGroupUID))["memberUIDState"].array().containsString(shared.str());
        };
        ASSERT_EQ(isListed(), !listIsLate) << log.text();
        ASSERT_EQ(std::filesystem::exists(fileOf(shared)), listIsLate) << log.text();
        for (int look = 0; look < 3; ++look) alice.pass();
        for (Participant* each : {&bob, &alice}) each->pass();
        EXPECT_TRUE(isListed() && std::filesystem::exists(fileOf(shared))) << listIsLate << "\n" << log.text();
        EXPECT_TRUE(alice.application->recordForUniqueId(shared)) << listIsLate << "\n" << log.text();
        EXPECT_EQ(copies(), alice.view());
    }
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

// Edits of somebody else's contacts that the store refuses do not stand in the copies alone.
TEST_F(TwoWriters, WhatTheStoreRefusesAWriterIsTakenBackFromTheCopies) {
    const CXGroupRef circle = circleOfBoth();
    bob.copyOf(people[0])->setValue(Value("Bob's"), kCXFirstNameProperty);
    copyOf(circle)->addMember(bob.copyOf(people[1]));
    copyOf(circle)->setValue(Value("Bob's circle"), kCXGroupNameProperty);
    bob.application->removeRecord(bob.copyOf(people[2]));
    bob.application->save();
    bob.wire->intercept([](const HttpRequest& request) {
        const bool isWrite = request.method == "PUT" || request.method == "DELETE";
        return isWrite ? std::optional(answerOf(403)) : std::nullopt;
    });
    for (int pass = 0; pass < 2; ++pass) bob.pass();
    bob.wire->intercept({});
    for (Participant* each : {&bob, &alice, &bob}) each->pass();
    EXPECT_EQ(copies(), alice.view()) << log.text();
    EXPECT_EQ(firstName(people[0]), Value("Ada")) << "nothing of it came to her";
    EXPECT_EQ(circle->name(), "Circle");
    EXPECT_TRUE(alice.application->recordForUniqueId(people[2]->uniqueId()));
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

// The store says 403 to a question in between, and takes every change.
TEST_F(TwoWriters, ARefusedQuestionTakesNoChangeBack) {
    const CXGroupRef circle = circleOfBoth();
    for (const std::string asked : {"People/", "CXGroup"}) {
        bob.copyOf(people[0])->setValue(Value("Bob's " + asked), kCXNicknameProperty);
        copyOf(friends)->setValue(Value("Bob's " + asked), kCXGroupNameProperty);
        if (const auto copy = copyOf(circle)) bob.application->removeRecord(copy);
        bob.application->save();
        writeElsewhere(people[0], "Elsewhere " + asked); // so that the contact is read before it is written
        size_t refused = 0;
        bob.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
            if (request.method != "GET" || request.url.path().find(asked) == std::string::npos) return std::nullopt;
            ++refused;
            return answerOf(403);
        });
        bob.pass();
        bob.wire->intercept({});
        ASSERT_GT(refused, 0u) << log.text();
        for (int round = 0; round < 3; ++round)
            for (Participant* each : {&bob, &alice}) each->pass();
        EXPECT_EQ(people[0]->valueForProperty(kCXNicknameProperty), Value("Bob's " + asked)) << log.text();
        EXPECT_EQ(friends->name(), "Bob's " + asked) << log.text();
        EXPECT_FALSE(alice.application->recordForUniqueId(circle->uniqueId())) << log.text();
        EXPECT_EQ(copies(), alice.view());
    }
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

// A list without the group has taken it out of the copy, and the group's own state has been there all the time.
TEST_F(TwoWriters, AGroupThatTheListOfEverybodyNamesAgainComesBack) {
    const CXGroupRef circle = circleOfBoth();
    const auto list = world->file(std::string(kCXAllGroupUID));
    const std::string complete = textOf(list);
    Dictionary without = contentOf(list).mutableCopy();
    Array groups;
    for (const Value& name : without[kSubgroupUIDState].array())
        if (name.string() != circle->uniqueId().str()) groups.append(name);
    ASSERT_EQ(groups.count() + 1, without[kSubgroupUIDState].array().count());
    without.set(kSubgroupUIDState, groups);
    rewrite(list, PropertyList::toXML(without));
    bob.pass();
    ASSERT_FALSE(copyOf(circle)) << log.text();
    rewrite(list, complete);
    for (int look = 0; look < 3; ++look) bob.pass();
    EXPECT_TRUE(copyOf(circle)) << log.text();
    alice.pass();
    EXPECT_EQ(copies(), alice.view()) << log.text();
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

// Its owner had put it there and deleted it before the list of everybody named it; a reader that may write has listed
// the copy, which had come with a group.
TEST_F(TwoWriters, AContactThatIsNowhereAndThatAWriterHasListedIsNamedNoLonger) {
    bob.pass();
    const UniqueId gone("5C0FFEE5-0000-4000-8000-000000000001:CXPerson");
    auto change = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDAddRecordToGroup, UserName("alice"), gone,
                                                    UniqueId(kCXAllGroupUID));
    change->setAppliesToSources(CXDSyncSourceVaultra);
    bob.engine->applyChangeRecords({change}, true);
    const auto listed = [&] {
        return stateOf(UniqueId(kCXAllGroupUID))["memberUIDState"].array().containsString(gone.str());
    };
    ASSERT_TRUE(listed()) << log.text();
    for (int round = 0; round < 3; ++round)
        alice.pass(); // Bob's daemon, which knows that it was he, would take it back
    EXPECT_TRUE(listed()) << "the contact may be on its way\n" << log.text();
    alice.clock.ahead = kPatience + 1;
    alice.pass();
    EXPECT_FALSE(listed()) << log.text();
    for (Participant* each : {&bob, &alice}) each->pass();
    EXPECT_EQ(copies(), alice.view()) << log.text();
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

// A list is written before the groups that name the same contact, and somebody who may not write reads in between.
TEST_F(TwoWriters, NobodyIsToldOfARefusalWhereNewsTookAMemberAway) {
    bob.pass();
    const UniqueId gone = people[0]->uniqueId();
    const auto list = world->file(std::string(kCXAllGroupUID));
    Dictionary everybody = contentOf(list).mutableCopy();
    Array left = everybody["memberUIDState"].array().mutableCopy();
    left.removeAll(gone);
    everybody.set("memberUIDState", left);
    rewrite(list, PropertyList::toXML(everybody));
    std::filesystem::remove(fileOf(gone));
    bob.pass();
    ASSERT_FALSE(bob.copyOf(people[0])) << log.text();
    int refused = 0;
    bob.wire->intercept([&](const HttpRequest& request) {
        const bool isWrite = request.method == "PUT" && request.url.encodedPath().find("CXGroup") != std::string::npos;
        refused += isWrite;
        return isWrite ? std::optional(answerOf(403)) : std::nullopt;
    });
    bob.pass();
    EXPECT_GT(refused, 0) << "the group that the store still has\n" << bob.wire->text();
    EXPECT_EQ(bob.preferences.get(kDaemonDomain, kCXDRefusedChanges).array().count(), 0u) << log.text();
    copyOf(friends)->addMember(bob.copyOf(people[1]));
    bob.application->save();
    bob.pass();
    EXPECT_EQ(bob.preferences.get(kDaemonDomain, kCXDRefusedChanges).array().count(), 1u) << log.text();
}

TEST_F(TwoWriters, AContactsFileThatTheStoreHasLostIsWrittenAgainByItsOwner) {
    bob.pass();
    const auto file = fileOf(people[1]);
    const std::string before = textOf(file);
    std::filesystem::remove(file);
    alice.pass();
    EXPECT_EQ(contentOf(file), PropertyList::fromXML(before).dictionary()) << log.text();
    EXPECT_TRUE(alice.application->recordForUniqueId(people[1]->uniqueId()));
    bob.pass();
    EXPECT_EQ(copies(), alice.view());
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

// One deletes a contact, and the other one, who has not heard of it, puts it into a group.
TEST_F(TwoWriters, ADeletedContactIsNamedByNoGroupWhoeverHasPutItThere) {
    const CXGroupRef circle = circleOfBoth();
    const UniqueId byOwner = people[0]->uniqueId(), byWriter = people[1]->uniqueId();
    bob.application->removeRecord(bob.copyOf(people[0]));
    friends->removeMember(people[0]);
    alice.application->removeRecord(alice.application->recordForUniqueId(byWriter));
    const CXGroupRef made = alice.group("Made", {people[0]});
    alice.application->save();
    copyOf(circle)->addMember(bob.copyOf(people[1]));
    bob.application->save();
    for (int round = 0; round < 3; ++round)
        for (Participant* each : {&alice, &bob}) each->pass();
    EXPECT_EQ(copies(), alice.view()) << log.text();
    for (const CXGroupRef& group : {circle, made, friends})
        for (const Value& member : stateOf(group->uniqueId())["memberUIDState"].array())
            EXPECT_TRUE(member.string() != byOwner.str() && member.string() != byWriter.str()) << group->name();
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

// The writer's daemon writes what was saved without a look at the list of everybody.
TEST_F(TwoWriters, AContactThatWasDeletedLongAgoIsNamedByNoGroupIntoWhichAWriterPutsIt) {
    const CXGroupRef circle = circleOfBoth();
    const UniqueId gone = people[1]->uniqueId();
    alice.application->removeRecord(people[1]);
    alice.application->save();
    alice.pass();
    copyOf(circle)->addMember(bob.copyOf(people[1]));
    bob.application->save();
    auto change = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDAddRecordToGroup, UserName("alice"), gone,
                                                    circle->uniqueId());
    change->setAppliesToSources(CXDSyncSourceVaultra);
    bob.engine->applyChangeRecords({change}, true);
    ASSERT_TRUE(stateOf(circle->uniqueId())["memberUIDState"].array().containsString(gone.str()));
    for (int round = 0; round < 2; ++round) {
        for (Participant* each : {&alice, &bob}) each->pass();
        alice.clock.ahead = kPatience + 1; // until then somebody may still put the contact there
    }
    EXPECT_FALSE(stateOf(circle->uniqueId())["memberUIDState"].array().containsString(gone.str())) << log.text();
    EXPECT_EQ(copies(), alice.view()) << log.text();
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

// The owner's daemon takes a name without a contact out of a group, and hears in the same pass who has joined it.
TEST_F(TwoWriters, NewsOfAGroupArrivesThoughTheSamePassMendsTheGroupOnTheStore) {
    const CXGroupRef circle = circleOfBoth();
    const UniqueId gone = people[0]->uniqueId();
    bob.application->removeRecord(bob.copyOf(people[0]));
    copyOf(circle)->addMember(bob.copyOf(people[1]));
    copyOf(circle)->setValue(Value("Bob's circle"), kCXGroupNameProperty);
    bob.application->save();
    bob.pass();
    auto change =
        std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDAddRecordToGroup, kSelf, gone, circle->uniqueId());
    change->setAppliesToSources(CXDSyncSourceVaultra);
    alice.engine->applyChangeRecords({change}, true);
    for (Participant* each : {&alice, &bob, &alice, &bob}) each->pass();
    EXPECT_EQ(circle->memberUniqueIds(), std::vector<UniqueId>{people[1]->uniqueId()}) << log.text();
    EXPECT_EQ(circle->name(), "Bob's circle");
    EXPECT_EQ(copies(), alice.view());
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

// A pass that could not be remembered would find its own writes on the store and take them for somebody else's.
TEST_F(TwoWriters, WhatIsChangedAfterAPassOnAFullDiskIsNotTakenBackByWhatThatPassWrote) {
    const CXGroupRef circle = circleOfBoth();
    circle->setValue(Value("First name"), kCXGroupNameProperty);
    alice.application->save();
    alice.wire->clear();
    alice.wire->intercept([](const HttpRequest& request) -> std::optional<HttpResponse> {
        const bool isOfTheTree = request.method == "PROPFIND" || request.method == "REPORT";
        if (isOfTheTree) interceptWrites([] { return false; }); // no room from here on
        return std::nullopt;
    });
    try {
        alice.pass();
    } catch (const CXException&) { // so it may end
    }
    interceptWrites(nullptr);
    alice.wire->intercept({});
    EXPECT_EQ(alice.writes(), 0u) << alice.wire->text();
    alice.start();
    circle->setValue(Value("Second name"), kCXGroupNameProperty);
    alice.application->save();
    for (Participant* each : {&alice, &bob, &alice, &bob}) each->pass();
    EXPECT_EQ(circle->name(), "Second name") << log.text();
    EXPECT_EQ(copies(), alice.view());
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

TEST_F(TwoWriters, WhoJoinsASingleGroupThatIsPublishedArrives) {
    CXMutableMultiValue locations;
    locations.addValue(alice.base, kCXPublishLabel);
    alice.application->allGroup()->setValue(CXMultiValue(), kCXRemoteLocationProperty);
    const CXGroupRef circle = alice.group("Circle", {people[0]});
    circle->setValue(locations, kCXRemoteLocationProperty);
    alice.application->save();
    std::filesystem::remove_all(world->file());
    for (int pass = 0; pass < 3; ++pass) alice.pass(); // the tree is lost, and published again
    bob.pass();
    const CXPersonRef dora = alice.add("Dora");
    circle->addMember(dora);
    alice.application->save();
    alice.pass();
    bob.pass();
    ASSERT_TRUE(bob.copyOf(dora)) << log.text();
    EXPECT_EQ(firstName(bob.copyOf(dora)), Value("Dora"));
}

TEST_F(TwoWriters, AContactsFileIsNotWrittenAgainWhereNotEverybodyIsPublished) {
    CXMutableMultiValue locations;
    locations.addValue(alice.base, kCXPublishLabel);
    friends->setValue(locations, kCXRemoteLocationProperty);
    alice.application->allGroup()->setValue(CXMultiValue(), kCXRemoteLocationProperty);
    alice.application->save();
    const auto file = fileOf(people[1]);
    std::filesystem::remove(file);
    alice.pass();
    EXPECT_FALSE(std::filesystem::exists(file)) << log.text();
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
        const Dictionary state = stateOf(each->uniqueId());
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
