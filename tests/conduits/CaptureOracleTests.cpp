#include "LiteralCapture.h"

#include <random>
#include <rapidcheck.h>

using namespace rolvane;
using namespace rolvane::test;

namespace {

// A database that random steps edit, and a prior state that random steps bring up to date, or out of it.
class CaptureOracle : public CaptureWorld {
public:
    CaptureOracle() {
        subscribe();
        save();
    }

    void step(std::mt19937& random) {
        const auto pick = [&](size_t n) { return std::uniform_int_distribution<size_t>(0, n - 1)(random); };
        const auto anyPerson = [&]() -> CXPersonRef { return people.empty() ? nullptr : people[pick(people.size())]; };
        const auto anyGroup = [&]() -> CXGroupRef { return groups.empty() ? nullptr : groups[pick(groups.size())]; };
        // Small databases: what goes wrong goes wrong with few records, and the literal version is slow.
        if (people.size() > 7) return erase(true, pick(100));
        if (groups.size() > 4) return erase(false, pick(100));
        switch (pick(14)) {
        case 0: people.push_back(person(name(pick(99)).c_str())); break;
        case 1: people.push_back(subscribedPerson("S", ("S" + std::to_string(pick(5))).c_str())); break;
        case 2: people.push_back(person("Twin", ("S" + std::to_string(pick(5))).c_str())); break;
        case 3: groups.push_back(group(name(pick(99)).c_str())); break;
        case 4: groups.push_back(subscribedGroup("Theirs", ("T" + std::to_string(pick(3))).c_str())); break;
        case 5:
        case 6:
        case 7:
            if (anyPerson() && anyGroup()) anyGroup()->addMember(anyPerson());
            break;
        case 8:
            if (anyPerson() && anyGroup()) anyGroup()->removeMember(anyPerson());
            break;
        case 9: nest(anyGroup(), anyGroup()); break;
        case 10: choose(anyGroup(), anyPerson()); break;
        case 11: share(anyGroup() && pick(2) ? anyGroup() : database.allGroup(), pick(5)); break;
        case 12: remember(pick(3) ? anyGroup() : CXGroupRef(database.allGroup()), pick(4) == 0); break;
        case 13: erase(pick(2) != 0, pick(100)); break;
        }
    }

    // What was decided, with every payload looked into.
    static Texts whole(const CXDChangeRecords& records) {
        Texts all;
        for (const auto& record : records) all.push_back(line(*record) + " " + record->payload().description());
        return all;
    }

    std::vector<CXPersonRef> people;
    std::vector<CXGroupRef> groups;

private:
    static std::string name(size_t n) { return "N" + std::to_string(n); }

    void nest(const CXGroupRef& outer, const CXGroupRef& inner) {
        if (!outer || !inner) return;
        try {
            outer->addSubgroup(inner);
        } catch (const CXException&) {
            // it would contain itself
        }
    }
    void choose(const CXGroupRef& in, const CXPersonRef& who) {
        if (!in || !who) return;
        CXMutableMultiValue mails;
        const std::string chosen = mails.addValue("a@b", "Home");
        who->setValue(mails, kCXEmailProperty);
        in->setDistributionIdentifier(chosen, kCXEmailProperty, who);
    }
    void share(const CXGroupRef& what, size_t how) {
        if (how == 0) what->removeValueForProperty(kCXRemoteLocationProperty);
        if (how == 1) what->setValue(CXMultiValue(), kCXRemoteLocationProperty);
        if (how == 2) what->setValue(oneLocation(kOwnLocation, kCXPublishLabel), kCXRemoteLocationProperty);
        if (how == 3) what->setValue(oneLocation(kBobsLocation, kCXSubscribeLabel), kCXRemoteLocationProperty);
        if (how == 4) what->setValue(principals({"bob", "eve"}), kCXReadSharingACLProperty);
    }
    void remember(const CXGroupRef& group, bool forget) {
        if (!group) return;
        for (const char* user : {"<self>", "bob"}) {
            if (forget)
                engine.priorState("CXDCX").dictionaryFor(user).remove(group->sharingUniqueId().str());
            else
                knows(UserName(user), group);
        }
    }
    void erase(bool aPerson, size_t n) {
        if (aPerson && !people.empty()) database.removeRecord(people[n % people.size()]);
        if (!aPerson && !groups.empty()) database.removeRecord(groups[n % groups.size()]);
        std::erase_if(people, [](const auto& one) { return !one->isAttached(); });
        std::erase_if(groups, [](const auto& one) { return !one->isAttached(); });
    }
};

} // namespace

TEST_F(CaptureOracle, ScansWhatTheRecordByRecordVersionFindsInRandomDatabases) {
    size_t found = 0;
    const bool agreed = rc::check([&](unsigned seed) {
        std::mt19937 random(seed);
        for (int i = 0; i < 10; ++i) step(random);
        save();
        const Date since = clock.now().addingSeconds(-static_cast<double>(random() % 60));
        preferences.set(kDaemonDomain, CXDCXConduit::kLastSyncDateKey, since);
        LiteralCapture literal(engine, database);
        const Texts expected = whole(literal.changeRecords(since));
        conduit->open();
        const Texts scanned = whole(conduit->changeRecords());
        found += expected.size();
        RC_ASSERT(scanned == expected);
    });
    EXPECT_TRUE(agreed);
    EXPECT_GT(found, 500u) << "the databases were nearly empty: nothing was compared";
}

TEST_F(CaptureOracle, CapturesOnePersonOrGroupAsTheRecordByRecordVersionDoes) {
    size_t found = 0;
    const bool agreed = rc::check([&](unsigned seed, bool update) {
        std::mt19937 random(seed);
        for (int i = 0; i < 8; ++i) step(random);
        LiteralCapture literal(engine, database);
        for (const auto& one : people) {
            const Texts expected = whole(literal.changesForPerson(one, update));
            found += expected.size();
            RC_ASSERT(whole(conduit->changesForPerson(one, update)) == expected);
        }
        for (const auto& one : groups)
            RC_ASSERT(whole(conduit->changesForGroup(one)) == whole(literal.changesForGroup(one)));
        save();
    });
    EXPECT_TRUE(agreed);
    EXPECT_GT(found, 100u);
}
