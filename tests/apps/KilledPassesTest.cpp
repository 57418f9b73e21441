// Passes of a subscriber's daemon that are killed.

#include "TwoPeople.h"
#include "foundation/PropertyList.h"
#include "support/WaitUntil.h"

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <functional>

namespace rolvane::test {
namespace {

constexpr double kPatience = 60; // seconds for one pass, on a loaded machine

class KilledSubscriber : public TwoPeople {
protected:
    KilledSubscriber() : TwoPeople(120) { bobsProgram->done({"subscribe", "alice", "--no-daemon"}); }

    void deleteAndAdd(int round) {
        const size_t gone = random() % people.size();
        alice->removeRecord(personOf(*alice, gone));
        people.erase(people.begin() + static_cast<std::ptrdiff_t>(gone));
        auto person = CXPerson::create();
        const std::string name = "New " + std::to_string(round);
        person->setValue(Value(name), kCXFirstNameProperty);
        alice->addRecord(person);
        people.push_back(person->uniqueId());
        written[person->uniqueId().str()].insert(name);
        groupOf(*alice, random() % kGroups)->addMember(person);
        alice->save();
    }

    std::string cleanPass() {
        const auto daemon = bobsProgram->startManager({"-p"});
        const auto ending = daemon->wait(kPatience);
        EXPECT_TRUE(ending && ending->exitedWith(0)) << daemon->errors();
        return daemon->errors();
    }
};

TEST_F(KilledSubscriber, AtAnyMomentOfAPassLosesNothingAndDoublesNothingAfterCleanPasses) {
    constexpr int kKills = 30, kEditsBetween = 4;
    double whole = 0.4; // seconds that a pass takes, about
    int inTheMiddle = 0;
    for (int kill = 0; kill < kKills; ++kill) {
        for (int i = 0; i < kEditsBetween; ++i) edit(*alice, "alice", kill * kEditsBetween + i);
        if (kill % 3 == 0) deleteAndAdd(kill);
        if (kill % 4 == 1) edit(*bob, "bob", kill);
        const auto daemon = bobsProgram->startManager({"-p"});
        const auto start = std::chrono::steady_clock::now();
        const double moment = std::uniform_real_distribution<double>(0, whole)(random);
        if (daemon->wait(moment)) {
            whole = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
            continue;
        }
        daemon->kill();
        ++inTheMiddle;
    }
    EXPECT_GE(inTheMiddle, kKills / 2) << "the passes were faster than the kills";

    cleanPass();          // gives back the lock that a killed one has left on her tree
    world.done({"sync"}); // all of hers is on the store
    const std::string said = cleanPass();
    expectEqual(storeView(Names::ofContacts), view(*bob), "bob's database\n" + said);
    expectEverySurvivingNameWasWritten(*bob);
    world.done({"sync"});
    expectEqual(storeView(Names::ofContacts), view(*alice), "alice's database");
    for (const auto& [name, text] : view(*bob)) EXPECT_EQ(text.find("twice"), std::string::npos) << name << text;
}

class KilledPublisher : public TwoPeople {
protected:
    explicit KilledPublisher(size_t count = 60) : TwoPeople(count) { world.rolvane({"daemon", "stop"}); }

    CXGroupRef anyGroup() { return groupOf(*alice, random() % kGroups); }
    CXPersonRef anybody() { return personOf(*alice, random() % people.size()); }

    // Several changes in one save, and how to take them back.
    void change(int number) {
        const auto newcomer = CXPerson::create();
        newcomer->setValue(Value("New " + std::to_string(number)), kCXFirstNameProperty);
        alice->addRecord(newcomer);
        const CXGroupRef joined = anyGroup();
        joined->addMember(newcomer);
        const auto made = CXGroup::create();
        made->setValue(Value("Made " + std::to_string(number)), kCXGroupNameProperty);
        alice->addRecord(made);
        made->addMember(anybody());
        const CXGroupRef named = anyGroup(), entered = anyGroup(), left = anyGroup();
        const std::string name = named->name();
        named->setValue(Value(name + "!"), kCXGroupNameProperty);
        const CXPersonRef enters = anybody(), leaves = anybody();
        const auto isIn = [](const CXGroupRef& group, const CXPersonRef& person) {
            const auto members = group->memberUniqueIds();
            return std::find(members.begin(), members.end(), person->uniqueId()) != members.end();
        };
        const bool wasIn = isIn(entered, enters), wasThere = isIn(left, leaves);
        entered->addMember(enters);
        left->removeMember(leaves);
        alice->save();
        undo = [=, this] {
            alice->removeRecord(newcomer);
            alice->removeRecord(made);
            named->setValue(Value(name), kCXGroupNameProperty);
            wasIn ? (void)entered->addMember(enters) : (void)entered->removeMember(enters);
            wasThere ? (void)left->addMember(leaves) : (void)left->removeMember(leaves);
            alice->save();
        };
        keep = [=, this] {
            people.push_back(newcomer->uniqueId());
            alice->removeRecord(made);
            alice->save();
        };
    }
    void cleanPass() {
        const auto daemon = world.startManager({"-p"});
        const auto ending = daemon->wait(kPatience);
        EXPECT_TRUE(ending && ending->exitedWith(0)) << daemon->errors();
    }
    std::set<std::string> filesOnTheStore() {
        std::set<std::string> files;
        for (const std::string& path : world.tree())
            if (path.starts_with("People/")) files.insert(path.substr(path.rfind('/') + 1));
        return files;
    }
    void expectTheStoreHoldsJustThat() {
        expectEqual(storeView(), view(*alice), "alice's database");
        EXPECT_EQ(filesOnTheStore().size(), people.size());
        const Dictionary all = PropertyList::fromXML(contentsOf(world.published("AllCXGroup"))).dictionary();
        EXPECT_EQ(all["memberUIDState"].array().count(), people.size());
        EXPECT_EQ(all["subgroupUIDState"].array().count(), kGroups);
        std::set<std::string> groupsThere;
        for (const std::string& path : world.tree())
            if (const std::string top = path.substr(0, path.find('/')); top.ends_with(":CXGroup"))
                groupsThere.insert(top);
        EXPECT_EQ(groupsThere.size(), kGroups);
    }
    std::function<void()> undo, keep;
};

TEST_F(KilledPublisher, LeavesNothingOnTheStoreOfWhatIsTakenBackBeforeTheNextPass) {
    constexpr int kKills = 30;
    double whole = 0.3; // seconds that a pass takes, about
    int inTheMiddle = 0;
    for (int kill = 0; kill < kKills; ++kill) {
        change(kill);
        const auto daemon = world.startManager({"-p"});
        const auto start = std::chrono::steady_clock::now();
        if (daemon->wait(std::uniform_real_distribution<double>(0, whole)(random))) {
            whole = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
        } else {
            daemon->kill();
            ++inTheMiddle;
        }
        kill % 4 == 0 ? keep() : undo();
    }
    EXPECT_GE(inTheMiddle, kKills / 2) << "the passes were faster than the kills";

    cleanPass();
    expectTheStoreHoldsJustThat();
}

class KilledFirstPublication : public KilledPublisher {
protected:
    KilledFirstPublication() : KilledPublisher(300) {
        world.done({"unpublish", "--yes", "--forget-shares"});
        world.rolvane({"daemon", "stop"});
        for (const char* key : {"CXDShareCount", "CXDLastOstrelUser"}) world.done({"defaults", "delete", key});
        world.done({"publish", "--no-daemon"});
    }
};

TEST_F(KilledFirstPublication, LeavesNothingOnTheStoreOfWhoIsDeletedBeforeTheNextPass) {
    constexpr int kKills = 8, kDeleted = 12;
    double moment = 0.03; // seconds; about when the first one begins to write
    for (int kill = 0; kill < kKills; ++kill) {
        const auto daemon = world.startManager({"-p"});
        if (!daemon->wait(moment += 0.015)) daemon->kill();
        for (int i = 0; i < kDeleted; ++i) {
            const size_t gone = random() % people.size();
            alice->removeRecord(personOf(*alice, gone));
            people.erase(people.begin() + static_cast<std::ptrdiff_t>(gone));
        }
        alice->save();
    }
    cleanPass();
    expectTheStoreHoldsJustThat();
}

// Its lock stands on the tree, and no later pass would give it back.
TEST_F(KilledFirstPublication, CanBeWithdrawnAtOnce) {
    const auto daemon = world.startManager({"-p"});
    const std::filesystem::path notes = world.home / "state/rolvane/locks";
    const auto knowsItsLock = [&] {
        std::error_code none;
        for (const auto& note : std::filesystem::directory_iterator(notes, none))
            if (contentsOf(note.path()).find("opaquelocktoken:") != std::string::npos) return true;
        return false;
    };
    ASSERT_TRUE(waitUntil(knowsItsLock, "a lock of the pass")) << daemon->errors();
    daemon->kill();
    world.done({"unpublish", "--yes", "--forget-shares"});
    EXPECT_TRUE(world.tree().empty());
}

} // namespace
} // namespace rolvane::test
