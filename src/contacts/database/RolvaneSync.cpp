// What the daemon needs beyond records: the share count and other processes' saves.

#include "contacts/database/RolvaneImpl.h"

#include "foundation/TestSwitch.h"

#include <algorithm>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr int64_t kOwnEntriesKept = 1000; // entries of our own that the cursor may leave behind itself

} // namespace

// Share count ----------------------------------------------------------------------------------------------------

int64_t CXRolvane::shareCount() {
    std::lock_guard lock(_impl->mutex);
    return _impl->work.shareCount() ? *_impl->work.shareCount() : _impl->store.shareCount();
}

void CXRolvane::setShareCount(int64_t count) {
    std::lock_guard lock(_impl->mutex);
    _impl->work.setShareCount(count);
}

Dictionary CXRolvane::historyMark() {
    std::lock_guard lock(_impl->mutex);
    return {{"identity", databaseIdentity()}, {"token", _impl->journal.latestToken()}};
}

bool CXRolvane::isOfHistory(const Dictionary& mark) {
    std::lock_guard lock(_impl->mutex);
    const std::string& token = mark["token"].string();
    return mark["identity"].string() == databaseIdentity() && (token.empty() || _impl->journal.hasToken(token));
}

void CXRolvane::keepFormerVersions() {
    std::lock_guard lock(_impl->mutex);
    _impl->formerVersions.begin();
}

std::shared_ptr<const Bytes> CXRolvane::formerVersion(const UniqueId& uid, Date at) {
    std::lock_guard lock(_impl->mutex);
    return _impl->formerVersions.of(uid, at);
}

// Two people's edits of one contact -------------------------------------------------------------------------------

std::optional<CXCommonVersion> CXRolvane::commonVersion(const UniqueId& uid) {
    std::lock_guard lock(_impl->mutex);
    const PendingRecord* pending = _impl->work.find(uid);
    const bool isAnother = pending && (pending->deleted || pending->isInsertion()); // than the one that is stored
    std::optional<CXCommonVersion> stored;
    if (!isAnother) stored = _impl->commonVersions.of(uid);
    const auto& unsaved = _impl->work.commonVersions();
    const auto found = unsaved.find(uid);
    if (found == unsaved.end()) return stored;
    CXCommonVersion version{found->second, stored ? stored->edited : std::nullopt};
    if (const auto now = _impl->encoded(uid); now && *now == *version.properties) version = {};
    return version;
}

void CXRolvane::setCommonVersion(const UniqueId& uid, std::shared_ptr<const Bytes> properties) {
    std::lock_guard lock(_impl->mutex);
    _impl->work.setCommonVersion(uid, std::move(properties));
}

void CXRolvane::setSentVersion(const UniqueId& uid, std::shared_ptr<const Bytes> properties) {
    std::lock_guard lock(_impl->mutex);
    _impl->work.setSentVersion(uid, std::move(properties));
}

std::vector<UniqueId> CXRolvane::editedSinceCommon() {
    std::lock_guard lock(_impl->mutex);
    return _impl->commonVersions.edited();
}

void CXRolvane::noteReachedAtOnce(const std::vector<CXReached>& reached) {
    if (reached.empty()) return;
    std::lock_guard lock(_impl->mutex);
    SqliteTransaction transaction(_impl->sqlite);
    for (const CXReached& each : reached) _impl->reachedStore.note(each);
    transaction.commit();
}

std::vector<CXReached> CXRolvane::reached() {
    std::lock_guard lock(_impl->mutex);
    return _impl->reachedStore.all();
}

void CXRolvane::forgetReached(const std::vector<UniqueId>& records) {
    if (records.empty()) return;
    std::lock_guard lock(_impl->mutex);
    SqliteTransaction transaction(_impl->sqlite);
    for (const UniqueId& uid : records) _impl->reachedStore.forget(uid);
    transaction.commit();
}

namespace {

std::vector<CXConflict> dated(CXRolvane::Impl& database, const UniqueId& uid,
                              const std::vector<CXMergeConflict>& conflicts) {
    std::vector<CXConflict> all;
    const auto person = database.handleAs<CXPerson>(uid);
    for (const CXMergeConflict& each : conflicts)
        all.push_back({0, uid, person ? person->displayName() : std::string(), database.clock.now(), each});
    return all;
}

} // namespace

void CXRolvane::noteConflicts(const UniqueId& uid, const std::vector<CXMergeConflict>& conflicts) {
    std::lock_guard lock(_impl->mutex);
    for (CXConflict& each : dated(*_impl, uid, conflicts)) _impl->work.addConflict(std::move(each));
}

void CXRolvane::noteConflictsAtOnce(const UniqueId& uid, const std::vector<CXMergeConflict>& conflicts) {
    if (conflicts.empty()) return;
    std::lock_guard lock(_impl->mutex);
    SqliteTransaction transaction(_impl->sqlite);
    for (const CXConflict& each : dated(*_impl, uid, conflicts)) _impl->conflicts.note(each);
    transaction.commit();
}

std::vector<CXConflict> CXRolvane::conflicts() {
    std::lock_guard lock(_impl->mutex);
    return _impl->conflicts.all();
}

std::optional<CXConflict> CXRolvane::conflict(int64_t number) {
    std::lock_guard lock(_impl->mutex);
    return _impl->conflicts.find(number);
}

bool CXRolvane::forgetConflict(int64_t number) {
    std::lock_guard lock(_impl->mutex);
    SqliteTransaction transaction(_impl->sqlite);
    const bool done = _impl->conflicts.forget(number);
    transaction.commit();
    return done;
}

// Other processes' saves ---------------------------------------------------------------------------------------------

int64_t CXRolvane::Impl::cursor() {
    if (std::optional<int64_t> at = journal.cursor(options.program)) return *at;
    int64_t end = journal.position();
    journal.setCursor(options.program, end);
    return end;
}

bool CXRolvane::deliverExternalChanges() {
    std::unique_lock lock(_impl->mutex);
    if (_impl->delivering) return false;
    _impl->requireSameFile();
    int64_t from = _impl->cursor();
    int64_t end = _impl->journal.position();
    if (end <= from) return false;
    std::vector<CXJournalEntry> entries = _impl->journal.foreignEntries(from, end, _impl->options.program);
    const size_t foreign = entries.size();
    std::erase_if(_impl->scans, [&](const Impl::Scanned& scan) { return scan.position <= from; });
    std::erase_if(entries, [&](const CXJournalEntry& entry) {
        return std::any_of(_impl->scans.begin(), _impl->scans.end(), [&](const Impl::Scanned& scan) {
            return entry.sequence <= scan.position && entry.date > scan.since;
        });
    });
    if (entries.empty()) {
        if (foreign > 0 || end - from > kOwnEntriesKept) _impl->journal.setCursor(_impl->options.program, end);
        return false;
    }
    _impl->delivering = true;
    struct Finally {
        bool& flag;
        std::unique_lock<std::recursive_mutex>& held;
        ~Finally() {
            if (!held.owns_lock()) held.lock();
            flag = false;
        }
    } finally{_impl->delivering, lock};
    Notification notification{kCXDatabaseChangedExternallyNotificationPriv, std::nullopt,
                              joinedChanges(entries, ::getpid())};
    lock.unlock(); // observers may wait for threads of theirs that use the database
    _impl->center.post(notification);
    lock.lock();
    _impl->journal.setCursor(_impl->options.program, end);
    return true;
}

bool CXRolvane::hasExternalChanges() {
    std::lock_guard lock(_impl->mutex);
    return _impl->journal.hasForeignEntries(_impl->cursor(), _impl->options.program);
}

int64_t CXRolvane::journalPosition() {
    std::lock_guard lock(_impl->mutex);
    return _impl->journal.position();
}

int64_t CXRolvane::cursorPosition() {
    std::lock_guard lock(_impl->mutex);
    return _impl->cursor();
}

int64_t CXRolvane::cursorPosition(const std::string& program) {
    std::lock_guard lock(_impl->mutex);
    return _impl->journal.cursor(program).value_or(-1);
}

void CXRolvane::advanceCursorTo(int64_t position, Date scannedSince) {
    std::lock_guard lock(_impl->mutex);
    const Impl::Scanned scan{position, scannedSince};
    if (_impl->oneCommit)
        _impl->moveTo = scan;
    else
        _impl->advanceCursor(scan);
}

void CXRolvane::Impl::advanceCursor(const Scanned& scan) {
    if (isLeftOut("cursor")) return;
    const int64_t from = cursor();
    const std::optional<int64_t> missed =
        journal.firstForeignNotAfter(from, scan.position, options.program, scan.since);
    const int64_t to = missed ? *missed - 1 : scan.position;
    if (to > from) journal.setCursor(options.program, to);
    // Several scans may come before the journal is read again, each with entries of its own that it has captured.
    std::erase_if(scans, [&](const Scanned& former) { return former.position <= to; });
    if (missed) scans.push_back(scan);
}

std::vector<UniqueId> CXRolvane::changedByOthers(int64_t after, int64_t until) {
    std::lock_guard lock(_impl->mutex);
    std::vector<UniqueId> changed;
    if (until <= after) return changed;
    for (const CXJournalEntry& entry : _impl->journal.foreignEntries(after, until, _impl->options.program))
        changed.push_back(entry.uniqueId);
    return changed;
}

std::vector<CXJournalEntry> CXRolvane::journalEntries(int64_t after, size_t limit) {
    std::lock_guard lock(_impl->mutex);
    return _impl->journal.entries(after, limit);
}

} // namespace rolvane
