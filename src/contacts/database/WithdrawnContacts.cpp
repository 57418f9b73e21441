#include "contacts/database/WithdrawnContacts.h"

#include "contacts/vcard/VCardExport.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Paths.h"
#include "foundation/PropertyList.h"
#include "foundation/Url.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr const char* kUser = "User";
constexpr const char* kLocation = "Location";
constexpr const char* kSubscription = "Subscription";
constexpr const char* kDate = "Date";
constexpr const char* kPeople = "People";
constexpr const char* kGroups = "Groups";

std::filesystem::path cardsFile(const std::string& directory, const std::string& name) {
    return std::filesystem::path(directory) / (name + ".vcf");
}
std::filesystem::path recordFile(const std::string& directory, const std::string& name) {
    return std::filesystem::path(directory) / (name + ".plist");
}

[[noreturn]] void fail(const std::string& path, int error) {
    throw CXException(kCXFileException, path + ": " + std::strerror(error));
}

std::optional<Dictionary> entryIn(const std::filesystem::path& file) {
    try {
        const Value value = PropertyList::fromXML(readFile(file));
        if (value.dictionaryIf() && value.dictionary()[kDate].isDate()) return value.dictionary();
    } catch (const CXException& e) {
        CXDLog("A record of withdrawn contacts is left out: %@", e.reason());
    }
    return std::nullopt;
}

void syncFile(const std::string& path, int flags) {
    const int file = ::open(path.c_str(), flags | O_CLOEXEC);
    if (file < 0) fail(path, errno);
    const int error = ::fsync(file) == 0 ? 0 : errno;
    ::close(file);
    if (error) fail(path, error);
}

// Written in pieces, so that photos of very many people never stand in memory together.
void writeCards(CXRolvane& database, const std::vector<UniqueId>& records, const std::filesystem::path& path) {
    const std::string making = path.string() + ".making";
    ::unlink(making.c_str());
    const int made = ::open(making.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
    if (made < 0) fail(making, errno);
    ::close(made);
    try {
        std::ofstream out(making, std::ios::binary | std::ios::trunc);
        if (!out) fail(making, errno);
        VCardExport(database, out, VCardVersion::v4).exportRecords(records);
        out.close();
        if (!out) fail(making, errno ? errno : EIO);
        syncFile(making, O_RDWR);
        if (::rename(making.c_str(), path.c_str()) != 0) fail(path, errno);
        syncFile(path.parent_path(), O_RDONLY | O_DIRECTORY);
    } catch (...) {
        ::unlink(making.c_str());
        throw;
    }
}

} // namespace

WithdrawnContactsFolder::WithdrawnContactsFolder(std::string directory)
    : _directory(directory.empty() ? dataDirectory() + "/withdrawn" : std::move(directory)) {}

// That of the record of the same subscription; else one that neither a record nor cards have yet.
std::string WithdrawnContactsFolder::nameFor(const UserName& user, const std::string& subscription, Date now) const {
    constexpr size_t kLongestUser = 100;
    std::error_code error;
    for (std::filesystem::directory_iterator each(_directory, error), end; !error && each != end;
         each.increment(error)) {
        if (subscription.empty() || each->path().extension() != ".plist") continue;
        const auto entry = entryIn(each->path());
        if (entry && (*entry)[kSubscription].string() == subscription && (*entry)[kUser].string() == user.str())
            return each->path().stem().string();
    }
    std::string date = now.toISO8601();
    std::replace(date.begin(), date.end(), ':', '-');
    const std::string stem = date + "-" + Url::percentEncodeComponent(user.str()).substr(0, kLongestUser);
    const auto isTaken = [&](const std::string& name) {
        return std::filesystem::exists(recordFile(_directory, name)) ||
               std::filesystem::exists(cardsFile(_directory, name));
    };
    std::string name = stem;
    for (int i = 2; isTaken(name); ++i) name = stem + "-" + std::to_string(i);
    return name;
}

WithdrawnContacts WithdrawnContactsFolder::keep(CXRolvane& database, const RemoteLocation& location,
                                                const UserName& user, Date now) {
    CXPathUtils_MakeCompletePath(_directory, 0700);
    const CXSubscriptionRef subscribed = database.findSubscriptionWithRemoteLocation(location);
    const std::string subscription = subscribed ? subscribed->uniqueId().str() : "";
    WithdrawnContacts record{user, location, now, 0, 0, {}, nameFor(user, subscription, now)};
    const std::string path = recordFile(_directory, record.name).string();
    const auto before = std::filesystem::exists(path) ? entryIn(path) : std::nullopt;
    if (before) record.date = (*before)[kDate].date().value_or(now);
    std::vector<UniqueId> uids;
    if (const CXAllGroupRef everybody = database.allGroupForRemoteLocation(location)) {
        uids = everybody->memberUniqueIds();
        record.people = uids.size();
        const std::vector<UniqueId> groups = everybody->subgroupUniqueIds();
        record.groups = groups.size();
        uids.insert(uids.end(), groups.begin(), groups.end());
    }
    // The record comes first: by it a process that is killed while it writes the cards finds them again.
    const Dictionary entry{{kUser, user},
                           {kLocation, location},
                           {kSubscription, subscription},
                           {kDate, record.date},
                           {kPeople, static_cast<int64_t>(record.people)},
                           {kGroups, static_cast<int64_t>(record.groups)}};
    writeFileDurably(path, PropertyList::toXML(entry));
    if (uids.empty()) return record;
    const std::filesystem::path cards = cardsFile(_directory, record.name);
    try {
        writeCards(database, uids, cards);
    } catch (...) {
        if (!before) ::unlink(path.c_str());
        throw;
    }
    record.file = cards.string();
    return record;
}

std::vector<WithdrawnContacts> WithdrawnContactsFolder::list() const {
    std::vector<WithdrawnContacts> all;
    std::error_code error;
    for (std::filesystem::directory_iterator each(_directory, error), end; !error && each != end;
         each.increment(error)) {
        if (each->path().extension() != ".plist") continue;
        const auto entry = entryIn(each->path());
        if (!entry) continue;
        WithdrawnContacts record{UserName((*entry)[kUser].string()),
                                 RemoteLocation((*entry)[kLocation].string()),
                                 *(*entry)[kDate].date(),
                                 static_cast<size_t>(std::max<int64_t>(0, (*entry)[kPeople].integer())),
                                 static_cast<size_t>(std::max<int64_t>(0, (*entry)[kGroups].integer())),
                                 {},
                                 each->path().stem().string()};
        const std::filesystem::path cards = cardsFile(_directory, record.name);
        if (std::filesystem::exists(cards)) record.file = cards.string();
        all.push_back(std::move(record));
    }
    std::sort(all.begin(), all.end(), [](const WithdrawnContacts& a, const WithdrawnContacts& b) {
        return a.date != b.date ? a.date > b.date : a.name > b.name;
    });
    return all;
}

void WithdrawnContactsFolder::forget(const WithdrawnContacts& record) {
    const std::string name = std::filesystem::path(record.name).filename().string();
    if (name.empty()) return;
    ::unlink(cardsFile(_directory, name).c_str());
    ::unlink(recordFile(_directory, name).c_str());
}

} // namespace rolvane
