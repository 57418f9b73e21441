#include "foundation/Preferences.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "foundation/PreferencesFile.h"
#include "foundation/PropertyList.h"

#include <map>
#include <mutex>
#include <set>

#include <fmt/format.h>

namespace rolvane {

struct Preferences::Impl {
    Impl(std::string path, double lockTimeout) : file(std::move(path), lockTimeout) {}

    // The unwritten change of a key, if there is one. With the mutex held.
    const std::optional<Bytes>* unwritten(std::string_view domain, std::string_view key) const {
        auto changes = staged.find(domain);
        if (changes == staged.end()) return nullptr;
        auto change = changes->second.find(key);
        return change == changes->second.end() ? nullptr : &change->second;
    }

    void stage(std::string_view domain, std::string_view key, std::optional<Bytes> bytes) {
        std::lock_guard guard(mutex);
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
                            key, domain, file.path(), e.reason()));
        }
    }

    std::set<std::string> keysWithChanges(std::string_view domain) {
        auto stored = file.keys(domain);
        std::set<std::string> all(stored.begin(), stored.end());
        if (auto changes = staged.find(domain); changes != staged.end())
            for (const auto& [key, bytes] : changes->second) {
                if (bytes)
                    all.insert(key);
                else
                    all.erase(key);
            }
        return all;
    }

    std::mutex mutex; // of everything below
    PreferencesFile file;
    std::map<std::string, PreferencesFile::Changes, std::less<>> staged;
};

Preferences::Preferences(std::string path, double lockTimeoutSeconds)
    : _impl(std::make_unique<Impl>(std::move(path), lockTimeoutSeconds)) {}

Preferences::~Preferences() = default;

Value Preferences::get(std::string_view domain, std::string_view key) const {
    std::optional<Bytes> bytes;
    {
        std::lock_guard guard(_impl->mutex);
        if (auto* change = _impl->unwritten(domain, key))
            bytes = *change;
        else
            bytes = _impl->file.read(domain, key);
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
    std::lock_guard guard(_impl->mutex);
    auto changes = _impl->staged.find(domain);
    if (changes == _impl->staged.end()) return;
    _impl->file.write(domain, changes->second);
    _impl->staged.erase(changes);
}

std::vector<std::string> Preferences::keys(std::string_view domain) const {
    std::lock_guard guard(_impl->mutex);
    auto all = _impl->keysWithChanges(domain);
    return {all.begin(), all.end()};
}

std::vector<std::string> Preferences::domains() const {
    std::lock_guard guard(_impl->mutex);
    auto stored = _impl->file.domains();
    std::set<std::string> all(stored.begin(), stored.end());
    for (const auto& [domain, changes] : _impl->staged) {
        if (_impl->keysWithChanges(domain).empty())
            all.erase(domain);
        else
            all.insert(domain);
    }
    return {all.begin(), all.end()};
}

const std::string& Preferences::path() const {
    return _impl->file.path();
}

Preferences& Preferences::shared() {
    static auto* mutex = new std::mutex;
    static auto* all = new std::map<std::string, std::unique_ptr<Preferences>>;
    std::lock_guard guard(*mutex);
    auto& one = (*all)[stateDirectory() + "/preferences.db"];
    if (!one) one = std::make_unique<Preferences>(stateDirectory() + "/preferences.db");
    return *one;
}

} // namespace rolvane
