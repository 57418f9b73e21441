#pragma once

#include "Archive.h"

#include "foundation/Date.h"

#include <optional>
#include <string>
#include <vector>

namespace rolvane::cli {

// One file with all that a person has on this computer: contact database, account, preferences, and the contacts that
// publishers have withdrawn. docs/formats.md has its members. No password is in it, nor the private store, nor the
// address books' devices.

// The words of a backup about itself.
struct BackupFacts {
    Date date;
    std::string computer, version; // that made it
    std::string user;              // of the account; "" without one
    bool hasDatabase = false, hasPreferences = false;
    size_t people = 0, groups = 0; // the owner's own
    size_t withdrawn = 0;          // files of withdrawn contacts
    uint64_t bytes = 0;            // of the file
};

// Makes the file, reads it back, compares it, and gives it its name then: a file that stood there is replaced by a
// whole one or not at all. `left` gets a sentence for each thing that cannot be had and is left out. CXException when
// the database or the preferences cannot be copied, or the file cannot be written.
BackupFacts writeBackup(const std::string& path, std::vector<std::string>& left);

// A backup that was read and found whole: every digest is right, the database is one that this version opens, and the
// account can be read. CXException with the file and the reason otherwise. One thread.
class Backup {
public:
    explicit Backup(const std::string& path);

    const BackupFacts& facts() const { return _facts; }

    // Puts its files into the directories of the data, the state and the configuration, under temporary names first.
    // Files of the same kind that stand there are replaced, those that it does not have stay. The database must be in
    // nobody's use. Killed in between, it is to be done again: each file is then the former or the restored one.
    void restore();

private:
    void readManifest();
    void checkDatabase();
    void restoreWithdrawn();
    void restoreAccount();

    ArchiveReader _archive;
    const std::string _path;
    BackupFacts _facts;
    std::string _configDirectory;                                // of the computer that made it
    std::vector<std::pair<std::string, std::string>> _withdrawn; // member and the name of its file
};

// Is there anything on this computer that a restored backup would replace? In words: "5 people, 1 group and the account
// of alice"; "" when there is nothing.
std::string whatIsHere();

// Keeps what is here before it is replaced: a backup of it, or, where something cannot be read, a directory with copies
// of the files as they are. Gives the place.
std::string keepWhatIsHere(Date now);

} // namespace rolvane::cli
