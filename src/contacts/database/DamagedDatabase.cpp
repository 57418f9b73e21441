#include "contacts/database/DamagedDatabase.h"

#include "contacts/database/RolvaneImpl.h"
#include "foundation/Paths.h"
#include "foundation/Preferences.h"
#include "foundation/PropertyList.h"
#include "foundation/TestSwitch.h"

#include <algorithm>
#include <filesystem>
#include <map>
#include <unordered_map>

namespace rolvane {
namespace {

constexpr const char* kShareCountKey = "CXDShareCount"; // stood in the preferences in earlier versions

constexpr const char* kWhatToDo =
    "Bring a backup back with `rolvane restore FILE`; or save what can be read with `rolvane export`, stop "
    "RolvaneManager "
    "(`rolvane daemon stop`), move the file away and begin anew with `rolvane new-database`.";

std::string pathOr(const std::string& path) {
    return path.empty() ? dataDirectory() + "/contacts.db" : path;
}

} // namespace

// -- absences

namespace {

// The copy of an own record, or the own record of a copy.
UniqueId otherFormOf(const UniqueId& uid) {
    switch (kindOfTable(cxTableName(uid))) {
    case RecordKind::person: return cxUIDWithTableName(uid, kCXSubscribedPersonTable);
    case RecordKind::group: return cxUIDWithTableName(uid, kCXSubscribedGroupTable);
    default: return cxNormalizedUID(uid);
    }
}

} // namespace

struct AbsenceCheck::Rows {
    std::unordered_map<std::string, std::string> locations; // by identifier
};

AbsenceCheck::AbsenceCheck(CXRolvane& rolvane) : _rolvane(rolvane) {}
AbsenceCheck::~AbsenceCheck() = default;

const AbsenceCheck::Rows& AbsenceCheck::rows() {
    if (_rows) return *_rows;
    auto read = std::make_unique<Rows>();
    _rolvane.impl().store.forEachRowOfTable(
        [&](const RecordStore::TableRow& row) { read->locations.emplace(row.uid, row.location); });
    _rows = std::move(read);
    return *_rows;
}

void AbsenceCheck::contradiction(const std::string& what) {
    damaged(what + " is there, and an index of the file does not know it");
}

void AbsenceCheck::damaged(const std::string& how) {
    CXRolvane::Impl& d = _rolvane.impl();
    const std::string told =
        "The contact database " + d.options.path + " is damaged: " + how + ". Nothing is taken for deleted.";
    d.sqlite.noteDamage(told);
    throw CXDamagedDatabase(told);
}

void AbsenceCheck::requireGone(const UniqueId& uid) {
    if (isLeftOut("absence")) return;
    std::lock_guard lock(_rolvane.impl().mutex);
    if (_rolvane.impl().work.isGone(uid)) return;
    if (rows().locations.contains(uid.str())) contradiction(uid.str());
}

void AbsenceCheck::requireGoneFrom(std::string_view location, const UniqueId& uid) {
    std::lock_guard lock(_rolvane.impl().mutex);
    if (_rolvane.impl().work.isRecordWithChanges(uid)) return;
    const auto found = rows().locations.find(uid.str());
    if (found != rows().locations.end() && found->second == location) contradiction(uid.str());
}

void AbsenceCheck::requireItsLocation(const UniqueId& uid) {
    CXRolvane::Impl& d = _rolvane.impl();
    std::lock_guard lock(d.mutex);
    const auto& row = d.storedRow(uid);
    if (row && locationOf(row->kind, d.storedProperties(uid)) != row->location)
        damaged(uid.str() + " has two locations");
}

void AbsenceCheck::requireUnlisted(const UniqueId& group, const std::vector<UniqueId>& members) {
    CXRolvane::Impl& d = _rolvane.impl();
    std::lock_guard lock(d.mutex);
    // Of what is not saved the rows say nothing yet. Who tells others what has changed has saved before.
    if (members.empty() || !d.work.empty()) return;
    for (const UniqueId& member : members)
        if (d.store.rowNumber(member) == 0 && d.store.rowNumber(otherFormOf(member)) == 0) requireGone(member);
    if (const auto member = d.store.firstListedAfterAll(group, members))
        contradiction(member->str() + " in the group " + group.str());
}

// -- the file

std::string damageOf(CXRolvane& rolvane) {
    std::lock_guard lock(rolvane.impl().mutex);
    return rolvane.impl().sqlite.damage();
}

void requireKnownDatabase(const std::string& given, const Preferences& preferences) {
    const std::string path = pathOr(given);
    std::error_code error;
    const bool there = std::filesystem::exists(path, error);
    if (there && !(std::filesystem::is_regular_file(path, error) && std::filesystem::file_size(path, error) == 0))
        return;
    if (there)
        throw CXException(
            kCXDatabaseException,
            "The contact database " + path +
                " is empty (0 bytes): what stood in it is lost. Nothing was deleted on the store nor for "
                "readers. Bring a backup back with `rolvane restore FILE`, or begin anew with `rolvane new-database`.");
    const bool wasShared =
        preferences.get(kDaemonDomain, kCXDKnownDatabase) || preferences.get(kDaemonDomain, kShareCountKey);
    if (!wasShared) return;
    throw CXException(
        kCXDatabaseException,
        "The contact database " + path +
            " is gone, and contacts of it are shared. Nothing was deleted on the store nor for readers. Put "
            "the file back, or a backup with `rolvane restore FILE`, or begin anew with `rolvane new-database`.");
}

void requireNoDatabase(const std::string& given) {
    const std::string path = pathOr(given);
    std::error_code error;
    if (!std::filesystem::exists(path, error)) return;
    if (!std::filesystem::is_regular_file(path, error) || std::filesystem::file_size(path, error) != 0)
        throw CXException(kCXDatabaseException,
                          "There is a contact database in " + path + ". Move it away first if you want to begin anew.");
}

void beginNewDatabase(const std::string& given) {
    const std::string path = pathOr(given);
    requireNoDatabase(path);
    std::error_code error;
    if (std::filesystem::exists(path, error)) {
        std::filesystem::rename(path, path + ".empty", error);
        if (error)
            throw CXException(kCXDatabaseException, "The empty file " + path + " could not be moved away (" +
                                                        error.message() + "). Check the permissions of its directory.");
    }
    // What an earlier file has left beside it belongs to that one.
    for (const char* suffix : {"-wal", "-shm"}) std::filesystem::remove(path + suffix, error);
    CXRolvane::Options options;
    options.path = path;
    const CXRolvane made(options);
}

// -- the repair

namespace {

// The tables as they stand, and what each index says of them. Pure but for reading.
class Evidence {
public:
    Evidence(RecordStore& store, const std::string& path) : _store(store), _path(path) {}

    void requireTablesToBeBelieved() {
        readRows();
        readWitnesses();
        compareRows();
        compareLists();
    }

private:
    using Identifiers = std::unordered_map<int64_t, std::string>; // by row number

    [[noreturn]] void unbelievable(const std::string& why) {
        throw CXDamagedDatabase("The contact database " + _path + " is damaged (" + why +
                                "), and rebuilding its indexes does not mend that. It was left as it is. " + kWhatToDo);
    }

    static Value propertiesOf(const RecordStore::TableRow& row) {
        try {
            return BinaryValue::decode(row.properties);
        } catch (const CXException&) {
            return {};
        }
    }

    void readRows() {
        _store.forEachRowOfTable(
            [&](const RecordStore::TableRow& row) {
                const RecordKind named = kindOfTable(cxTableName(UniqueId(row.uid)));
                if (named != row.kind) unbelievable("the record " + row.uid + " is of another kind than its name");
                const Value properties = propertiesOf(row);
                if (!properties.isDictionary()) unbelievable("the record " + row.uid + " cannot be read");
                if (locationOf(row.kind, properties.dictionary()) != row.location)
                    unbelievable("the record " + row.uid + " has two locations");
                _rows.emplace(row.id, row.uid);
            },
            true);
    }

    void readWitnesses() {
        for (const RecordStore::Index index : RecordStore::kIndexesOfRecords) {
            Identifiers known;
            try {
                _store.forEachOfIndex(index, [&](int64_t id, std::string uid) { known.emplace(id, std::move(uid)); });
            } catch (const CXDamagedDatabase&) {
                known.clear(); // it says nothing
            }
            _witnesses.push_back(std::move(known));
        }
    }

    bool knows(const Identifiers& witness, int64_t id, const std::string& uid) {
        const auto found = witness.find(id);
        return found != witness.end() && found->second == uid;
    }

    void compareRows() {
        for (const auto& row : _rows) {
            const auto known = [&](const Identifiers& witness) { return knows(witness, row.first, row.second); };
            if (std::none_of(_witnesses.begin(), _witnesses.end(), known))
                unbelievable("no index knows the record " + row.second);
        }
        std::map<std::pair<int64_t, std::string>, int> missing;
        for (const Identifiers& witness : _witnesses)
            for (const auto& [id, uid] : witness)
                if (!knows(_rows, id, uid) && ++missing[{id, uid}] > 1) unbelievable("the record " + uid + " is lost");
    }

    // Two things say who is listed, the lists and their index. Where they differ, an index that is out of order is
    // wrong, and so is one whose every surplus is of something that is not there.
    void compareLists() {
        const auto lists = _store.listsOfTable();
        const RecordStore::ListsOfIndex index = _store.listsOfIndex();
        if (!index.isReadable || !index.isInOrder) return;
        for (const auto& pair : index.pairs)
            if (!lists.contains(pair) && _rows.contains(pair.first) && _rows.contains(pair.second))
                unbelievable("it is not certain whether " + _rows[pair.second] + " is in the group " +
                             _rows[pair.first]);
    }

    RecordStore& _store;
    const std::string& _path;
    Identifiers _rows;
    std::vector<Identifiers> _witnesses;
};

} // namespace

void repairDatabase(CXRolvane& rolvane) {
    CXRolvane::Impl& d = rolvane.impl();
    std::lock_guard lock(d.mutex);
    d.requireSameFile();
    {
        SqliteTransaction transaction(d.sqlite);
        Evidence(d.store, d.options.path).requireTablesToBeBelieved();
        try {
            d.sqlite.execute("REINDEX");
        } catch (const CXDamagedDatabase&) {
            throw;
        } catch (const CXException& e) { // two rows of one identifier
            throw CXDamagedDatabase(e.reason() + " " + kWhatToDo);
        }
        const std::string found = d.store.whatIsWrong();
        if (!found.empty())
            throw CXDamagedDatabase("The contact database " + d.options.path + " is damaged (" + found +
                                    "), and rebuilding its indexes does not mend that. It was left as it is. " +
                                    kWhatToDo);
        transaction.commit();
    }
    d.sqlite.forgetDamage();
    d.store.noteOwnWrite();
}

} // namespace rolvane
