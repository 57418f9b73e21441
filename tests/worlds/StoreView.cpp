#include "StoreView.h"

#include "Editor.h"
#include "conduits/PublishedLayout.h"
#include "contacts/records/CXMultiValue.h"
#include "contacts/records/Constants.h"
#include "foundation/CXException.h"
#include "foundation/PropertyList.h"
#include "store/dav/CXDAVManager.h"

#include <algorithm>
#include <array>
#include <filesystem>
#include <fstream>
#include <iterator>

namespace rolvane::worlds {

namespace {

namespace fs = std::filesystem;

Dictionary contentOf(const fs::path& file, View& view) {
    std::ifstream in(file, std::ios::binary);
    const std::string text{std::istreambuf_iterator<char>(in), {}};
    try {
        return PropertyList::fromXML(text).dictionary();
    } catch (const CXException&) {
        view.faults.push_back("the store's " + file.filename().string() + " cannot be read");
        return {};
    }
}

Cells personCells(const std::string& name, const Dictionary& content, std::vector<std::string>& faults) {
    Cells cells;
    for (const char* property : {kCXFirstNameProperty, kCXLastNameProperty, kCXOrganizationProperty,
                                 kCXNicknameProperty, kCXNoteProperty, kCXJobTitleProperty})
        if (content[property]) cells[property] = content[property].string();
    readPhones(CXMultiValue::fromValue(content[kCXPhoneProperty]), name + " on the store", cells, faults);
    return cells;
}

void readPeople(const fs::path& people, View& view) {
    std::error_code none;
    for (const auto& entry : fs::recursive_directory_iterator(people, none)) {
        if (entry.is_directory()) continue;
        const std::string name = entry.path().filename().string();
        if (!name.ends_with(":CXPerson"))
            view.faults.push_back("the store has the file " + entry.path().lexically_relative(people).string());
        else if (!view.people.emplace(name, personCells(name, contentOf(entry.path(), view), view.faults)).second)
            view.faults.push_back("the store has " + name + " twice");
    }
}

fs::path stateOf(const fs::path& group) {
    return fs::is_directory(group) ? group / CXDAVManager::kStateName : group;
}

void readGroup(const std::string& name, const fs::path& path, View& view) {
    const Dictionary state = contentOf(stateOf(path), view);
    Cells& cells = view.groups[name];
    cells["Name"] = state["GroupName"].string();
    for (const auto& [key, kind] : {std::pair{"memberUIDState", "Member/"}, std::pair{"subgroupUIDState", "Group/"}})
        for (const Value& listed : state[key].array())
            if (!cells.emplace(kind + listed.string(), "1").second)
                view.faults.push_back("the store lists " + listed.string() + " twice in " + name);
    if (!fs::is_directory(path)) return;
    for (const auto& entry : fs::directory_iterator(path)) {
        const std::string inside = entry.path().filename().string();
        if (inside != CXDAVManager::kStateName && inside != layout::kInfo && !inside.ends_with(":CXPerson"))
            view.faults.push_back("the store has the file " + name + "/" + inside);
    }
}

// The list of everybody names each contact and each group once, and nobody else.
void judgeList(const fs::path& path, View& view) {
    const Dictionary state = contentOf(stateOf(path), view);
    const auto judge = [&](const char* key, const std::map<std::string, Cells>& there) {
        std::multiset<std::string> listed;
        for (const Value& each : state[key].array()) listed.insert(each.string());
        for (const std::string& each : listed) {
            if (!there.contains(each))
                view.faults.push_back("the list of everybody names " + each + ", who is not there");
            if (listed.count(each) > 1) view.faults.push_back("the list of everybody names " + each + " twice");
        }
        for (const auto& [each, cells] : there)
            if (!listed.contains(each)) view.faults.push_back("the list of everybody does not name " + each);
    };
    judge("memberUIDState", view.people);
    judge("subgroupUIDState", view.groups);
}

} // namespace

View viewOfStore(const std::string& tree, const std::set<std::string>& furtherFiles) {
    View view;
    const fs::path root(tree);
    readPeople(root / layout::kPeople, view);
    std::error_code none;
    for (const auto& entry : fs::directory_iterator(root, none)) {
        const std::string name = entry.path().filename().string();
        if (name.ends_with(":CXGroup"))
            readGroup(name, entry.path(), view);
        else if (name != layout::kPeople && name != layout::kInfo && name != layout::kDateFile &&
                 name != layout::kAllGroup && !furtherFiles.contains(name))
            view.faults.push_back("the store has the file " + name);
    }
    judgeList(root / layout::kAllGroup, view);
    return view;
}

} // namespace rolvane::worlds
