// Bits of the contact database that turn: whatever they are, nobody's contact is told to be deleted.

#include "CaptureWorld.h"
#include "contacts/database/DamagedDatabase.h"
#include "foundation/Log.h"
#include "foundation/Sqlite.h"
#include "support/CapturingLog.h"

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <random>

using namespace rolvane;
using namespace rolvane::test;

namespace {

class DamagedDatabase : public CaptureWorld {
public:
    DamagedDatabase() {
        publishAll();
        subscribe();
        std::vector<CXPersonRef> people;
        for (int i = 0; i < 150; ++i) people.push_back(person(("Person " + std::to_string(i)).c_str()));
        for (int i = 0; i < 12; ++i) {
            const auto made = group(("Group " + std::to_string(i)).c_str());
            for (int k = 0; k < 25; ++k) made->addMember(people[static_cast<size_t>(i * 11 + k * 7) % people.size()]);
            groups.push_back(made);
        }
        groups[0]->addSubgroup(groups[1]);
        groups[1]->addSubgroup(groups[2]);
        const auto theirs = subscribedGroup("Bob's", "BOB");
        for (int i = 0; i < 40; ++i) theirs->addMember(subscribedPerson("Copy", ("COPY" + std::to_string(i)).c_str()));
        groups.push_back(theirs);
        save();
        for (const CXGroupRef& each : groups) knows(each->isSubscribed() ? UserName("bob") : kSelf, each);
        knows(kSelf, database.allGroup());
        knows(UserName("bob"), database.allGroupForRemoteLocation(kBobsLocation));
        Sqlite(directory / "contacts.db", 1000).execute("PRAGMA wal_checkpoint(TRUNCATE)");
        std::ifstream in(directory / "contacts.db", std::ios::binary);
        sound.assign(std::istreambuf_iterator<char>(in), {});
    }

    struct Seen {
        std::set<std::string> removals;
        bool damaged = false, repaired = false;
        std::string told;
    };

    // One who opens the file that is as given, with the memory of a sound one, and compares everything.
    Seen scan(const std::string& bytes) {
        Seen seen;
        const TempDirectory place;
        std::ofstream(place / "contacts.db", std::ios::binary) << bytes;
        for (int look = 0; look < 2; ++look) {
            std::unique_ptr<CXRolvane> opened;
            try {
                FakeEngine asks;
                asks.data = Value(engine.data).deepMutableCopy().dictionary();
                NotificationCenter quiet;
                opened = std::make_unique<CXRolvane>(daemonDatabase(place, clock, quiet));
                CXDCXConduit daemons(asks, {*opened, preferences, clock, quiet, 1, "another program"});
                daemons.open();
                for (const CXDChangeRecordPtr& record : daemons.changeRecords())
                    if ((record->type() & kCXDRemovalBit) != 0 && record->type() != CXDRemoveDistributionListFromGroup)
                        seen.removals.insert(record->description());
                if (seen.damaged) seen.repaired = true;
                return seen;
            } catch (const CXException& e) {
                seen.told = e.reason();
                if (look == 1) ADD_FAILURE() << "repaired, and not in order: " << seen.told;
                seen.damaged = true;
            }
            try {
                if (!opened) return seen;
                repairDatabase(*opened);
            } catch (const CXException& e) {
                seen.told = e.reason();
                return seen;
            }
        }
        return seen;
    }

    // A bit, a byte, or a few bytes of nothing.
    static std::string damaged(std::string bytes, std::mt19937& random) {
        const size_t at = random() % bytes.size();
        switch (random() % 4) {
        case 0: bytes[at] = static_cast<char>(random()); break;
        case 1:
            for (size_t i = 0; i < 1 + random() % 64 && at + i < bytes.size(); ++i) bytes[at + i] = 0;
            break;
        default: bytes[at] = static_cast<char>(bytes[at] ^ (1 << random() % 8)); break;
        }
        return bytes;
    }

    CapturingLog log;
    std::vector<CXGroupRef> groups;
    std::string sound;
};

} // namespace

TEST_F(DamagedDatabase, ASoundOneTellsNoRemoval) {
    const Seen seen = scan(sound);
    EXPECT_TRUE(seen.removals.empty());
    EXPECT_FALSE(seen.damaged) << seen.told;
}

// ROLVANE_TEST_DAMAGES=n tries so many; a failure names its seed.
TEST_F(DamagedDatabase, WhateverIsDamagedNoContactAndNoGroupIsToldToBeGone) {
    const char* asked = std::getenv("ROLVANE_TEST_DAMAGES");
    const unsigned count = asked ? static_cast<unsigned>(std::atoi(asked)) : 150;
    unsigned met = 0, mended = 0;
    for (unsigned seed = 1; seed <= count; ++seed) {
        std::mt19937 random(seed);
        const Seen seen = scan(damaged(sound, random));
        EXPECT_TRUE(seen.removals.empty()) << "seed " << seed << ": " << *seen.removals.begin();
        met += seen.damaged;
        mended += seen.repaired;
    }
    std::cout << count << " damages, " << met << " met, " << mended << " of them mended\n";
}
