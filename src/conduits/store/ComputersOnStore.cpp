#include "conduits/store/ComputersOnStore.h"

#include "foundation/PropertyList.h"
#include "store/dav/CXDAVManager.h"

namespace rolvane {
namespace {

constexpr const char *kId = "id", *kName = "name", *kSeen = "seen";
constexpr int kMissing = 404;
constexpr int kAnother = 412; // somebody has written meanwhile
constexpr int kTries = 4;
// All who may write in the tree may write this file. Nobody has so many computers, nor such names.
constexpr size_t kMostComputers = 50, kLongestText = 100;

Dictionary entryOf(const Computer& computer) {
    Dictionary entry{{kName, computer.name}};
    if (computer.seen) entry.set(kSeen, *computer.seen);
    return entry;
}

Computer computerOf(const std::string& id, const Dictionary& entry) {
    const std::string& name = entry[kName].string();
    return {id, name.size() <= kLongestText ? name : "a computer", entry[kSeen].date()};
}

std::vector<Computer> computersIn(const Dictionary& file) {
    std::vector<Computer> all;
    for (const auto& [id, entry] : file)
        if (!id.empty() && id.size() <= kLongestText && all.size() < kMostComputers)
            all.push_back(computerOf(id, entry.dictionary()));
    return all;
}

} // namespace

ComputersOnStore::ComputersOnStore(CXDAVManager& manager, const Url& base)
    : _manager(manager), _file(base.cxURLByAppendingComponent(kFile)) {}

std::optional<std::vector<Computer>> ComputersOnStore::read() {
    int code = 0;
    const auto file = _manager.dictionaryAtURL(_file, true, &code);
    if (file) return computersIn(*file);
    return code == kMissing ? std::optional(std::vector<Computer>()) : std::nullopt;
}

std::optional<std::vector<Computer>> ComputersOnStore::put(const Computer& computer) {
    return change(computer.id, entryOf(computer));
}

bool ComputersOnStore::remove(const std::string& id) {
    return change(id, {}).has_value();
}

std::optional<std::vector<Computer>> ComputersOnStore::change(const std::string& id, const Value& entry) {
    for (int tries = 0; tries < kTries; ++tries) {
        int code = 0;
        const auto file = _manager.dictionaryAtURL(_file, true, &code);
        if (!file && code != kMissing) return std::nullopt;
        Dictionary changed = file ? file->mutableCopy() : Dictionary();
        if (!entry && !changed.contains(id)) return computersIn(changed);
        if (entry)
            changed.set(id, entry);
        else
            changed.remove(id);
        if (_manager.write(PropertyList::toXML(changed), _file, true, &code)) return computersIn(changed);
        if (code != kAnother) return std::nullopt;
    }
    return std::nullopt;
}

Array valueOfComputers(const std::vector<Computer>& computers) {
    Array all;
    for (const Computer& computer : computers) {
        Dictionary entry = entryOf(computer);
        entry.set(kId, computer.id);
        all.append(entry);
    }
    return all;
}

std::vector<Computer> computersOfValue(const Value& value) {
    std::vector<Computer> all;
    for (const Value& each : value.array())
        all.push_back(computerOf(each.dictionary()[kId].string(), each.dictionary()));
    return all;
}

} // namespace rolvane
