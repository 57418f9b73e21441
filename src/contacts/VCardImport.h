#pragma once

#include "contacts/CXRolvane.h"
#include "contacts/VCardReader.h"

#include <functional>
#include <istream>
#include <map>
#include <string>
#include <vector>

namespace rolvane {

struct VCardProgress {
    uint64_t bytesDone = 0;
    uint64_t bytesTotal = 0; // 0 when it is not known
    size_t cards = 0;        // good ones so far
};

struct VCardImportReport {
    size_t imported = 0;       // people that were not there
    size_t updated = 0;        // people that were there and changed
    size_t unchanged = 0;      // people that were there and have it all already
    size_t groups = 0;         // groups made or named by the files
    size_t missingMembers = 0; // members of groups that neither the files nor the database have
    size_t errorCount = 0;     // all errors; `errors` holds the first kVCardErrorsKept of them
    std::vector<VCardError> errors;
};
inline constexpr size_t kVCardErrorsKept = 10000;

// Puts the cards of files into a contact database. A card whose UID is here updates its person through CXMerger: no
// value is ever lost. Groups come from group cards and from CATEGORIES; they are joined when everything is read, so
// they may stand before their members and in another file of the same import. One import is one save, but for inputs
// above 64 MB, which are saved piecemeal.
// Bad cards are reported and left out. CXException kCXVCardException: a file cannot be read; kCXDatabaseException: as
// CXRolvane::save. After an exception the people read so far are unsaved changes of the database.
// One thread; the database is borrowed.
class VCardImport {
public:
    using ProgressHandler =
        std::function<void(const VCardProgress&)>; // every 64 KB or so, and at the end of each input

    explicit VCardImport(CXRolvane& rolvane, ProgressHandler onProgress = {}, VCardLimits limits = {});

    void addFile(const std::string& path);
    void addStream(std::istream& in, const std::string& name, uint64_t totalBytes = 0);
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
    void takePerson(VCardEntity&& card);
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
};

} // namespace rolvane
