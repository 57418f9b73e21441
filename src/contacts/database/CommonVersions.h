#pragma once

#include "foundation/Date.h"
#include "foundation/Sqlite.h"
#include "foundation/StrongString.h"

#include <memory>
#include <optional>
#include <vector>

namespace rolvane {

// The version of a contact that this database and a store both had last, while it is edited here and not yet sent.
struct CXCommonVersion {
    std::shared_ptr<const Bytes> properties; // encoded; null: the contact was not edited since
    std::optional<Date> edited;              // the last edit; missing when there was none
    // Contents of the edited contact, encoded, that were on their way to a store: each may have come there, and nobody
    // knows. With the last edit in them, which an earlier version did not note. Empty when the contact was not edited.
    struct Sent {
        std::shared_ptr<const Bytes> properties;
        std::optional<Date> edited;
    };
    std::vector<Sent> sent = {};
};

// The table of them: a row for each contact that a store is known to have had. A second table has what was on its way;
// it is made when something is put there first. Not locked. The writing operations want an open transaction. Rows go
// with their contact.
class CommonVersions {
public:
    explicit CommonVersions(Sqlite& database) : _database(database) {}

    static constexpr const char* kTable = R"(
CREATE TABLE IF NOT EXISTS common(
  record_id INTEGER PRIMARY KEY REFERENCES records(id) ON DELETE CASCADE,
  properties BLOB,
  edited REAL);
CREATE INDEX IF NOT EXISTS common_edited ON common(record_id) WHERE properties IS NOT NULL;
)";

    std::optional<CXCommonVersion> of(const UniqueId& uid); // nothing: no store is known to have had the contact
    std::vector<UniqueId> edited();                         // contacts with an edit that was not sent, by age

    // Within a transaction ---------------------------------------------------------------------------------------
    // A contact is about to be edited. Of several edits the first one's state before it stays.
    void keep(int64_t record, const Bytes& before, Date when);
    // Both sides had these properties. Nothing is kept of them while the contact's row says the same.
    void set(const UniqueId& uid, const Bytes& properties);
    // They are going to be sent; for as long as nothing is set.
    void addSent(const UniqueId& uid, const Bytes& properties);

private:
    static constexpr const char* kSentTable = R"(
CREATE TABLE IF NOT EXISTS sent(
  record_id INTEGER NOT NULL REFERENCES records(id) ON DELETE CASCADE,
  properties BLOB NOT NULL,
  edited REAL,
  UNIQUE(record_id, properties));
)";
    bool hasSentTable();
    bool datesSent(); // the table was made by a version that notes the last edit

    Sqlite& _database;
};

} // namespace rolvane
