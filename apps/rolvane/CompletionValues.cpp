#include "CompletionValues.h"

#include "SafeText.h"
#include "Shares.h"
#include "Subscriptions.h"
#include "ValueNames.h"

#include "conduits/store/ComputersOnStore.h"
#include "contacts/database/DaemonMemory.h"
#include "contacts/database/WithdrawnContacts.h"
#include "contacts/records/RecordKind.h"
#include "foundation/Paths.h"
#include "foundation/Preferences.h"
#include "model/Computers.h"
#include "server/BooksDevices.h"
#include "server/PrivateStore.h"

#include <optional>
#include <set>
#include <unistd.h>

namespace rolvane::cli {

namespace {

constexpr size_t kMostPeople = 200;

// The database as it is; nothing where there is none, as completing makes no files. The daemon is not asked.
class Contacts {
public:
    Contacts() {
        CXRolvane::Options options;
        options.path = dataDirectory() + "/contacts.db";
        options.program = "rolvane";
        options.busyTimeoutMilliseconds = 100;
        if (::access(options.path.c_str(), R_OK | W_OK) == 0) _database.emplace(options);
    }
    explicit operator bool() const { return _database.has_value(); }
    CXRolvane* operator->() { return &*_database; }
    CXRolvane& operator*() { return *_database; }

private:
    std::optional<CXRolvane> _database;
};

std::string trimmed(const std::string& mark) {
    const size_t begin = mark.find_first_not_of(' ');
    return begin == std::string::npos ? "" : mark.substr(begin);
}

std::vector<Offer> offersOf(const std::vector<CXListing>& listings) {
    std::vector<Offer> all;
    for (const CXListing& listing : listings) all.push_back({listing.displayName, trimmed(ownerMark(listing))});
    return all;
}

std::vector<Offer> offersOf(const std::vector<std::string>& names, const char* help = "") {
    std::vector<Offer> all;
    for (const std::string& name : names) all.push_back({name, help});
    return all;
}

std::vector<Offer> publishers() {
    std::vector<Offer> all;
    if (Contacts contacts; contacts)
        for (const CXSubscriptionRef& subscription : subscriptionsToPeople(*contacts))
            all.push_back({publisherOf(subscription->remoteLocation()), "you subscribe to"});
    return all;
}

std::vector<Offer> readers() {
    Contacts contacts;
    return contacts ? offersOf(Shares(*contacts).readers(), "may read your contacts") : std::vector<Offer>();
}

std::string givenOr(const CompletionPoint& point, const char* option, const std::string& otherwise) {
    const auto found = point.given.find(option);
    return found == point.given.end() ? otherwise : found->second;
}

std::vector<Offer> storeUsers(const CompletionPoint& point) {
    const auto saved = PrivateStore::savedOptions(givenOr(point, "directory", ""));
    return saved ? offersOf(PrivateStore(*saved).users(), "of the private store") : std::vector<Offer>();
}

std::vector<Offer> users(const CompletionPoint& point) {
    std::vector<Offer> all = readers();
    for (const auto& more : {publishers(), storeUsers(point)}) all.insert(all.end(), more.begin(), more.end());
    return all;
}

std::vector<Offer> devices(const CompletionPoint& point) {
    std::vector<Offer> all;
    for (const BooksDevice& device : BooksDevices(givenOr(point, "directory", "")).all())
        all.push_back({device.name, ""});
    return all;
}

std::vector<Offer> withdrawn() {
    std::vector<Offer> all;
    for (const WithdrawnContacts& record : WithdrawnContactsFolder().list())
        all.push_back({record.name, record.user.str()});
    return all;
}

std::vector<Offer> conflicts() {
    std::vector<Offer> all;
    if (Contacts contacts; contacts)
        for (const CXConflict& conflict : contacts->conflicts())
            all.push_back({std::to_string(conflict.number), conflict.name + ", " + conflict.merge.property});
    return all;
}

std::vector<Offer> computers() {
    std::vector<Offer> all;
    const Preferences& preferences = Preferences::shared();
    const std::string self = preferences.get(kDaemonDomain, kCXDComputer).dictionary()["id"].string();
    for (const Computer& each : computersOfValue(preferences.get(kDaemonDomain, kCXDComputers)))
        if (each.id != self) all.push_back({each.name, each.seen ? "last there " + each.seen->toISO8601() : ""});
    return all;
}

std::vector<Offer> keys(const CompletionPoint& point) {
    return offersOf(Preferences::shared().keys(givenOr(point, "domain", "net.rolvane.RolvaneManager")));
}

std::vector<Offer> people(const CompletionPoint& point) {
    Contacts contacts;
    return contacts ? offersOf(contacts->peopleBegun(point.begun, kMostPeople)) : std::vector<Offer>();
}

std::vector<Offer> groups() {
    Contacts contacts;
    return contacts ? offersOf(contacts->listGroups(std::nullopt)) : std::vector<Offer>();
}

std::vector<Offer> valuesOf(const std::string& kind, const CompletionPoint& point) {
    if (kind == kPersonValue) return people(point);
    if (kind == kGroupValue) return groups();
    if (kind == kUserValue) return users(point);
    if (kind == kReaderValue) return readers();
    if (kind == kPublisherValue) return publishers();
    if (kind == kStoreUserValue) return storeUsers(point);
    if (kind == kDeviceValue) return devices(point);
    if (kind == kWithdrawnValue) return withdrawn();
    if (kind == kConflictValue) return conflicts();
    if (kind == kComputerValue) return computers();
    if (kind == kKeyValue) return keys(point);
    return {};
}

bool isPlain(const std::string& text) {
    return !text.empty() && shownLine(text) == text;
}

} // namespace

std::vector<Offer> offersOfValues(const std::string& kind, const CompletionPoint& point) {
    std::vector<Offer> all;
    try {
        all = valuesOf(kind, point);
    } catch (const CXException&) { // the command itself will say why
        return {};
    }
    const std::string begun = foldCase(point.begun);
    std::set<std::string> seen;
    std::erase_if(all, [&](const Offer& offer) {
        return !isPlain(offer.text) || !foldCase(offer.text).starts_with(begun) || !seen.insert(offer.text).second;
    });
    for (Offer& offer : all)
        if (!isPlain(offer.help)) offer.help.clear();
    return all;
}

} // namespace rolvane::cli
