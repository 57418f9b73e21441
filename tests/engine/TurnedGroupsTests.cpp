// Nested groups that are turned round: who is above and who is below changes between two looks of the others.

#include "TwoUsers.h"
#include "model/PayloadKeys.h"

namespace rolvane::test {

class TurnedGroups : public TwoUsers {
protected:
    static CXGroupRef groupAt(Participant& user, const UniqueId& uid) {
        auto group = std::dynamic_pointer_cast<CXGroup>(user.application->recordForUniqueId(uid));
        if (group) return group;
        return std::dynamic_pointer_cast<CXGroup>(
            user.application->recordForUniqueId(cxUIDWithTableName(uid, kCXSubscribedGroupTable)));
    }
    // New groups under identifiers that sort as the letters do.
    void makeGroups(const std::string& letters) {
        ++rounds;
        for (const char letter : letters) {
            const UniqueId uid(letter + std::to_string(rounds) + ":CXGroup");
            const CXGroupRef group = CXGroup::initWithUniqueId(uid);
            group->setValue(Value(std::string(1, letter)), kCXGroupNameProperty);
            alice.application->addRecord(group);
            chain.push_back(uid);
        }
        alice.application->save();
        nest(alice, chain);
    }
    // Each holds the next one, and none anything else of the chain. One save, or one for each step.
    void nest(Participant& user, const std::vector<UniqueId>& order, bool together = true) {
        for (const UniqueId& group : chain)
            for (const CXGroupRef& below : groupAt(user, group)->subgroups()) {
                groupAt(user, group)->removeSubgroup(below);
                if (!together) user.application->save();
            }
        for (size_t i = 0; i + 1 < order.size(); ++i) {
            groupAt(user, order[i])->addSubgroup(groupAt(user, order[i + 1]));
            if (!together) user.application->save();
        }
        user.application->save();
        expectNested(user, order);
    }
    void expectNested(Participant& user, const std::vector<UniqueId>& order) {
        for (size_t i = 0; i < order.size(); ++i) {
            std::vector<UniqueId> below;
            const CXGroupRef group = groupAt(user, order[i]);
            ASSERT_TRUE(group) << user.name << " " << order[i].str() << "\n" << log.text();
            for (const UniqueId& uid : group->subgroupUniqueIds()) below.push_back(cxNormalizedUID(uid));
            std::vector<UniqueId> expected;
            if (i + 1 < order.size()) expected.push_back(order[i + 1]);
            EXPECT_EQ(below, expected) << user.name << ": below " << order[i].str() << "\n" << log.text();
        }
    }
    void rename(Participant& user, const std::string& suffix) {
        for (const UniqueId& uid : chain) {
            const CXGroupRef group = groupAt(user, uid);
            group->setValue(Value(group->name() + suffix), kCXGroupNameProperty);
        }
        user.application->save();
    }
    void expectSettled(const std::vector<UniqueId>& order) {
        expectNested(alice, order);
        expectNested(bob, order);
        EXPECT_EQ(copies(), alice.view()) << log.text();
        for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
        EXPECT_FALSE(log.mentions("contain itself")) << log.text();
        EXPECT_FALSE(log.mentions("another program")) << log.text();
    }
    // The turn of one of them reaches the other, and what the other renames afterwards takes no nesting along.
    void expectTurnedEverywhere(Participant& first, Participant& second, const std::vector<UniqueId>& order) {
        for (int i = 0; i < 2; ++i) {
            first.pass();
            second.pass();
        }
        expectSettled(order);
        rename(second, "'");
        for (int i = 0; i < 2; ++i) {
            second.pass();
            first.pass();
        }
        expectSettled(order);
    }
    void arriveAtBobs() {
        alice.pass();
        bob.pass();
        expectNested(bob, chain);
    }
    static std::vector<UniqueId> reversed(std::vector<UniqueId> order) {
        std::reverse(order.begin(), order.end());
        return order;
    }

    std::vector<UniqueId> chain;
    int rounds = 0;
};

TEST_F(TurnedGroups, ArriveTurnedInWhateverOrderTheirIdentifiersSort) {
    for (const std::string letters : {"ab", "ba"})
        for (const bool byOwner : {true, false}) {
            SCOPED_TRACE(letters + (byOwner ? " by the owner" : " by a writer"));
            chain.clear();
            makeGroups(letters);
            arriveAtBobs();
            Participant& first = byOwner ? alice : bob;
            nest(first, reversed(chain));
            expectTurnedEverywhere(first, byOwner ? bob : alice, reversed(chain));
        }
}

TEST_F(TurnedGroups, ThreeThatAreRotatedArriveInEveryOrder) {
    makeGroups("abc");
    arriveAtBobs();
    std::vector<UniqueId> order = chain;
    std::sort(order.begin(), order.end(), [](const auto& a, const auto& b) { return a.str() < b.str(); });
    bool byOwner = true;
    do {
        byOwner = !byOwner;
        SCOPED_TRACE(order[0].str() + " " + order[1].str() + " " + order[2].str() + (byOwner ? " owner" : " writer"));
        Participant &first = byOwner ? alice : bob, &second = byOwner ? bob : alice;
        nest(first, order);
        expectTurnedEverywhere(first, second, order);
        std::vector<UniqueId> rotated{order[2], order[0], order[1]};
        nest(second, rotated);
        expectTurnedEverywhere(second, first, rotated);
    } while (std::next_permutation(order.begin(), order.end(),
                                   [](const auto& a, const auto& b) { return a.str() < b.str(); }));
}

TEST_F(TurnedGroups, ArriveAtAReaderWhoLooksAfterEachStepAndAtOneWhoLooksAtTheEnd) {
    for (const bool looksBetween : {true, false}) {
        SCOPED_TRACE(looksBetween);
        if (chain.empty()) {
            makeGroups("ab");
            arriveAtBobs();
        }
        std::vector<UniqueId> order = looksBetween ? reversed(chain) : chain;
        const CXGroupRef outer = groupAt(alice, order[1]), inner = groupAt(alice, order[0]);
        outer->removeSubgroup(inner);
        alice.application->save();
        alice.pass();
        if (looksBetween) bob.pass();
        inner->addSubgroup(outer);
        alice.application->save();
        expectTurnedEverywhere(alice, bob, order);
    }
}

// While the store shows a circle, one half of it is left out, and is taken in as soon as the other half has gone.
TEST_F(TurnedGroups, ACircleOnTheStoreIsTakenInAsFarAsItIsNone) {
    makeGroups("ab");
    arriveAtBobs();
    // As another client may write it.
    const Dictionary before =
        *bob.manager.dictionaryAtURL(Url(alice.base).cxURLByAppendingComponent(chain[1].str()), nullptr, false);
    Dictionary circle = before.mutableCopy();
    circle.set(kSubgroupUIDState, Array{chain[0].str()});
    ASSERT_TRUE(bob.manager.write(PropertyList::toXML(circle),
                                  Url(alice.base).cxURLByAppendingComponent(chain[1].str()), false, nullptr));
    bob.pass();
    expectNested(bob, chain);
    rename(bob, "!");
    bob.pass();
    bob.pass();
    const Dictionary other =
        *alice.manager.dictionaryAtURL(Url(alice.base).cxURLByAppendingComponent(chain[0].str()), nullptr, false);
    const Dictionary after =
        *alice.manager.dictionaryAtURL(Url(alice.base).cxURLByAppendingComponent(chain[1].str()), nullptr, false);
    EXPECT_EQ(after[kSubgroupUIDState], circle[kSubgroupUIDState]) << "nothing that was left out is taken from it";
    Dictionary opened = other.mutableCopy();
    opened.set(kSubgroupUIDState, Array());
    ASSERT_TRUE(alice.manager.write(PropertyList::toXML(opened),
                                    Url(alice.base).cxURLByAppendingComponent(chain[0].str()), false, nullptr));
    bob.pass();
    bob.pass();
    expectNested(bob, reversed(chain));
}

// Each nests one into the other, and does not know of the other's doing. The owner's stays.
TEST_F(TurnedGroups, OfTwoThatAreNestedIntoOneAnotherTheOwnersHalfStaysEverywhere) {
    makeGroups("ab");
    nest(alice, {});
    alice.pass();
    bob.pass();
    groupAt(alice, chain[0])->addSubgroup(groupAt(alice, chain[1]));
    alice.application->save();
    groupAt(bob, chain[1])->addSubgroup(groupAt(bob, chain[0]));
    bob.application->save();
    for (int i = 0; i < 4; ++i)
        for (Participant* each : {&bob, &alice}) each->pass();
    expectNested(alice, chain);
    expectNested(bob, chain);
    EXPECT_EQ(copies(), alice.view()) << log.text();
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

// -- others that were done with and had no effect

// The choices for somebody who could not be read: remembered, they would be missing at the next look, as if the reader
// had taken them back.
TEST_F(TurnedGroups, ChoicesForSomebodyWhoHasNotComeYetComeLaterAndAreTakenFromNobody) {
    const auto phone = people[0]->multiValueForProperty(kCXPhoneProperty)->identifierAtIndex(0);
    friends->setDistributionIdentifier(phone, kCXPhoneProperty, people[0]);
    alice.application->save();
    alice.pass();
    bob.wire->intercept([&](const HttpRequest& request) {
        const bool reads =
            request.method == "GET" && request.url.path().find(people[0]->uniqueId().str()) != std::string::npos;
        return reads ? std::optional(answerOf(503)) : std::nullopt;
    });
    bob.pass();
    ASSERT_FALSE(bob.copyOf(people[0])) << log.text();
    bob.wire->intercept({});
    for (int i = 0; i < 2; ++i) {
        bob.pass();
        alice.pass();
    }
    const CXGroupRef copy = groupAt(bob, friends->uniqueId());
    ASSERT_TRUE(bob.copyOf(people[0])) << log.text();
    EXPECT_EQ(copy->distributionIdentifierForProperty(kCXPhoneProperty, bob.copyOf(people[0])), phone) << log.text();
    copy->setValue(Value("Buddies"), kCXGroupNameProperty);
    bob.application->save();
    for (int i = 0; i < 2; ++i) {
        bob.pass();
        alice.pass();
    }
    EXPECT_EQ(friends->name(), "Buddies");
    EXPECT_EQ(friends->distributionIdentifierForProperty(kCXPhoneProperty, people[0]), phone) << log.text();
}

} // namespace rolvane::test
