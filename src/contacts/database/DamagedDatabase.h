#pragma once

#include "foundation/CXException.h"
#include "foundation/StrongString.h"

#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

class CXRolvane;
class Preferences;

// The file of the contact database is damaged: SQLite cannot read it, or it says two things at once. Its name is
// kCXDatabaseException. Nothing that the file says after that is to be taken for somebody's doing.
class CXDamagedDatabase : public CXException {
public:
    explicit CXDamagedDatabase(std::string reason) : CXException(kCXDatabaseException, std::move(reason)) {}
};

// Confirms absences. What is looked for by an index may be missing in the index alone, and a deletion that is made of
// such an absence would be carried to every copy. So whoever is about to make one asks here, where the rows themselves
// are looked at. An object reads all rows once, at the first question of that kind, in about a microsecond each, so it
// lives for one gathering. Any thread, one at a time.
class AbsenceCheck {
public:
    explicit AbsenceCheck(CXRolvane& rolvane);
    ~AbsenceCheck();

    // Each throws CXDamagedDatabase where a row contradicts.
    // No record has the identifier; one that is removed in the unit of work counts as none.
    void requireGone(const UniqueId& uid);
    // No record of the location has the identifier; the empty location is the owner's own.
    void requireGoneFrom(std::string_view location, const UniqueId& uid);
    // The record stands under the location that its properties name: whoever is looked for there is of that location.
    void requireItsLocation(const UniqueId& uid);
    // The group does not list any of them: identifiers as in the database. Not asked while anything is unsaved.
    void requireUnlisted(const UniqueId& group, const std::vector<UniqueId>& members);

private:
    struct Rows;
    const Rows& rows();
    [[noreturn]] void contradiction(const std::string& what);
    [[noreturn]] void damaged(const std::string& how);

    CXRolvane& _rolvane;
    std::unique_ptr<Rows> _rows;
};

// What was found damaged in the file since it was opened or repaired; "" when nothing was.
std::string damageOf(CXRolvane& rolvane);

// Rebuilds all indexes, where the tables can be believed: every row fits its own identifier and is known to an index,
// and the indexes know of none besides. The whole file is checked afterwards. Throws CXDamagedDatabase, with the file
// as it was, when that is not so, and says what to do. Costs seconds where there are 50,000 contacts.
void repairDatabase(CXRolvane& rolvane);

// In the daemon's preferences, from its first pass on: the identity of the database that it has shared contacts of.
inline constexpr const char* kCXDKnownDatabase = "CXDKnownDatabase";

// Throws kCXDatabaseException when there is no file though the preferences know of one, and when the file is empty. To
// be asked before the database is opened, which would make a new one. "": the path is the default.
void requireKnownDatabase(const std::string& path, const Preferences& preferences);

// Throws kCXDatabaseException where there is a database: a file that is not empty. "": the path is the default.
void requireNoDatabase(const std::string& path);

// Puts a new database in the place of one that is gone or empty, on purpose; an empty file is kept under another name.
// Throws kCXDatabaseException where there is a database.
void beginNewDatabase(const std::string& path);

} // namespace rolvane
