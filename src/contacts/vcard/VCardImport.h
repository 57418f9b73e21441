#pragma once

#include "contacts/database/CXRolvane.h"
#include "contacts/records/AlikePeople.h"
#include "contacts/vcard/ImportSource.h"
#include "contacts/vcard/TableCards.h"
#include "contacts/vcard/VCardReader.h"

#include <functional>
#include <istream>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace rolvane {

struct VCardProgress {
    uint64_t bytesDone = 0;
    uint64_t bytesTotal = 0; // 0 when it is not known
    size_t cards = 0;        // good ones so far
};

// Text of a file that was read with a character set that it does not name.
struct VCardForeignText {
    std::string file, charset;
    bool detected = false; // else it was given, or the file is UTF-16
    size_t lines = 0;      // 0: all
};

struct VCardNoteColumns {
    std::string file;
    std::vector<std::string> columns;
};

struct VCardImportReport {
    size_t imported = 0;             // people that were not there
    size_t updated = 0;              // people that were there and changed
    size_t unchanged = 0;            // people that were there and have it all already
    size_t groups = 0;               // groups made or named by the files
    size_t missingMembers = 0;       // members of groups that neither the files nor the database have; kept as names
    size_t doubtful = 0;             // of `imported`: cards without UID beside whom somebody of that name was there
    size_t linesLost = 0;            // lines of good cards that were left out; `notices` name them
    size_t noticeCount = 0;          // `notices` holds the first kVCardErrorsKept
    std::vector<VCardError> notices; // what went in otherwise than it stood: lines kept as they are, cards in doubt
    std::vector<VCardForeignText> foreign;     // files whose text was no UTF-8
    std::vector<VCardNoteColumns> intoTheNote; // tables with columns that people have no place for
    size_t errorCount = 0;                     // all errors; `errors` holds the first kVCardErrorsKept of them
    std::vector<VCardError> errors;
};
inline constexpr size_t kVCardErrorsKept = 10000;

// Puts the cards of files into a contact database: vCards, and the tables and LDIF of TableCards. A card whose UID is
// here updates its person through CXMerger: no value is ever lost. A card without UID is found again by its content
// (CardOwnerFinder); in doubt it is added, and said. Groups come from group cards and from CATEGORIES; they are joined
// when everything is read, so they may stand before their members and in another file of the same import. One import is
// one save, but for inputs above 64 MB, which are saved piecemeal. Bad cards are reported and left out. CXException
// kCXVCardException: a file cannot be read; kCXDatabaseException: as CXRolvane::save. After an exception the people
// read so far are unsaved changes of the database. One thread; the database is borrowed.
class VCardImport {
public:
    using ProgressHandler =
        std::function<void(const VCardProgress&)>; // every 64 KB or so, and at the end of each input

    explicit VCardImport(CXRolvane& rolvane, ProgressHandler onProgress = {}, VCardLimits limits = {});

    void addFile(const std::string& path);
    void addStream(std::istream& in, const std::string& name, uint64_t totalBytes = 0);
    // The character set of text that is no UTF-8 and does not name one; without it such text is examined.
    void setCharset(std::string charset) { _charset = std::move(charset); }
    // Says what would happen: `finish` then drops every change instead of saving.
    void setDryRun(bool dry) { _dryRun = dry; }
    // Joins the groups, saves, and gives the report. Call it once, after the last input.
    VCardImportReport finish();

    // All three in one.
    static VCardImportReport importFile(CXRolvane& rolvane, const std::string& path, ProgressHandler onProgress = {});

private:
    struct Group {
        CXGroupRef record;
        VCardEntity card;
        std::string file;
    };

    void report(const VCardError& error);
    void notice(const std::string& file, size_t line, const std::string& reason);
    void reportNotices(const VCardEntity& card, const std::string& file);
    void addCards(ImportSource& source);
    void addTable(ImportSource& source, TableKind kind);
    std::string textOfTable(ImportSource& source);
    void take(VCardEntity&& card, const std::string& file);
    void takePerson(VCardEntity&& card, const std::string& file);
    CXGroupRef groupOf(const VCardEntity& card) const;
    CXPersonRef ownerOf(const VCardEntity& card, const std::string& file);
    void update(const CXPersonRef& person, const VCardEntity& card);
    void settleMissingMembers();
    void keepCategoryOrder();
    const std::map<std::string, UniqueId>& mergedUIDs() const;
    void takeGroup(VCardEntity&& card, const std::string& file);
    void joinMembers(const Group& group);
    void joinSubgroup(const Group& group, const std::string& uid, const CXGroupRef& subgroup);
    void choose(const Group& group);
    void joinCategories();
    void joinCategory(const CXPersonRef& person, const std::string& name);
    CXPersonRef personForUID(const std::string& uid) const;
    CXGroupRef groupForUID(const std::string& uid) const;
    CXRecordRef recordForUID(const std::string& uid, std::string_view table) const;

    CXRolvane& _rolvane;
    ProgressHandler _onProgress;
    VCardLimits _limits;
    VCardImportReport _report;
    std::vector<Group> _groups;
    std::vector<std::pair<UniqueId, std::vector<std::string>>> _categories;
    std::map<std::string, std::vector<CXGroupRef>> _groupsByName;
    uint64_t _unsavedBytes = 0;
    std::string _charset;
    bool _dryRun = false;
    CardOwnerFinder _owners;
    std::set<UniqueId> _touched;                           // people whom this import has added or changed
    std::map<std::string, UniqueId> _entries;              // of a text whose entries name one another, by their names
    std::map<UniqueId, std::vector<std::string>> _missing; // group -> members without a record
    UniqueId _lastPerson;
    mutable std::optional<std::map<std::string, UniqueId>> _mergedUIDs;
};

} // namespace rolvane
