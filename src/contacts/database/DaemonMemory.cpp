#include "contacts/database/DaemonMemory.h"

#include "contacts/database/DatabaseErrors.h"
#include "contacts/database/RecordStore.h"
#include "foundation/CXException.h"
#include "foundation/Paths.h"

#include <algorithm>
#include <array>
#include <filesystem>
#include <utility>

namespace rolvane {

namespace {

constexpr std::string_view kStates = "CXDConduitData"; // and "CXDConduitData/..."
constexpr std::array<std::string_view, 9> kOthers{
    "CXDStateEdition",
    "CXDPendingChanges",
    "CXDVaultraConduitLastSyncDate",
    "CXDCXConduitLastSyncDate",
    "CXDLocalConduitLastSyncDate",
    "CXDShareCount",
    "CXDLastOstrelUser",
    "CXDUnderWay",
    "CXDRefusedChanges",
};

constexpr int kBusyTimeoutMilliseconds = 5000;

class DaemonMemory : public PreferencesKeeper {
public:
    explicit DaemonMemory(std::string path) : _given(std::move(path)) {}

    bool keeps(std::string_view domain, std::string_view key) const override {
        return domain == kDaemonDomain && MemoryTable::hasKey(key);
    }
    const std::string& domain() const override { return _domain; }
    std::optional<Bytes> read(std::string_view key) override {
        return open() ? MemoryTable(*_database).value(key) : std::nullopt;
    }
    std::vector<std::string> keys() override {
        return open() ? MemoryTable(*_database).keys() : std::vector<std::string>();
    }
    void write(const PreferencesChanges& changes) override {
        if (!open())
            throw CXException(kCXDatabaseException,
                              "There is no contact database " + path() + " to keep what the daemon remembers of it.");
        SqliteTransaction transaction(*_database);
        MemoryTable(*_database).write(changes);
        transaction.commit();
    }

private:
    std::string path() const { return _given.empty() ? dataDirectory() + "/contacts.db" : _given; }

    bool open() {
        if (_database) {
            if (_database->hasMoved())
                throw CXException(kCXDatabaseException, "The contact database " + _database->path() +
                                                            " was moved away or replaced while this program had it "
                                                            "open. Start this program again.");
            return true;
        }
        std::error_code error;
        const std::string path = this->path();
        // An empty file is no database, and what stood in it is lost: opening it makes one.
        if (!std::filesystem::is_regular_file(path, error) || std::filesystem::file_size(path, error) == 0)
            return false;
        auto database = std::make_unique<Sqlite>(path, kBusyTimeoutMilliseconds, throwDatabaseError);
        const RecordStore ofTheFormat(*database);
        _database = std::move(database);
        return true;
    }

    const std::string _given;
    const std::string _domain = kDaemonDomain;
    std::unique_ptr<Sqlite> _database;
};

} // namespace

bool MemoryTable::hasKey(std::string_view key) {
    if (key.starts_with(kStates)) return key.size() == kStates.size() || key[kStates.size()] == '/';
    return std::find(kOthers.begin(), kOthers.end(), key) != kOthers.end();
}

std::optional<Bytes> MemoryTable::value(std::string_view key) {
    auto s = _database.statement("SELECT value FROM daemon WHERE key=?");
    if (!s.bind(1, key).step()) return std::nullopt;
    return s.bytes(0);
}

std::vector<std::string> MemoryTable::keys() {
    auto s = _database.statement("SELECT key FROM daemon ORDER BY key");
    std::vector<std::string> all;
    while (s.step()) all.push_back(s.text(0));
    return all;
}

void MemoryTable::write(const PreferencesChanges& changes) {
    // A value stays in its row, or row and index would be written elsewhere each time.
    auto put = _database.statement("INSERT INTO daemon VALUES(?1, ?2) ON CONFLICT(key) DO UPDATE SET value=?2");
    auto erase = _database.statement("DELETE FROM daemon WHERE key=?");
    for (const auto& [key, bytes] : changes) {
        if (bytes)
            put.bind(1, std::string_view(key)).bind(2, *bytes).run();
        else
            erase.bind(1, std::string_view(key)).run();
        put.reset();
        erase.reset();
    }
}

std::shared_ptr<PreferencesKeeper> daemonMemory(std::string path) {
    return std::make_shared<DaemonMemory>(std::move(path));
}

} // namespace rolvane
