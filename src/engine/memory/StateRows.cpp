#include "engine/memory/StateRows.h"

#include "engine/memory/EngineState.h"
#include "foundation/Url.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <array>
#include <string_view>
#include <vector>

namespace rolvane {

namespace {

constexpr std::array kConduits{kConduitCX, kConduitVaultra};

std::string rowOf(const std::string& conduit, const std::string& user, const std::string& group) {
    std::string key = kCXDConduitData;
    for (const std::string& part : {conduit, user, group}) key += "/" + Url::percentEncodeComponent(part);
    return key;
}

// A mark that has been dealt with stays as an empty dictionary, or goes; both say the same.
Dictionary ofContent(const Dictionary& marks) {
    Dictionary content;
    for (const auto& [key, value] : marks)
        if (!value.isDictionary() || !value.dictionaryIf()->empty()) content.set(key, value);
    return content;
}

} // namespace

bool isStateRow(std::string_view key) {
    constexpr std::string_view start = kCXDConduitData;
    return key.starts_with(start) && (key.size() == start.size() || key[start.size()] == '/');
}

StateRows stateRows(const Dictionary& conduitData) {
    StateRows rows;
    Dictionary rest = conduitData.mutableCopy();
    for (const std::string conduit : kConduits) {
        const Value& of = conduitData[conduit];
        if (!of.isDictionary() || !of.dictionary()[kPriorState].isDictionary()) continue;
        Dictionary without = ofContent(of.dictionary());
        Dictionary users;
        for (const auto& [user, groups] : of.dictionary()[kPriorState].dictionary()) {
            users.set(user, Dictionary()); // whoever is known without any group is known
            for (const auto& [group, state] : groups.dictionary()) rows.emplace(rowOf(conduit, user, group), state);
        }
        without.set(kPriorState, users);
        rest.set(conduit, without);
    }
    rows.emplace(kCXDConduitData, rest);
    return rows;
}

Dictionary joinedRows(const StateRows& rows) {
    Dictionary all;
    const auto rest = rows.find(kCXDConduitData);
    if (rest != rows.end() && rest->second.isDictionary()) all = rest->second.deepMutableCopy().dictionary();
    for (const auto& [key, state] : rows) {
        if (!isStateRow(key) || key == kCXDConduitData) continue;
        std::vector<std::string> parts;
        for (size_t at = std::string_view(kCXDConduitData).size(); at != std::string::npos;) {
            const size_t next = key.find('/', at + 1);
            parts.push_back(Url::percentDecode(key.substr(at + 1, next == std::string::npos ? next : next - at - 1)));
            at = next;
        }
        if (parts.size() != 3) continue;
        all.dictionaryFor(parts[0])
            .dictionaryFor(kPriorState)
            .dictionaryFor(parts[1])
            .set(parts[2], state.deepMutableCopy());
    }
    return all;
}

} // namespace rolvane
