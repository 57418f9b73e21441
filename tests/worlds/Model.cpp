#include "Model.h"

#include <algorithm>
#include <iterator>
#include <sstream>

namespace rolvane::worlds {

namespace {

// The contact or group that a part of a group is about; "" for other parts.
std::string othersName(const std::string& cell) {
    for (const char* kind : {"Member/", "Group/"})
        if (cell.starts_with(kind)) return cell.substr(std::string(kind).size());
    return {};
}

// A labelled value is told apart by what it says. Two changes of one that did not know of each other stand side by side
// (contacts/records/ContactMerge.h), and each goes when somebody replaces it.
bool isLabelled(const std::string& cell) {
    return cell.starts_with("Phone/");
}

std::set<std::string> marksIn(const std::string& value) {
    std::istringstream text(value);
    return {std::istream_iterator<std::string>(text), {}};
}

} // namespace

void Model::take(const Deed& deed) {
    ++deeds;
    Thing& thing = _things[deed.thing];
    _recent[deed.who].push_back(deed);
    switch (deed.kind) {
    case Deed::Kind::makePerson:
    case Deed::Kind::makeGroup: thing.isGroup = deed.kind == Deed::Kind::makeGroup; return;
    case Deed::Kind::remove:
        thing.removed = true;
        for (const auto& [who, things] : _madeThereAgain)
            if (who != deed.who && things.contains(deed.thing)) thing.cameBack = true;
        return;
    case Deed::Kind::set: break;
    }
    thing.editors.insert(deed.who);
    Cell& cell = thing.cells[deed.cell];
    if (cell.history.empty()) cell.history[""] = 1;
    // A value that was set more than once may have been seen as it was long ago, so it is not certain to be replaced.
    const bool sawThatVery = cell.history[deed.before] == 1;
    if (isLabelled(deed.cell))
        std::erase_if(cell.heads, [&](const Value& head) { return head.text.empty() || head.text == deed.before; });
    else
        std::erase_if(cell.heads, [&](const Value& head) {
            return head.who == deed.who || (sawThatVery && head.text == deed.before);
        });
    if (!cell.heads.empty()) ++conflicts;
    cell.heads.push_back({deed.who, deed.after});
    ++cell.history[deed.after];
}

void Model::settled(char who) {
    _recent[who].clear();
    _madeThereAgain[who].clear();
}

std::vector<Deed> Model::unsettled(char who) const {
    const auto found = _recent.find(who);
    return found == _recent.end() ? std::vector<Deed>{} : found->second;
}

void Model::comeBack(const std::vector<Deed>& unsent, char who) {
    std::map<std::pair<std::string, std::string>, std::string> last;
    std::set<std::string>& made = _madeThereAgain[who];
    for (const Deed& deed : unsent) switch (deed.kind) {
        case Deed::Kind::makePerson:
        case Deed::Kind::makeGroup: made.insert(deed.thing); break;
        case Deed::Kind::remove: made.erase(deed.thing); break;
        case Deed::Kind::set: last[{deed.thing, deed.cell}] = deed.after; break;
        }
    for (const std::string& thing : made) _things[thing].cameBack = _things[thing].removed;
    for (const auto& [part, value] : last) {
        Cell& cell = _things[part.first].cells[part.second];
        if (isLabelled(part.second))
            cell.anything = true;
        else
            cell.heads.push_back({who, value});
    }
}

void Model::refused(char who) {
    for (const Deed& recent : _recent[who]) {
        Thing& thing = _things[recent.thing];
        if (recent.kind == Deed::Kind::set)
            thing.cells[recent.cell].anything = true;
        else
            thing.mayBeMissing = thing.mayBeThere = true;
    }
}

const Model::Thing* Model::known(const std::string& thing) const {
    const auto found = _things.find(thing);
    return found == _things.end() ? nullptr : &found->second;
}

bool Model::mustBeAbsent(const std::string& name) const {
    const Thing* thing = known(name);
    return !thing || (thing->removed && !thing->mayBeThere && !thing->cameBack);
}

// Whether the inner group may have been seen to hold the outer one, over others perhaps: of two people who list two
// groups in each other one has to give way.
bool Model::couldCloseACircle(const std::string& outer, const std::string& inner) const {
    std::set<std::string> seen;
    std::vector<std::string> next{inner};
    while (!next.empty()) {
        const std::string name = next.back();
        next.pop_back();
        if (name == outer) return true;
        if (!seen.insert(name).second) continue;
        if (const Thing* group = known(name))
            for (const auto& [cell, state] : group->cells)
                if (cell.starts_with("Group/") && state.history.contains("1")) next.push_back(othersName(cell));
    }
    return false;
}

bool Model::mayStand(const std::string& name, const Thing& thing, const std::string& cell,
                     const std::string& value) const {
    const Cell& state = thing.cells.at(cell);
    if (const std::string other = othersName(cell); !other.empty()) {
        if (mustBeAbsent(other)) return value.empty();
        const Thing* member = known(other);
        if ((member->mayBeMissing || member->cameBack) && value.empty()) return true;
        if (cell.starts_with("Group/") && value.empty() && couldCloseACircle(name, other)) return true;
    }
    const bool any = state.anything || thing.cameBack || (!mergesProperties && thing.editors.size() > 1);
    if (isLabelled(cell)) {
        const std::set<std::string> marks = marksIn(value);
        std::set<std::string> all;
        for (const Value& head : state.heads)
            if (!head.text.empty()) all.insert(head.text);
        return any ? std::all_of(marks.begin(), marks.end(), [&](const auto& m) { return state.history.contains(m); })
                   : marks == all;
    }
    if (any && state.history.contains(value)) return true;
    return std::any_of(state.heads.begin(), state.heads.end(), [&](const Value& head) { return head.text == value; });
}

void Model::judge(const std::string& name, const Thing& thing, const Cells* there,
                  std::vector<std::string>& out) const {
    if (!there) {
        if (!thing.removed && !thing.mayBeMissing) out.push_back(name + " is missing, and nobody removed it");
        return;
    }
    if (thing.removed && !thing.mayBeThere && !thing.cameBack) {
        out.push_back(name + " is there, and was removed");
        return;
    }
    for (const auto& [cell, state] : thing.cells) {
        const auto found = there->find(cell);
        const std::string value = found == there->end() ? "" : found->second;
        if (mayStand(name, thing, cell, value)) continue;
        std::string wanted;
        for (const Value& head : state.heads) wanted += " \"" + head.text + "\" of " + head.who;
        out.push_back(name + " " + cell + " is \"" + value + "\", not" + wanted);
    }
    for (const auto& [cell, value] : *there)
        if (!value.empty() && !thing.cells.contains(cell))
            out.push_back(name + " " + cell + " is \"" + value + "\", which nobody wrote");
}

std::vector<std::string> Model::differences(const View& view) const {
    std::vector<std::string> out = view.faults;
    for (const auto& [name, thing] : _things) {
        const auto& all = thing.isGroup ? view.groups : view.people;
        const auto found = all.find(name);
        judge(name, thing, found == all.end() ? nullptr : &found->second, out);
    }
    for (const auto* all : {&view.people, &view.groups})
        for (const auto& [name, cells] : *all)
            if (!known(name)) out.push_back(name + " is there, and nobody made it");
    return out;
}

} // namespace rolvane::worlds
