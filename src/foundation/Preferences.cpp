#include "foundation/Preferences.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/Paths.h"
#include "foundation/PreferencesFile.h"
#include "foundation/PropertyList.h"

#include <map>
#include <set>

#include <fmt/format.h>

namespace rolvane {

struct Preferences::Impl {
    Impl(std::string place, double lockTimeout) : path(place), file(std::move(place), lockTimeout) {}

    // The unwritten change of a key, if there is one.
    const std::optional<Bytes>* unwritten(std::string_view domain, std::string_view key) const REQUIRES(mutex) {
        auto changes = staged.find(domain);
        if (changes == staged.end()) return nullptr;
        auto change = changes->second.find(key);
        return change == changes->second.end() ? nullptr : &change->second;
    }

    void stage(std::string_view domain, std::string_view key, std::optional<Bytes> bytes) {
        Lock guard(mutex);
        auto changes = staged.try_emplace(std::string(domain)).first;
        changes->second.insert_or_assign(std::string(key), std::move(bytes));
    }

    Value decode(std::string_view domain, std::string_view key, Bytes bytes) const {
        try {
            return BinaryValue::decode(std::move(bytes));
        } catch (const CXException& e) {
            throw CXException(
                kCXArchiveException,
                fmt::format("The value of \"{}\" in the domain \"{}\" of the preferences file \"{}\" is damaged "
                            "({}). It was left as it is. Restore the file from a backup, or delete the value.",
                            key, domain, path, e.reason()));
        }
    }

    bool isKept(std::string_view domain, std::string_view key) const REQUIRES(mutex) {
        return keeper && keeper->keeps(domain, key);
    }

    // Moves what an earlier version left in the file. The removal comes last, so a crash repeats the whole.
    void move() REQUIRES(mutex) {
        if (!keeper || moved) return;
        PreferencesFile::Changes values, removals;
        for (const std::string& key : file.keys(keeper->domain()))
            if (keeper->keeps(keeper->domain(), key)) {
                values.emplace(key, file.read(keeper->domain(), key));
                removals.emplace(key, std::nullopt);
            }
        if (!values.empty()) {
            keeper->write(values);
            file.write(keeper->domain(), removals);
        }
        moved = true;
    }

    bool hasMoved() REQUIRES(mutex) {
        try {
            move();
        } catch (const CXException& e) {
            CXDLog("What the preferences file has of the contact database stays there: %@", e);
            return false;
        }
        return true;
    }

    std::optional<Bytes> read(std::string_view domain, std::string_view key) REQUIRES(mutex) {
        if (!isKept(domain, key)) return file.read(domain, key);
        if (!hasMoved())
            if (auto bytes = file.read(domain, key)) return bytes;
        return keeper->read(key);
    }

    void write(std::string_view domain, PreferencesFile::Changes& changes) REQUIRES(mutex) {
        PreferencesFile::Changes kept;
        for (auto change = changes.begin(); change != changes.end();)
            if (isKept(domain, change->first))
                kept.insert(changes.extract(change++));
            else
                ++change;
        try {
            if (!kept.empty() && !held) {
                move();
                keeper->write(kept);
                kept.clear();
            }
            if (!changes.empty()) {
                file.write(domain, changes);
                changes.clear();
            }
        } catch (...) {
            changes.merge(kept);
            throw;
        }
        changes.merge(kept);
    }

    std::set<std::string> keysWithChanges(std::string_view domain) REQUIRES(mutex) {
        auto stored = file.keys(domain);
        std::set<std::string> all(stored.begin(), stored.end());
        if (keeper && keeper->domain() == domain && hasMoved())
            for (std::string& key : keeper->keys()) all.insert(std::move(key));
        if (auto changes = staged.find(domain); changes != staged.end())
            for (const auto& [key, bytes] : changes->second) {
                if (bytes)
                    all.insert(key);
                else
                    all.erase(key);
            }
        return all;
    }

    const std::string path;
    Mutex mutex;
    PreferencesFile file GUARDED_BY(mutex);
    std::shared_ptr<PreferencesKeeper> keeper GUARDED_BY(mutex);
    bool moved GUARDED_BY(mutex) = false; // the file has nothing of the keeper's any more
    bool held GUARDED_BY(mutex) = false;
    std::map<std::string, PreferencesFile::Changes, std::less<>> staged GUARDED_BY(mutex);
};

Preferences::Preferences(std::string path, double lockTimeoutSeconds)
    : _impl(std::make_unique<Impl>(std::move(path), lockTimeoutSeconds)) {}

Preferences::~Preferences() = default;

Value Preferences::get(std::string_view domain, std::string_view key) const {
    std::optional<Bytes> bytes;
    {
        Lock guard(_impl->mutex);
        if (auto* change = _impl->unwritten(domain, key))
            bytes = *change;
        else
            bytes = _impl->read(domain, key);
    }
    return bytes ? _impl->decode(domain, key, std::move(*bytes)) : Value();
}

void Preferences::set(std::string_view domain, std::string_view key, Value value) {
    if (value.isAbsent()) return remove(domain, key);
    _impl->stage(domain, key, BinaryValue::encode(value));
}

void Preferences::setData(std::string_view domain, std::string_view key, Bytes data) {
    _impl->stage(domain, key, BinaryValue::encodeData(std::move(data)));
}

void Preferences::remove(std::string_view domain, std::string_view key) {
    _impl->stage(domain, key, {});
}

void Preferences::synchronize(std::string_view domain) {
    Lock guard(_impl->mutex);
    auto changes = _impl->staged.find(domain);
    if (changes == _impl->staged.end()) return;
    _impl->write(domain, changes->second);
    if (changes->second.empty()) _impl->staged.erase(changes);
}

void Preferences::keepElsewhere(std::shared_ptr<PreferencesKeeper> keeper) {
    Lock guard(_impl->mutex);
    _impl->keeper = std::move(keeper);
    _impl->moved = false;
}

Preferences::Hold::Hold(Preferences& preferences) : _preferences(preferences) {
    Lock guard(_preferences._impl->mutex);
    _preferences._impl->held = true;
}

Preferences::Hold::~Hold() {
    if (_holds) end();
}

PreferencesChanges Preferences::Hold::changes() const {
    Impl& all = *_preferences._impl;
    Lock guard(all.mutex);
    all.move();
    PreferencesChanges kept;
    if (!all.keeper) return kept;
    if (const auto changes = all.staged.find(all.keeper->domain()); changes != all.staged.end())
        for (const auto& [key, bytes] : changes->second)
            if (all.keeper->keeps(changes->first, key)) kept.emplace(key, bytes);
    return kept;
}

void Preferences::Hold::end() {
    _holds = false;
    Impl& all = *_preferences._impl;
    Lock guard(all.mutex);
    all.held = false;
    if (!all.keeper) return;
    const auto changes = all.staged.find(all.keeper->domain());
    if (changes == all.staged.end()) return;
    std::erase_if(changes->second, [&](const auto& change)
                                       REQUIRES(all.mutex) { return all.keeper->keeps(changes->first, change.first); });
    if (changes->second.empty()) all.staged.erase(changes);
}

std::vector<std::string> Preferences::keys(std::string_view domain) const {
    Lock guard(_impl->mutex);
    auto all = _impl->keysWithChanges(domain);
    return {all.begin(), all.end()};
}

std::vector<std::string> Preferences::domains() const {
    Lock guard(_impl->mutex);
    auto stored = _impl->file.domains();
    std::set<std::string> all(stored.begin(), stored.end());
    if (_impl->keeper && !_impl->keysWithChanges(_impl->keeper->domain()).empty()) all.insert(_impl->keeper->domain());
    for (const auto& [domain, changes] : _impl->staged) {
        if (_impl->keysWithChanges(domain).empty())
            all.erase(domain);
        else
            all.insert(domain);
    }
    return {all.begin(), all.end()};
}

const std::string& Preferences::path() const {
    return _impl->path;
}

Preferences& Preferences::shared() {
    static auto* mutex = new Mutex;
    static auto* all = new std::map<std::string, std::unique_ptr<Preferences>>;
    Lock guard(*mutex);
    auto& one = (*all)[stateDirectory() + "/preferences.db"];
    if (!one) one = std::make_unique<Preferences>(stateDirectory() + "/preferences.db");
    return *one;
}

} // namespace rolvane
