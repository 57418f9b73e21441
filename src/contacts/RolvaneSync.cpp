// What the daemon needs beyond records: the share count and other processes' saves.

#include "contacts/RolvaneImpl.h"
#include "foundation/Preferences.h"

#include <unistd.h>

namespace rolvane {

namespace {

constexpr const char* kShareCountKey = "CXDShareCount";
constexpr const char* kIntentKey = "CXDShareCountIntent"; // {count, identity, token of the latest save}
constexpr int64_t kOwnEntriesKept = 1000;                 // entries of our own that the cursor may leave behind itself

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

int64_t CXRolvane::bumpShareCount(Preferences& preferences) {
    std::lock_guard lock(_impl->mutex);
    save(); // the token below must be of a history that the new count continues
    int64_t count = shareCount() + 1;
    preferences.set(kDaemonDomain, kShareCountKey, count);
    preferences.set(
        kDaemonDomain, kIntentKey,
        Dictionary{{"count", count}, {"identity", _impl->identity}, {"token", _impl->journal.latestToken()}});
    preferences.synchronize(kDaemonDomain);
    setShareCount(count);
    save();
    preferences.remove(kDaemonDomain, kIntentKey);
    preferences.synchronize(kDaemonDomain);
    return count;
}

void CXRolvane::recoverShareCount(Preferences& preferences) {
    std::lock_guard lock(_impl->mutex);
    Value intent = preferences.get(kDaemonDomain, kIntentKey);
    if (intent.isAbsent()) return;
    Dictionary meant = intent.dictionary();
    int64_t count = meant["count"].integer();
    const std::string& token = meant["token"].string();
    // Only the very database whose bump was interrupted, or one that has gone on from there, is completed: a copy of
    // an earlier state lacks the save that the intent names.
    bool sameDatabase = meant["identity"].string() == _impl->identity;
    bool sameHistory = token.empty() || _impl->journal.hasToken(token);
    if (sameDatabase && sameHistory && shareCount() == count - 1) {
        setShareCount(count);
        save();
    }
    preferences.remove(kDaemonDomain, kIntentKey);
    preferences.synchronize(kDaemonDomain);
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
    int64_t from = _impl->cursor();
    int64_t end = _impl->journal.position();
    if (end <= from) return false;
    std::vector<CXJournalEntry> entries = _impl->journal.foreignEntries(from, end, _impl->options.program);
    if (entries.empty()) {
        if (end - from > kOwnEntriesKept) _impl->journal.setCursor(_impl->options.program, end);
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

void CXRolvane::advanceCursorTo(int64_t position, Date scannedSince) {
    std::lock_guard lock(_impl->mutex);
    int64_t from = _impl->cursor();
    std::optional<int64_t> missed =
        _impl->journal.firstForeignNotAfter(from, position, _impl->options.program, scannedSince);
    int64_t to = missed ? *missed - 1 : position;
    if (to > from) _impl->journal.setCursor(_impl->options.program, to);
}

std::vector<CXJournalEntry> CXRolvane::journalEntries(int64_t after, size_t limit) {
    std::lock_guard lock(_impl->mutex);
    return _impl->journal.entries(after, limit);
}

} // namespace rolvane
