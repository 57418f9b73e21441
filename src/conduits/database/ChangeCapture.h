#pragma once

#include "conduits/ConduitEngine.h"
#include "conduits/database/ContactReader.h"
#include "conduits/database/GroupComparison.h"
#include "contacts/database/DamagedDatabase.h"
#include "foundation/NumberTable.h"
#include "model/CXDChangeRecord.h"

#include <memory>
#include <set>
#include <unordered_map>
#include <unordered_set>
#include <vector>

namespace rolvane {

// One gathering of change records from the contact database: the records of what is added to it, in that order.
// A person that is captured several times, by itself and as a new member of groups, is read once: its records are
// listed again, and they hold its data in encoded form. Lives for one gathering on the main thread.
class ChangeCapture {
public:
    // `priorState` is user -> group -> state; a user that is met for the first time gets an empty entry in it.
    // `ownProgram`: what it wrote last into a subscribed person came from the publisher. Where such a person is met as
    // a new member of a group, its data is not carried back; it might replace a newer version.
    ChangeCapture(ConduitEngine& engine, CXRolvane& rolvane, Dictionary priorState, std::string ownProgram = {});

    // The person's data for each location where it is shared, with its choices in each group that lists the person; a
    // person that is new also enters the location's all-contacts group.
    void addPerson(const CXRow& person, bool update);
    void addPerson(const std::optional<CXRow>& person, bool update);
    // Adds the changes of the group for its location. A null group, or one that is shared nowhere, adds nothing. Throws
    // CXDamagedDatabase where a record would count as gone although its row is there.
    void addGroup(const CXGroupRef& group);
    // `group` is the group that the states are of, when there is one: its new members are then read together.
    void addComparison(const Value& prior, const Value& current, const UniqueId& guid, const RemoteLocation& location,
                       const CXGroup* group);
    void addDistributionLists(const CXRow& person, int32_t sources, const UserName& user);
    void add(CXDChangeRecords records);

    ContactReader& reader() { return _reader; }
    CXDChangeRecords take() { return std::move(_records); }

private:
    struct Destination {
        UserName user;
        int32_t sources;
    };
    // A person's records for one location: so many in `_captured`, one after the other.
    struct Captured {
        Destination destination;
        uint32_t records;
    };
    struct CapturedPerson {
        UniqueId uniqueId;
        uint32_t place, places;   // in `_places`
        uint32_t record, records; // in `_captured`
    };

    Destination destination(const RemoteLocation& location);
    CapturedPerson captured(const CXRow& person);
    const CapturedPerson* capturedBefore(const UniqueId& uniqueId) const;
    UniqueId sharedText(const UniqueId& uid) const;
    void addCaptured(uint32_t first, uint32_t count);
    void addDistributionLists(const CXRow& person, const Destination& to, CXDChangeRecords& records);
    std::optional<UniqueId> allGroupAt(const RemoteLocation& location, const UserName& user) const;
    void addMember(const UniqueId& member);
    void readNewMembers(const GroupSteps& steps, const CXGroup& group, size_t members); // members: of the group now
    bool cameFromPublisher(const CXRow& person) const;
    void confirmAbsences(const GroupSteps& steps, const CXGroup& group); // else CXDamagedDatabase

    ConduitEngine& _engine;
    ContactReader _reader;
    AbsenceCheck _absences;
    Dictionary _priorState;
    const std::string _ownProgram;
    CXDChangeRecords _records;
    std::unordered_map<RemoteLocation, Destination> _destinations;
    std::vector<CapturedPerson> _people;
    NumberTable _byIdentifier;                      // places in _people, by uniqueId
    mutable size_t _following = 0;                  // the place in _people behind the last one that was asked for
    std::vector<Captured> _places;                  // of all people
    CXDChangeRecords _captured;                     // of all people
    std::unordered_set<UniqueId> _arrived;          // members whose data came from their publisher
    std::set<UniqueId> _underway;                   // groups whose comparison is under way, by uniqueId
    std::unordered_map<UniqueId, int> _comparisons; // how often a group was compared, by uniqueId
};

} // namespace rolvane
