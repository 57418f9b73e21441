#include "contacts/database/CXRolvane.h"

#include "contacts/database/DamagedDatabase.h"
#include "contacts/database/DatabaseErrors.h"
#include "contacts/database/RolvaneImpl.h"
#include "foundation/Log.h"
#include "foundation/Paths.h"
#include "foundation/PropertyList.h"

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <limits>
#include <span>

namespace rolvane {

namespace {

constexpr int kPage = 500;
constexpr int64_t kBehindAll = std::numeric_limits<int64_t>::max();

CXRolvane::Options filledIn(CXRolvane::Options options) {
    if (options.path.empty()) options.path = dataDirectory() + "/contacts.db";
    options.path = std::filesystem::absolute(options.path).lexically_normal();
    if (options.program.empty()) options.program = program_invocation_short_name;
    std::string directory = std::filesystem::path(options.path).parent_path();
    if (!std::filesystem::exists(directory)) CXPathUtils_MakeCompletePath(directory, 0700);
    return options;
}

} // namespace

CXRolvane::Impl::Impl(CXRolvane& owner, Options given)
    : face(owner), options(filledIn(std::move(given))), clock(options.clock ? *options.clock : Clock::system()),
      center(options.center ? *options.center : NotificationCenter::defaultCenter()),
      sqlite(RecordStore::makeIfMissing(options.path, options.busyTimeoutMilliseconds), options.busyTimeoutMilliseconds,
             throwDatabaseError),
      store(sqlite), journal(sqlite), commonVersions(sqlite), reachedStore(sqlite), conflicts(sqlite),
      formerVersions(sqlite), changeLog(sqlite), identity(store.identity()),
      anchor(std::make_shared<CXRolvane* const>(&owner)) {}

CXRolvane::CXRolvane(Options options) : _impl(std::make_unique<Impl>(*this, std::move(options))) {
    if (!_impl->options.runLoop) return;
    _impl->cursor();
    _impl->watcher = std::make_unique<ChangeWatcher>(*_impl->options.runLoop, _impl->options.distributed,
                                                     _impl->options.path, [this] {
                                                         try {
                                                             deliverExternalChanges();
                                                         } catch (const CXDamagedDatabase& e) {
                                                             CXLog("What other programs have saved waits: %@", e);
                                                         }
                                                     });
    ChangeWatcher::touch(_impl->options.path); // what came while nobody watched is delivered in the first turn
}

CXRolvane::~CXRolvane() = default;

void CXRolvane::Impl::isMissing(const std::string& what) {
    const std::string told =
        "The contact database " + options.path + " is damaged: " + what + " cannot be found in it.";
    sqlite.noteDamage(told);
    throw CXDamagedDatabase(told);
}

// Records --------------------------------------------------------------------------------------------------------

CXAllGroupRef CXRolvane::allGroup() {
    std::lock_guard lock(_impl->mutex);
    CXAllGroupRef group = _impl->handleAs<CXAllGroup>(UniqueId(kCXAllGroupUID));
    if (!group) _impl->isMissing("the list of all contacts");
    return group;
}

CXAllGroupRef CXRolvane::allGroupForRemoteLocation(const RemoteLocation& location) {
    if (location.str() == kCXLocalRemoteLocation) return allGroup();
    if (location.empty()) return nullptr;
    std::lock_guard lock(_impl->mutex);
    std::vector<UniqueId> found = _impl->recordsOf(RecordKind::allSubscribedGroup, location.str());
    return found.empty() ? nullptr : _impl->handleAs<CXAllGroup>(found.front());
}

std::vector<CXSubscriptionRef> CXRolvane::subscriptions() {
    std::lock_guard lock(_impl->mutex);
    std::vector<CXSubscriptionRef> all;
    for (const UniqueId& uid : _impl->recordsOf(RecordKind::subscription, std::nullopt)) {
        all.push_back(_impl->handleAs<CXSubscription>(uid));
        if (!all.back()) _impl->isMissing("the subscription " + uid.str());
    }
    return all;
}

CXSubscriptionRef CXRolvane::findSubscriptionWithRemoteLocation(const RemoteLocation& location) {
    std::lock_guard lock(_impl->mutex);
    std::vector<UniqueId> found = _impl->recordsOf(RecordKind::subscription, location.str());
    return found.empty() ? nullptr : _impl->handleAs<CXSubscription>(found.front());
}

CXRecordRef CXRolvane::recordForUniqueId(const UniqueId& uid) {
    std::lock_guard lock(_impl->mutex);
    return _impl->handle(uid);
}

void CXRolvane::addRecord(const CXRecordRef& record) {
    std::lock_guard lock(_impl->mutex);
    if (!record) throw CXException(kCXInvalidArgumentException, "There is no record to add.");
    if (!record->_isDetached) {
        if (record->rolvane() == this && record->isAttached()) return;
        throw CXException(kCXInvalidArgumentException,
                          record->uniqueId().str() + " was removed or belongs to another database; add a new record.");
    }
    RecordKind fresh = kindOfRecord(*record);
    RecordKind there = _impl->kind(record->uniqueId());
    bool alike = (isPerson(fresh) && isPerson(there)) || (isPlainGroup(fresh) && isPlainGroup(there));
    if (fresh == RecordKind::none || isAllKind(fresh) || (there != RecordKind::none && !alike))
        throw CXException(kCXInvalidArgumentException,
                          record->uniqueId().str() + " cannot be added: the identifier belongs to another record.");
    if (fresh == RecordKind::subscription) {
        RemoteLocation location(locationOf(fresh, record->_detached));
        if (location.empty() || findSubscriptionWithRemoteLocation(location))
            throw CXException(kCXInvalidArgumentException, location.str() + " is subscribed already, or no location.");
        CXMutableMultiValue where;
        where.addValue(location.str(), kCXSubscribeLabel);
        _impl->insert(cxUIDWithTableName(record->uniqueId(), kCXAllSubscribedGroupTable),
                      RecordKind::allSubscribedGroup,
                      {{kCXGroupNameProperty, defaultGroupName(RecordKind::allSubscribedGroup)},
                       {kCXRemoteLocationProperty, where.toValue()}});
    }
    Dictionary properties = record->_detached;
    if (there == RecordKind::none)
        _impl->insert(record->uniqueId(), fresh, properties);
    else if (isPlainGroup(fresh))
        for (const auto& [name, value] : properties) _impl->setProperty(record->uniqueId(), name, value);
    else
        _impl->replaceProperties(record->uniqueId(), properties);
    _impl->adopt(record);
}

bool CXRolvane::removeRecord(const CXRecordRef& record) {
    std::lock_guard lock(_impl->mutex);
    if (!record || record->rolvane() != this) return false;
    return _impl->remove(record->uniqueId());
}

// The unit of work -----------------------------------------------------------------------------------------------

bool CXRolvane::save() {
    std::lock_guard lock(_impl->mutex);
    _impl->save();
    return true;
}

bool CXRolvane::saveIfStill(const std::vector<CXExpected>& expected) {
    std::lock_guard lock(_impl->mutex);
    return _impl->save(expected);
}

bool CXRolvane::hasUnsavedChanges() const {
    std::lock_guard lock(_impl->mutex);
    return !_impl->work.empty();
}

size_t CXRolvane::unsavedSize() const {
    std::lock_guard lock(_impl->mutex);
    return _impl->work.size();
}

void CXRolvane::rollback() {
    std::lock_guard lock(_impl->mutex);
    _impl->work.clear();
}

// Identity -------------------------------------------------------------------------------------------------------

std::string CXRolvane::databaseIdentity() const {
    return _impl->identity;
}
const std::string& CXRolvane::path() const {
    return _impl->options.path;
}
bool CXRolvane::isOfPast() const {
    std::lock_guard lock(_impl->mutex);
    return _impl->sqlite.hasMoved();
}
const std::string& CXRolvane::programName() const {
    return _impl->options.program;
}

// The process's database -----------------------------------------------------------------------------------------

namespace {

struct Shared {
    std::recursive_mutex mutex;
    CXRolvane::Options options;
    std::unique_ptr<CXRolvane> database;
};

Shared& shared() {
    static Shared* lasting = new Shared; // handles in static objects may outlive everything else
    return *lasting;
}

} // namespace

CXRolvane& CXRolvane::sharedRolvane() {
    Shared& s = shared();
    std::lock_guard lock(s.mutex);
    if (!s.database) s.database = std::make_unique<CXRolvane>(s.options);
    return *s.database;
}

CXRolvane& CXRolvane::sharedLocalRolvane() {
    return sharedRolvane();
}

void CXRolvane::configureShared(Options options) {
    Shared& s = shared();
    std::lock_guard lock(s.mutex);
    s.database.reset();
    s.options = std::move(options);
}

void CXRolvane::closeShared() {
    configureShared({});
}

// Sets -----------------------------------------------------------------------------------------------------------

void CXRolvane::forEachPersonModifiedSince(Date date, std::string_view table,
                                           const std::function<void(const CXRow&)>& call) {
    RecordKind wanted = kindOfTable(table);
    if (!isPerson(wanted)) throw CXException(kCXInvalidArgumentException, std::string(table) + " holds no people.");
    std::unique_lock lock(_impl->mutex);
    std::vector<UniqueId> unsaved;
    for (const auto& [uid, record] : _impl->work.inOrder())
        if (!record->deleted && record->kind == wanted && record->touched > date) unsaved.push_back(uid);
    ScanPosition position{date.secondsSince1970(), kBehindAll};
    std::vector<CXRow> rows;
    do {
        rows = _impl->store.scan(wanted, position, kPage, true);
        size_t read = rows.size();
        std::erase_if(rows, [this](const CXRow& r) { return _impl->work.isRecordWithChanges(r.uniqueId); });
        if (_impl->work.changesMemberships())
            for (CXRow& row : rows) row.parentGroups = _impl->parents(row.uniqueId);
        lock.unlock();
        for (const CXRow& row : rows) call(row);
        lock.lock();
        if (read < kPage) break;
    } while (true);
    for (const UniqueId& uid : unsaved) {
        std::optional<CXRow> row = _impl->row(uid, true);
        lock.unlock();
        if (row) call(*row);
        lock.lock();
    }
}

std::optional<CXRow> CXRolvane::personRow(const UniqueId& uid) {
    std::lock_guard lock(_impl->mutex);
    return _impl->row(uid, true);
}

std::vector<UniqueId> CXRolvane::peopleOfTable(std::string_view table) {
    RecordKind wanted = kindOfTable(table);
    if (!isPerson(wanted)) throw CXException(kCXInvalidArgumentException, std::string(table) + " holds no people.");
    std::lock_guard lock(_impl->mutex);
    return _impl->recordsOf(wanted, std::nullopt);
}

void CXRolvane::forEachMember(const CXGroup& group, const std::function<void(const CXRow&)>& call) {
    std::unique_lock lock(_impl->mutex);
    if (!_impl->work.empty()) { // the list itself may have unsaved changes
        std::vector<UniqueId> members = group.memberUniqueIds();
        for (const UniqueId& uid : members) {
            std::optional<CXRow> row = _impl->row(uid, true);
            lock.unlock();
            if (row) call(*row);
            lock.lock();
        }
        return;
    }
    if (!group.isAttached()) return;
    const RecordKind kind = _impl->kind(group.uniqueId());
    const bool isAll = !isPlainGroup(kind);
    const RecordKind people = group.isSubscribed() ? RecordKind::subscribedPerson : RecordKind::person;
    const auto location = group.isSubscribed() ? std::optional(group.remoteLocation().str()) : std::nullopt;
    int64_t position = 0;
    std::vector<CXRow> rows;
    do {
        rows = isAll ? _impl->store.scanByAge(people, location, position, kPage)
                     : _impl->store.scanMembers(group.uniqueId(), position, kPage);
        for (const CXRow& stored : rows) {
            // The callback may have changed something meanwhile.
            const std::optional<CXRow> row = _impl->work.empty() ? stored : _impl->row(stored.uniqueId, true);
            lock.unlock();
            if (row) call(*row);
            lock.lock();
        }
    } while (rows.size() == kPage);
}

std::vector<CXRecordRef> CXRolvane::recordsMatchingSearchElement(const CXSearchElement& element) {
    RecordKind wanted = kindOfTable(element.table);
    if (!isPerson(wanted) && !isPlainGroup(wanted) && wanted != RecordKind::subscription) return {};
    std::lock_guard lock(_impl->mutex);
    std::vector<CXRecordRef> found;
    auto take = [&](const UniqueId& uid) {
        if (element.matches(_impl->property(uid, element.property))) found.push_back(_impl->handle(uid));
    };
    // Behind a date only the rows behind it are read.
    bool byDate = element.property == kCXModificationDateProperty && element.comparison == kCXGreaterThan;
    ScanPosition position{byDate ? element.value.date().value_or(Date()).secondsSince1970()
                                 : -std::numeric_limits<double>::infinity(),
                          byDate ? kBehindAll : 0};
    std::vector<CXRow> rows;
    do {
        rows = _impl->store.scan(wanted, position, kPage, false);
        for (const CXRow& row : rows)
            if (!_impl->work.isRecordWithChanges(row.uniqueId) && !_impl->work.membershipIf(row.uniqueId))
                byDate ? found.push_back(_impl->handle(row.uniqueId)) : take(row.uniqueId);
    } while (rows.size() == kPage);
    std::vector<UniqueId> unsaved;
    for (const auto& [uid, record] : _impl->work.inOrder())
        if (_impl->kind(uid) == wanted) unsaved.push_back(uid);
    for (const auto& [uid, changes] : _impl->work.memberships())
        if (!_impl->work.find(uid) && _impl->kind(uid) == wanted) unsaved.push_back(uid);
    for (const UniqueId& uid : unsaved) take(uid);
    return found;
}

namespace {

struct SortedListing {
    std::string sort;
    CXListing listing;
};

std::vector<CXListing> inOrder(std::vector<SortedListing> lines) {
    std::sort(lines.begin(), lines.end(), [](const SortedListing& a, const SortedListing& b) {
        return std::tie(a.sort, a.listing.uniqueId) < std::tie(b.sort, b.listing.uniqueId);
    });
    std::vector<CXListing> all;
    all.reserve(lines.size());
    for (SortedListing& line : lines) all.push_back(std::move(line.listing));
    return all;
}

std::vector<CXListing> listing(CXRolvane::Impl& d, std::initializer_list<RecordKind> kinds,
                               const std::optional<RemoteLocation>& location, const std::string& text) {
    std::vector<SortedListing> lines;
    auto take = [&](RecordStore::Line line) {
        bool there = !location || line.location == location->str();
        if (there && (text.empty() || line.search.find(text) != std::string::npos))
            lines.push_back({std::move(line.sort), {line.uid, std::move(line.display), RemoteLocation(line.location)}});
    };
    for (RecordKind kind : kinds) {
        d.store.forEachLine(kind, [&](RecordStore::Line line) {
            if (!d.work.isRecordWithChanges(line.uid)) take(std::move(line));
        });
        for (const auto& [uid, record] : d.work.inOrder()) {
            if (d.kind(uid) != kind) continue;
            DerivedColumns columns = deriveColumns(kind, d.properties(uid));
            take({uid, columns.location, columns.display, columns.sort, columns.search});
        }
    }
    return inOrder(std::move(lines));
}

} // namespace

std::vector<CXListing> CXRolvane::listPeople(const std::optional<RemoteLocation>& location, std::string_view text) {
    std::lock_guard lock(_impl->mutex);
    return listing(*_impl, {RecordKind::person, RecordKind::subscribedPerson}, location, cxFoldedForSearch(text));
}

namespace {

bool fits(const CXListing& listing, const std::string& wanted, CXRolvane::Named how) {
    if (how == CXRolvane::Named::byIdentifier) return foldCase(listing.uniqueId.str()).starts_with(wanted);
    const std::string name = foldCase(listing.displayName);
    return how == CXRolvane::Named::whole ? name == wanted : name.find(wanted) != std::string::npos;
}

} // namespace

std::vector<CXListing> CXRolvane::peopleNamed(const std::string& named, Named how) {
    std::lock_guard lock(_impl->mutex);
    if (!_impl->work.empty()) { // what is not saved stands in no index
        auto all = listing(*_impl, {RecordKind::person, RecordKind::subscribedPerson}, std::nullopt, {});
        std::erase_if(all, [&, wanted = foldCase(named)](const CXListing& l) { return !fits(l, wanted, how); });
        return all;
    }
    std::vector<SortedListing> lines;
    if (how != Named::byIdentifier) {
        for (auto& line : _impl->store.linesNamed(named, how == Named::part))
            lines.push_back({std::move(line.sort), {line.uid, std::move(line.display), RemoteLocation(line.location)}});
        return inOrder(std::move(lines));
    }
    for (const UniqueId& uid : _impl->store.peopleWhoseIdentifierBegins(named))
        if (const auto row = _impl->row(uid, false)) {
            const auto columns = deriveColumns(_impl->kind(uid), BinaryValue::decode(*row->encoded).dictionary());
            lines.push_back({columns.sort, {uid, columns.display, row->location}});
        }
    return inOrder(std::move(lines));
}

std::vector<CXListing> CXRolvane::peopleBegun(const std::string& start, size_t most) {
    std::lock_guard lock(_impl->mutex);
    std::vector<CXListing> all;
    for (auto& line : _impl->store.linesBegun(start, most))
        all.push_back({line.uid, std::move(line.display), RemoteLocation(line.location)});
    return all;
}

std::vector<CXListing> CXRolvane::peopleFound(const CXSearchQuery& query) {
    std::lock_guard lock(_impl->mutex);
    std::vector<SortedListing> lines;
    const auto take = [&](RecordStore::Line& line) {
        lines.push_back({std::move(line.sort), {line.uid, std::move(line.display), RemoteLocation(line.location)}});
    };
    for (auto& line : _impl->store.linesFound([&](std::string_view text) { return query.fits(text); }))
        if (!_impl->work.isRecordWithChanges(line.uid)) take(line);
    for (const auto& [uid, record] : _impl->work.inOrder()) {
        if (!isPerson(_impl->kind(uid))) continue;
        DerivedColumns columns = deriveColumns(_impl->kind(uid), _impl->properties(uid));
        RecordStore::Line line{uid, columns.location, columns.display, columns.sort, {}};
        if (query.fits(columns.search)) take(line);
    }
    return inOrder(std::move(lines));
}

void CXRolvane::forEachOf(const std::vector<UniqueId>& uids, const std::function<void(const CXRow&)>& call) {
    for (std::span<const UniqueId> rest = uids; !rest.empty();) {
        const auto page = rest.first(std::min<size_t>(rest.size(), kPage));
        size_t taken = page.size();
        std::unique_lock lock(_impl->mutex);
        std::vector<CXRow> rows;
        if (_impl->work.empty()) {
            rows = _impl->store.rowsOf(page, taken);
        } else {
            for (const UniqueId& uid : page)
                if (auto row = isPerson(_impl->kind(uid)) ? _impl->row(uid, true) : std::nullopt)
                    rows.push_back(std::move(*row));
        }
        rest = rest.subspan(taken);
        lock.unlock();
        for (const CXRow& row : rows) call(row);
    }
}

std::vector<CXListing> CXRolvane::listGroups(const std::optional<RemoteLocation>& location) {
    std::lock_guard lock(_impl->mutex);
    return listing(*_impl, {RecordKind::group, RecordKind::subscribedGroup}, location, {});
}

size_t CXRolvane::countPeople(const std::optional<RemoteLocation>& location) {
    std::lock_guard lock(_impl->mutex);
    std::optional<std::string> of = location ? std::optional(location->str()) : std::nullopt;
    size_t count = 0;
    for (RecordKind kind : {RecordKind::person, RecordKind::subscribedPerson}) count += _impl->countOf(kind, of);
    return count;
}

} // namespace rolvane
