#pragma once

#include "foundation/Preferences.h"
#include "foundation/Sqlite.h"

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// The SQLite file beneath Preferences: rows of (domain, key, bytes). Journal in WAL form, where the file system can
// carry it: a commit costs one flush, and readers never wait for a writer. One thread at a time. Every operation opens
// the file when there is one and notices when it was moved away or removed meanwhile. Failures throw
// kCXPreferencesException and leave the file as it was.
class PreferencesFile {
public:
    using Changes = PreferencesChanges;

    PreferencesFile(std::string path, double lockTimeoutSeconds);
    PreferencesFile(const PreferencesFile&) = delete;
    PreferencesFile& operator=(const PreferencesFile&) = delete;

    std::optional<Bytes> read(std::string_view domain, std::string_view key);
    std::vector<std::string> keys(std::string_view domain);
    std::vector<std::string> domains();
    void write(std::string_view domain, const Changes& changes); // one transaction, on the disk when it returns
    const std::string& path() const { return _path; }

private:
    bool openExisting(); // false: there is no file, or no table in it yet
    void openOrCreate();
    void createFile();
    void open();
    void checkFormat();
    bool hasTable();
    void applyChanges(std::string_view domain, const Changes& changes);

    std::string _path;
    double _lockTimeout;
    std::unique_ptr<Sqlite> _database;
    bool _tableSeen = false;
};

} // namespace rolvane
