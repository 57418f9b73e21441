#pragma once

#include "contacts/database/CXRolvane.h"
#include "contacts/records/RecordKind.h"
#include "foundation/Sqlite.h"

#include <array>
#include <functional>
#include <set>
#include <span>

namespace rolvane {

// One stored row.
struct StoredRow {
    int64_t id = 0;
    UniqueId uid;
    RecordKind kind = RecordKind::none;
    std::string location;
    Date created, modified;
    std::shared_ptr<const Bytes> properties;
    std::string writer; // the program that wrote the properties last; "" when unknown
};

struct StoredChoice {
    UniqueId record; // the person's, or the group's when asked for a person
    std::string property, identifier;
    bool propertyIsUsed = true;
};

// Where a scan stands: behind the row with this date and number.
struct ScanPosition {
    double modified;
    int64_t id;
};

// The tables: every SQL text of the framework but those of the journal. Reads what is saved; the writing operations
// want an open transaction. Not locked. Row numbers grow with age and are never used again.
class RecordStore {
public:
    // A file that is missing is made elsewhere and put in its place when it is a whole database, so that no empty file
    // is ever anybody's beginning. Gives the path.
    static const std::string& makeIfMissing(const std::string& path, int busyTimeoutMilliseconds);
    // Makes the tables in a new file. Refuses files of a newer format and files that are no contact database.
    explicit RecordStore(Sqlite& database);

    Sqlite& database() { return _database; }
    // Changes whenever another connection has committed, and by noteOwnWrite.
    uint64_t generation();
    void noteOwnWrite() { _ownWrites++; }
    std::string identity();
    int64_t shareCount();

    std::optional<StoredRow> row(const UniqueId& uid);
    int64_t rowNumber(const UniqueId& uid); // 0 when there is none
    std::pair<int64_t, RecordKind> numberAndKind(const UniqueId& uid);
    std::optional<UniqueId> firstOfLocation(RecordKind kind, std::string_view location);
    // Makes an identifier of one in the database.
    using Naming = std::function<UniqueId(std::string_view)>;
    // With row numbers, by age. Without a naming as they stand there.
    std::vector<std::pair<int64_t, UniqueId>> recordsOf(RecordKind kind, const std::optional<std::string>& location,
                                                        const Naming& name = {});
    std::vector<std::pair<UniqueId, RecordKind>> listed(const UniqueId& group); // members and subgroups in list order
    bool isListed(const UniqueId& group, const UniqueId& member);
    int64_t countMembers(const UniqueId& group);
    int64_t countOf(RecordKind kind, const std::optional<std::string>& location);
    std::vector<std::pair<int64_t, UniqueId>> parents(const UniqueId& member); // groups, by age
    std::vector<StoredChoice> choicesOfGroup(const UniqueId& group);
    std::vector<StoredChoice> choicesOfPerson(const UniqueId& person);
    std::optional<std::string> choice(const UniqueId& group, const UniqueId& person, std::string_view property);
    // Rows of the kind behind the position, by modification date; moves the position. With the parents, if wanted.
    std::vector<CXRow> scan(RecordKind kind, ScanPosition& position, int limit, bool withParents);
    // Rows with their parents: people that the group lists, in list order, behind the position in the list; or records
    // of the kind (and location) behind the row number, by age. Both move the position; 0 is before all.
    std::vector<CXRow> scanMembers(const UniqueId& group, int64_t& position, int limit);
    std::vector<CXRow> scanByAge(RecordKind kind, const std::optional<std::string>& location, int64_t& position,
                                 int limit);
    // Calls with uid, location, display, sort and search text of every row of the kind.
    struct Line {
        UniqueId uid;
        std::string location, display, sort, search;
    };
    // The same of the people whose name is this (letter case of ASCII aside), or has this in it; by an index of names.
    std::vector<Line> linesNamed(std::string_view name, bool partOfName);
    // The same of the people whose name begins so, by name: the first ones and the last of all, not more than `most`.
    std::vector<Line> linesBegun(std::string_view start, size_t most);
    // The same of the people whose search text passes, which is seen for the time of the call alone.
    std::vector<Line> linesFound(const std::function<bool(std::string_view)>& passes);
    // Identifiers of people that begin so, letter case aside.
    std::vector<UniqueId> peopleWhoseIdentifierBegins(std::string_view start);
    // Rows with their parents, in this order; those that are not there are left out. Only the first ones where all of
    // them would fill the memory: `taken` tells how many identifiers were looked up, one at least.
    std::vector<CXRow> rowsOf(std::span<const UniqueId> uids, size_t& taken);
    void forEachLine(RecordKind kind, const std::function<void(Line)>& call);

    // Past the indexes, or by one of them alone: for finding out which of them is damaged --------------------------
    struct TableRow {
        int64_t id;
        std::string uid;
        RecordKind kind;
        std::string location;
        Bytes properties;
    };
    void forEachRowOfTable(const std::function<void(const TableRow&)>& call, bool withProperties = false);
    enum class Index { identifiers, names, locations }; // of records, each of which names the row and its identifier
    static constexpr std::array kIndexesOfRecords{Index::identifiers, Index::names, Index::locations};
    void forEachOfIndex(Index index, const std::function<void(int64_t id, std::string uid)>& call);
    std::set<std::pair<int64_t, int64_t>> listsOfTable(); // group and member
    struct ListsOfIndex {
        bool isReadable = true, isInOrder = true;
        std::set<std::pair<int64_t, int64_t>> pairs; // group and member
    };
    ListsOfIndex listsOfIndex();
    // The first of them whom the group lists after all.
    std::optional<UniqueId> firstListedAfterAll(const UniqueId& group, const std::vector<UniqueId>& members);
    std::string whatIsWrong(); // SQLite's own check of the whole file; "" when it finds nothing

    // Within a transaction ---------------------------------------------------------------------------------------
    void insertRow(const UniqueId& uid, RecordKind kind, const Dictionary& properties, const Bytes& encoded,
                   Date created, const std::string& writer);
    void updateRow(int64_t id, RecordKind kind, const Dictionary& properties, const Bytes& encoded, Date modified,
                   const std::string& writer);
    void removeRow(int64_t id);
    void setModified(int64_t id, Date modified);
    void touchParents(int64_t member, Date modified);
    bool addListed(int64_t group, int64_t member);
    bool removeListed(int64_t group, int64_t member);
    bool isReachable(int64_t from, int64_t to); // through lists
    bool setChoice(int64_t group, int64_t person, const std::string& property, const std::string& identifier);
    bool removeChoice(int64_t group, int64_t person, const std::string& property);
    bool removeChoices(int64_t group, int64_t person);
    void setShareCount(int64_t count);

private:
    void makeOrCheckFormat();
    int64_t addWriters(); // the format then
    int64_t addNames();
    int64_t addCommonVersions();
    int64_t addDisplayNames();
    int64_t addDaemonMemory();
    int64_t addSearchTexts();
    int64_t addChangeLog();
    int64_t moveDaemonMemory();
    void fillNewDatabase();
    [[noreturn]] void outOfOrder();
    std::vector<CXRow> rowsWithParents(Sqlite::Statement& s, int positionColumn, int64_t& position);
    void addParents(std::vector<CXRow>& rows, const std::vector<int64_t>& ids);

    Sqlite& _database;
    uint64_t _ownWrites = 0;
};

} // namespace rolvane
