#include "store/dav/CXDAVManager.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/Paths.h"
#include "store/account/ConfigurationValues.h"
#include "store/dav/CXDAVManagerImpl.h"

#include <cstdlib>
#include <strings.h>

namespace rolvane {

namespace {

Mutex sharedMutex;
std::shared_ptr<CXDAVManager> sharedManager GUARDED_BY(sharedMutex);

// The saved account, or an empty one, with which every operation fails.
CXDAVAccount savedAccount() {
    try {
        if (auto account = CXDAVAccount::load()) return *account;
    } catch (const CXException& e) {
        CXLog("%@", e.reason());
    }
    return {};
}

// A hash of the name will do: it is compared with those of the few databases that a person has had.
VersionMemory::Owner ownerOf(const std::string& database, int64_t passes) {
    uint64_t hash = 0xcbf29ce484222325u; // FNV-1a, which is the same in every run
    for (const char c : database) hash = (hash ^ static_cast<unsigned char>(c)) * 0x100000001b3u;
    return {hash, static_cast<uint64_t>(passes)};
}

std::string versionMemoryPath() {
    try {
        return cacheDirectory() + "/versions";
    } catch (const CXException& e) {
        CXLog("Versions are remembered in memory only: %@", e.reason());
        return {};
    }
}

// What every name in the account's own tree begins with; without an account, what no name begins with.
std::string treeOf(const CXDAVAccount& account) {
    return account.user.empty() ? "\n" : account.baseLocationFor(account.user).absoluteString() + "/";
}

std::string beside(const std::string& versions, const char* name) {
    return versions.empty() ? std::string() : versions.substr(0, versions.rfind('/') + 1) + name;
}

// The user, the store and the kind of the question: another asker may be shown something else.
std::string ownerOf(const CXDAVAccount& account, const char* what) {
    return std::string(what) + "\n" + account.user.str() + "\n" + account.endpoint + "\n" + account.nameHost;
}

bool isSecure(const Url& url) {
    return strcasecmp(url.scheme().c_str(), "https") == 0;
}

void setCode(int* code, int value) {
    if (code) *code = value;
}

} // namespace

CXDAVManager::Impl::Impl(CXDAVAccount account, std::shared_ptr<HttpTransport> transport, CurlTransport* signsIn,
                         std::string versionsPath)
    : versions(versionsPath), session(std::move(account), std::move(transport), signsIn),
      files(session, tokens, versions), structure(session, files), accessLists(session),
      ownTree(treeOf(session.account())),
      groupFile(beside(versionsPath, "groups"), ownerOf(session.account(), "groups 1")),
      _listingFile(beside(versionsPath, "listings"), ownerOf(session.account(), "listings 1")) {}

ListingMemory& CXDAVManager::Impl::listings() {
    std::call_once(_listingsRead, [this] {
        if (!_listings.restore(_listingFile.read())) CXDLog("The memory of listings is not whole.");
    });
    return _listings;
}

GroupCopies& CXDAVManager::Impl::copies() {
    std::call_once(_copiesRead, [this] { files.copies().restore(groupFile.read()); });
    return files.copies();
}

void CXDAVManager::Impl::saveListings(bool atEnd) {
    if (!listings().isWorthSaving(atEnd)) return;
    _listingFile.write(listings().saved());
    listings().wasSaved();
}

void CXDAVManager::Impl::sawTree(const Url& tree) {
    const Lock guard(_treesLock);
    _trees.insert(tree.absoluteString() + "/");
}

void CXDAVManager::Impl::forgetOtherTrees() {
    const Lock guard(_treesLock);
    if (!_trees.empty()) copies().keepOnly(_trees);
}

StoreFiles::Reading CXDAVManager::Impl::read(const Url& name, bool securely) {
    const auto endsATree = [](int code) { return code == 403 || code == 404; };
    StoreFiles::Reading once = files.read(name, securely);
    const Url tree = name.cxURLByDeletingLastComponent();
    const bool isInfo = name.cxLastComponent() == "info" && tree.pathComponents().size() == 3; // "/", user, "Contacts"
    if (!isInfo || !endsATree(once.code)) return once;
    CXDLog("%@ was answered with %d. It is asked once more.", name, once.code);
    if (!session.provesItself()) return {};
    if (tree.absoluteString() + "/" == ownTree) structure.check(true);
    return files.read(name, securely);
}

StoreListing::AskedRef CXDAVManager::Impl::begun(const Url& container) {
    const Lock guard(begunLock);
    const auto found = begunListings.find(container.absoluteString());
    if (found == begunListings.end()) return nullptr;
    auto listing = std::move(found->second);
    begunListings.erase(found);
    return listing;
}

CXDAVManager::CXDAVManager(CXDAVAccount account) : CXDAVManager(std::move(account), VersionsFile()) {}

CXDAVManager::CXDAVManager(CXDAVAccount account, VersionsFile versions) {
    std::shared_ptr<CurlTransport> transport = makeAccountTransport(account);
    CurlTransport* signsIn = transport.get();
    _impl = std::make_shared<Impl>(std::move(account), std::move(transport), signsIn, std::move(versions.path));
}

CXDAVManager::CXDAVManager(CXDAVAccount account, std::shared_ptr<HttpTransport> transport)
    : CXDAVManager(std::move(account), std::move(transport), VersionsFile()) {}

CXDAVManager::CXDAVManager(CXDAVAccount account, std::shared_ptr<HttpTransport> transport, VersionsFile versions)
    : _impl(std::make_shared<Impl>(std::move(account), std::move(transport), nullptr, std::move(versions.path))) {}

CXDAVManager::~CXDAVManager() = default;

const CXDAVAccount& CXDAVManager::account() const {
    return _impl->session.account();
}
HttpTransport& CXDAVManager::transport() {
    return _impl->session.transport();
}

RequestFailures& CXDAVManager::failures() {
    return _impl->session.failures();
}

// ---- the process's own

static std::shared_ptr<CXDAVManager> shared() {
    Lock guard(sharedMutex);
    if (!sharedManager) {
        sharedManager = std::make_shared<CXDAVManager>(savedAccount(), CXDAVManager::VersionsFile{versionMemoryPath()});
        // Now, when the TLS library has put its own end in the list: connections have to be closed before it goes.
        [[maybe_unused]] static const int once = std::atexit([] { CXDAVManager::setDefaultManager(nullptr); });
    }
    return sharedManager;
}

CXDAVManager& CXDAVManager::defaultManager() {
    return *shared();
}

void CXDAVManager::setDefaultManager(std::shared_ptr<CXDAVManager> manager) {
    Lock guard(sharedMutex);
    std::swap(sharedManager, manager);
}

std::string CXDAVManager::vaultraUser() {
    return shared()->account().user.str();
}
std::string CXDAVManager::password() {
    return shared()->_impl->session.password().value_or("");
}
std::string CXDAVManager::ostrelUserAgent() {
    return "Rolvane/" ROLVANE_VERSION;
}

std::string CXDAVManager::vaultraAddress() {
    const auto origins = shared()->account().origins();
    return origins.empty() ? "" : Url(origins.front() + "/").host();
}

bool CXDAVManager::canReachOstrelError(CXDAVError& error) {
    return shared()->canReach(error);
}

Url CXDAVManager::ostrelBaseLocationForOstrelUser(const UserName& user) {
    const auto manager = shared();
    if (manager->account().user.empty()) return {};
    return manager->account().baseLocationFor(user);
}

void CXDAVManager::updateConfigDataIfNeeded() {
    ConfigurationValues::shared().updateIfNeeded();
}

Value CXDAVManager::configValueForKey(const std::string& key, Value defaultValue) {
    return ConfigurationValues::shared().valueForKey(key, std::move(defaultValue));
}

// ---- one client

bool CXDAVManager::canReach(CXDAVError& error, const std::function<void()>& meanwhile) {
    if (account().user.empty()) {
        error = {kCXDAVErrorNoAccount, "There is no account. Set one with: rolvane account set"};
        return false;
    }
    return _impl->session.canReach(error, meanwhile);
}

bool CXDAVManager::write(const std::string& text, const Url& url, bool securely) {
    return write(text, url, securely, nullptr);
}

bool CXDAVManager::write(const std::string& text, const Url& url, bool securely, int* code) {
    const bool isOwn = url.absoluteString().starts_with(_impl->ownTree);
    const int status = _impl->files.write(
        url, text, securely, isOwn ? std::function<bool()>([this] { return _impl->structure.repair(); }) : nullptr);
    setCode(code, status);
    return StoreFiles::succeeded(status);
}

std::optional<Date> CXDAVManager::modDateForURL(const Url& url) {
    return _impl->files.modificationDate(url);
}

std::optional<Dictionary> CXDAVManager::dictionaryAtURL(const Url& url, bool securely, int* code) {
    auto reading = _impl->read(url, securely);
    setCode(code, reading.code);
    return std::move(reading.dictionary);
}

CXDAVManager::Version CXDAVManager::readVersion(const Url& url, bool securely, int* code) {
    auto reading = _impl->files.read(url, securely);
    setCode(code, reading.code);
    return {std::move(reading.dictionary), reading.isKnown, reading.lastModified, reading.failed};
}

void CXDAVManager::expectAbsence(const Url& url, bool securely) {
    _impl->files.expectAbsence(url, securely);
}

bool CXDAVManager::remembersVersion(const Url& url) const {
    return _impl->versions.remembers(url.absoluteString());
}

std::optional<Dictionary> CXDAVManager::dictionaryAtURL(const Url& url, int* errorCode, bool securely) {
    return dictionaryAtURL(url, securely, errorCode);
}

bool CXDAVManager::removeFileAtURL(const Url& url, int* code) {
    const int status = _impl->files.remove(url);
    setCode(code, status);
    return StoreFiles::succeeded(status) || status == 404;
}

bool CXDAVManager::removeDirectoryAndContentsAtURL(const Url& url) {
    return removeFileAtURL(url, nullptr);
}
bool CXDAVManager::createDirectoryAtAURL(const Url& url) {
    return _impl->files.makeCollection(url);
}

std::optional<FileListing> CXDAVManager::infoForFilesInContainer(const Url& url) {
    return infoForFilesInContainerByParts(url, nullptr);
}

std::optional<FileListing> CXDAVManager::infoForFilesInContainerByParts(const Url& url, const ListingPart& part) {
    auto listing = StoreListing(_impl->session, _impl->versions, _impl->listings()).list(url, _impl->begun(url), part);
    if (!listing) return listing;
    _impl->sawTree(url);
    for (const auto& [path, file] : *listing) {
        if (!file.displayName.ends_with("CXGroup")) continue;
        const Url group = url.cxURLByAppendingComponent(file.displayName);
        if (file.isCollection) _impl->files.foundCollection(group);
        if (file.seen)
            _impl->copies().foundUnchanged(group.absoluteString(), _impl->versions.markOf(group.absoluteString()));
    }
    return listing;
}

void CXDAVManager::expectReads(const std::vector<Url>& urls, bool securely) {
    _impl->files.expectReads(urls, securely);
}

void CXDAVManager::expectSomeReads(const std::vector<Url>& urls, bool securely) {
    _impl->files.expectSomeReads(urls, securely);
}

void CXDAVManager::expectListing(const Url& url) {
    auto begun = StoreListing(_impl->session, _impl->versions, _impl->listings()).begin(url);
    const Lock guard(_impl->begunLock);
    _impl->begunListings.insert_or_assign(url.absoluteString(), std::move(begun));
}

bool CXDAVManager::isToBeListed(const Url& tree) const {
    return _impl->session.maySynchronize() && _impl->listings().token(tree).empty();
}

// Nothing of it counts for the versions that are known: what a pass finds out of them is stored with the pass.
std::unique_ptr<ListingMemory> CXDAVManager::listAhead(const Url& tree) {
    VersionMemory unused;
    auto listed = std::make_unique<ListingMemory>();
    return StoreListing(_impl->session, unused, *listed).list(tree) ? std::move(listed) : nullptr;
}

bool CXDAVManager::keepListing(const Url& tree, std::unique_ptr<ListingMemory> listed) {
    if (listed) _impl->listings().takeOver(tree, std::move(*listed));
    return !_impl->listings().token(tree).empty();
}

void CXDAVManager::expectNothing() {
    _impl->files.expectNoReads();
    const Lock guard(_impl->begunLock);
    _impl->begunListings.clear();
}

CXDAVManager::Snapshot::Snapshot(CXDAVManager& manager) : _impl(manager._impl) {
    _impl->copies().beginSnapshot();
}
CXDAVManager::Snapshot::~Snapshot() {
    _impl->copies().endSnapshot();
}

void CXDAVManager::keepSerialNumber(const std::string& serial) {
    _impl->structure.keepSerialNumber(serial);
}
void CXDAVManager::mendOwnTreeOnly(bool mendOnly) {
    _impl->structure.mendOnly(mendOnly);
}
bool CXDAVManager::sanityCheckPublishStructureCreate(bool create) {
    return !account().user.empty() && _impl->structure.check(create);
}
std::optional<CXDAVManager::TreeMark> CXDAVManager::markOfTree(const Url& tree, bool ask) {
    if (ask) {
        StoreListing::AskedRef begun = _impl->begun(tree);
        if (!StoreListing(_impl->session, _impl->versions, _impl->listings()).bringUpToDate(tree, begun))
            return std::nullopt;
        _impl->sawTree(tree);
        const Lock guard(_impl->begunLock);
        _impl->begunListings.insert_or_assign(tree.absoluteString(), std::move(begun));
    }
    const uint64_t listing = _impl->listings().stateOf(tree);
    return listing == 0 ? std::nullopt : std::optional(TreeMark{listing, _impl->versions.changes()});
}

std::optional<FileListing> CXDAVManager::contactsChangedSince(const Url& tree, const TreeMark& mark,
                                                              const std::vector<Url>& others) {
    StoreListing::AskedRef asked;
    {
        const Lock guard(_impl->begunLock);
        const auto found = _impl->begunListings.find(tree.absoluteString());
        if (found != _impl->begunListings.end()) asked = found->second;
    }
    return StoreListing(_impl->session, _impl->versions, _impl->listings())
        .contactsChangedSince(tree, asked, {mark.listing, mark.versions, others});
}

std::map<std::string, Date> CXDAVManager::datesOfTree(const Url& tree) {
    std::map<std::string, Date> dates;
    _impl->listings().forEach(tree, ListingMemory::kSynced, [&](const ListingMemory::Member& member) {
        if ((member.encodedName == "info" || member.encodedName == "dateFile") && member.entry.lastModified)
            dates.emplace(member.encodedName, *member.entry.lastModified);
    });
    return dates;
}

bool CXDAVManager::knowsPublishStructure() const {
    return _impl->structure.isKnown();
}

std::optional<bool> CXDAVManager::keepsAccessLists() {
    return _impl->session.keepsAccessLists();
}

bool CXDAVManager::ACLsAtURL(const Url& url, std::vector<std::string>& readers, std::vector<std::string>& writers) {
    auto found = _impl->accessLists.read(url, isSecure(url));
    if (!found) return false;
    readers = std::move(found->readers);
    writers = std::move(found->writers);
    return true;
}

bool CXDAVManager::setACLsWithReadPrincipals(const std::vector<std::string>& readers,
                                             const std::vector<std::string>& writers, const Url& url) {
    return _impl->accessLists.set(url, isSecure(url), {readers, writers});
}

void CXDAVManager::useVersionMemoryOf(const std::string& database, int64_t passes) {
    _impl->versions.belongTo(ownerOf(database, passes));
    _impl->isOfDaemon = true;
}
void CXDAVManager::saveVersionMemory(const std::string& database, int64_t passes) {
    _impl->versions.save(ownerOf(database, passes));
    _impl->saveListings(false);
}
void CXDAVManager::revertVersionMemory() {
    _impl->versions.revert();
    _impl->listings().forgetAll();
    _impl->copies().forgetAll(); // of versions that count as not seen
}
// The marks of versions stand in the file of versions. So a copy that is newer than that file counts for nothing.
void CXDAVManager::processEnds() const noexcept try {
    if (!_impl->isOfDaemon) return;
    _impl->saveListings(true);
    _impl->forgetOtherTrees();
    if (!_impl->copies().hasChanged()) return;
    _impl->groupFile.write(
        _impl->copies().saved([this](const std::string& name) { return _impl->versions.markOf(name); }));
} catch (const std::exception& e) {
    CXLog("What is remembered of the store could not be kept: %@", e.what());
}

void CXDAVManager::forgetVersion(const Url& url) {
    _impl->versions.forget(url.absoluteString());
}
void CXDAVManager::networkChanged() {
    _impl->session.transport().networkChanged();
}
void CXDAVManager::abortAll() {
    _impl->session.transport().abortAll();
}

} // namespace rolvane
