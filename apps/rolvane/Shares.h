#pragma once

#include "contacts/database/CXRolvane.h"

#include <optional>
#include <string>
#include <vector>

namespace rolvane::cli {

// With whom the owner shares, in the contact database: kCXReadSharingACLProperty of the all-contacts group names those
// who may read, kCXReadWriteSharingACLProperty those of them who may write, too. The daemon carries both to the store.
//
// Two more properties of that group note since when each of them may (contacts/records/SharingDates.h).
//
// While only single groups are published nothing is carried for the all-contacts group, so each published group has the
// same two properties then.
class Shares {
public:
    explicit Shares(CXRolvane& database) : _database(database) {}

    std::vector<std::string> readers() const; // writers among them, in the order in which they were granted
    std::vector<std::string> writers() const;
    bool mayRead(const std::string& user) const;
    bool mayWrite(const std::string& user) const;

    // When the right was granted that the user has; nothing when it was not noted. Lowering and raising leave the
    // beginning of reading alone, and a right that was there already keeps its date.
    std::optional<Date> readsSince(const std::string& user) const;
    std::optional<Date> writesSince(const std::string& user) const;

    // Each is unsaved. True when it changed something.
    bool grant(const std::string& user, bool write); // without `write` a writer becomes a reader
    bool deny(const std::string& user);
    void denyAll();
    // The two properties on every published group, where they are wanted there.
    void settle();

private:
    std::vector<std::string> listed(const char* property) const;
    std::optional<Date> since(const char* property, const std::string& user) const;
    bool put(const char* property, const std::string& user, bool wanted);
    void putDate(const char* property, const std::string& user, bool wanted);
    CXRolvane& _database;
};

} // namespace rolvane::cli
