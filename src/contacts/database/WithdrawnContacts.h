#pragma once

#include "contacts/database/CXRolvane.h"

#include <optional>
#include <string>
#include <vector>

namespace rolvane {

// One subscription that ended without this database's doing: whose it was, when it ended here, and where the copies are
// that left with it.
struct WithdrawnContacts {
    UserName user;
    RemoteLocation location;
    Date date; // to the second
    size_t people = 0, groups = 0;
    std::string file; // a vCard file that VCardImport takes; "" when there was nothing to keep
    std::string name; // of this record in its folder; names nothing else
};

// Keeps the contacts of withdrawn subscriptions, one dated vCard file each with a property list beside it:
//
//   <date>-<user>.vcf     people and groups, vCard 4.0; absent when there were none
//   <date>-<user>.plist   {"User", "Location", "Subscription": strings, "Date": date, "People", "Groups": integers}
//
// with the user percent-encoded. A subscription ends once: a process that is killed before the contacts have left the
// database finds the subscription withdrawn again, and keeps them in the same record. The directory has the mode 0700,
// the files 0600. Any thread; several processes may use one folder, one of which keeps.
class WithdrawnContactsFolder {
public:
    explicit WithdrawnContactsFolder(std::string directory = {}); // "": dataDirectory()/withdrawn; made on first keep

    const std::string& directory() const { return _directory; }

    // Writes down what came from the location, durably on return; the database stays as it is. CXException: it could
    // not be written, and nothing new is left of it.
    WithdrawnContacts keep(CXRolvane& database, const RemoteLocation& location, const UserName& user, Date now);
    // Latest first. Records that cannot be read are left out; a missing directory is an empty list.
    std::vector<WithdrawnContacts> list() const;
    // Removes the record and its file; absence is no error.
    void forget(const WithdrawnContacts& record);

private:
    std::string nameFor(const UserName& user, const std::string& subscription, Date now) const;
    const std::string _directory;
};

} // namespace rolvane
