#pragma once

#include "contacts/database/CXRolvane.h"
#include "contacts/vcard/VCardWriter.h"

#include <functional>
#include <map>
#include <ostream>
#include <set>
#include <string>
#include <vector>

namespace rolvane {

// Writes people and groups of a contact database as vCards: people first, then group cards with members, subgroups and
// distribution choices; the names of a person's groups stand in CATEGORIES too. Importing the text into an empty
// database gives equal people and groups. With whom something is shared is not written.
// Each operation gives the number of cards. CXException kCXVCardException: the stream takes no more (a full disk).
// One thread; database and stream are borrowed.
class VCardExport {
public:
    using ProgressHandler = std::function<void(size_t done, size_t total)>; // of people

    VCardExport(CXRolvane& rolvane, std::ostream& out, VCardVersion version, ProgressHandler onProgress = {});

    // The owner's own people and groups.
    size_t exportAll();
    // The group, its members, its subgroups and theirs. An all-contacts group of the owner's: as exportAll.
    size_t exportGroup(const CXGroupRef& group);
    // People and groups by `uniqueId`, in this order, a group as exportGroup does, nothing twice. Identifiers of no
    // record are passed over.
    size_t exportRecords(const std::vector<UniqueId>& uids);

private:
    void studyGroups();
    void writePerson(const UniqueId& uid, const Dictionary& properties, const std::vector<UniqueId>& parents);
    void writePerson(const CXPersonRef& person);
    void writeMembersOf(const CXGroupRef& group);
    void writeGroup(const CXGroupRef& group);
    void addChoices(VCardEntity& card, const CXGroupRef& group);
    void write(const VCardEntity& card);
    void finish();
    void check();
    std::string uidTextOf(const UniqueId& uid) const;

    CXRolvane& _rolvane;
    std::ostream& _out;
    VCardVersion _version;
    ProgressHandler _onProgress;
    size_t _cards = 0, _total = 0;
    std::map<UniqueId, std::string> _groupNames;
    std::map<UniqueId, std::string> _keptUIDs; // of people whose card came with a UID that is no UUID
    std::set<UniqueId> _written;
    std::vector<CXGroupRef> _groupsToWrite;
};

} // namespace rolvane
