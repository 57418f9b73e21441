#include "Editor.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <numeric>
#include <set>

namespace rolvane::worlds {

namespace {

constexpr std::array kTexts{kCXFirstNameProperty, kCXLastNameProperty, kCXOrganizationProperty,
                            kCXNicknameProperty,  kCXNoteProperty,     kCXJobTitleProperty};

std::string shared(const UniqueId& uid) {
    return cxNormalizedUID(uid).str();
}
// A phone is written "<the mark it was made with>/<the mark it has now>".
std::string rootOf(const std::string& phone) {
    return phone.substr(0, phone.find('/'));
}
std::string markOf(const std::string& phone) {
    return phone.substr(std::min(phone.find('/') + 1, phone.size()));
}

Cells cellsOf(const CXPerson& person, std::vector<std::string>& faults) {
    Cells cells;
    for (const char* property : kTexts)
        if (const Value text = person.valueForProperty(property)) cells[property] = text.string();
    readPhones(person.multiValueForProperty(kCXPhoneProperty), shared(person.uniqueId()), cells, faults);
    return cells;
}

Cells cellsOf(const CXGroup& group, std::vector<std::string>& faults) {
    Cells cells{{"Name", group.name()}};
    for (const UniqueId& member : group.memberUniqueIds())
        if (!cells.emplace("Member/" + shared(member), "1").second)
            faults.push_back(shared(member) + " is twice in " + shared(group.uniqueId()));
    for (const UniqueId& inner : group.subgroupUniqueIds())
        if (!cells.emplace("Group/" + shared(inner), "1").second)
            faults.push_back(shared(inner) + " is twice in " + shared(group.uniqueId()));
    return cells;
}

} // namespace

void readPhones(const std::optional<CXMultiValue>& phones, const std::string& whose, Cells& cells,
                std::vector<std::string>& faults) {
    if (!phones) return;
    std::map<std::string, std::set<std::string>> marks; // by root; two where two people have changed one
    for (const auto& phone : phones->entries())
        if (!marks[rootOf(phone.value.string())].insert(markOf(phone.value.string())).second)
            faults.push_back(whose + " has " + phone.value.string() + " twice");
    for (const auto& [root, all] : marks) {
        std::string& cell = cells["Phone/" + root];
        for (const std::string& mark : all) cell += (cell.empty() ? "" : " ") + mark;
    }
}

View Editor::view(CXRolvane& database, const RemoteLocation& location) {
    View view;
    for (const CXListing& each : database.listPeople(location)) {
        const auto person = std::dynamic_pointer_cast<CXPerson>(database.recordForUniqueId(each.uniqueId));
        const std::string name = shared(each.uniqueId);
        if (!view.people.emplace(name, cellsOf(*person, view.faults)).second) view.faults.push_back(name + " twice");
        Dictionary properties = person->dictionaryRepresentation().mutableCopy();
        properties.remove(kCXRemoteLocationProperty);
        view.whole[name] = Value(properties).description();
    }
    for (const CXListing& each : database.listGroups(location)) {
        const auto group = std::dynamic_pointer_cast<CXGroup>(database.recordForUniqueId(each.uniqueId));
        const std::string name = shared(each.uniqueId);
        if (!view.groups.emplace(name, cellsOf(*group, view.faults)).second) view.faults.push_back(name + " twice");
        for (const auto& [cell, value] : view.groups[name]) view.whole[name] += cell + "=" + value + " ";
        std::map<std::string, std::string> choices;
        for (const auto& [member, chosen] : group->distributionChoices())
            for (const auto& [property, identifier] : chosen)
                choices[shared(member) + " uses"] += " " + property + "/" + identifier;
        for (const auto& [member, text] : choices) view.whole[name] += member + text + " ";
    }
    return view;
}

std::vector<CXPersonRef> Editor::people() const {
    std::vector<CXPersonRef> all;
    for (const CXListing& each : _database.listPeople(_location))
        if (auto person = std::dynamic_pointer_cast<CXPerson>(_database.recordForUniqueId(each.uniqueId)))
            all.push_back(person);
    std::sort(all.begin(), all.end(), [](const auto& a, const auto& b) { return a->uniqueId() < b->uniqueId(); });
    return all;
}

std::vector<CXGroupRef> Editor::groups() const {
    std::vector<CXGroupRef> all;
    for (const CXListing& each : _database.listGroups(_location))
        if (auto group = std::dynamic_pointer_cast<CXGroup>(_database.recordForUniqueId(each.uniqueId)))
            all.push_back(group);
    std::sort(all.begin(), all.end(), [](const auto& a, const auto& b) { return a->uniqueId() < b->uniqueId(); });
    return all;
}

CXPersonRef Editor::anybody() {
    const auto all = people();
    return all.empty() ? nullptr : _chance.oneOf(all);
}

CXGroupRef Editor::anyGroup() {
    const auto all = groups();
    return all.empty() ? nullptr : _chance.oneOf(all);
}

std::string Editor::freshMark() {
    return _who + _stamp + "." + std::to_string(++_count);
}

UniqueId Editor::freshName(std::string_view table) {
    const std::string mark = freshMark();
    const uint64_t a = hashOf(mark, _chance.next()), b = hashOf(mark, a);
    std::array<char, 40> text{};
    std::snprintf(text.data(), text.size(), "%08X-%04X-4%03X-8%03X-%012llX", static_cast<unsigned>(a >> 32),
                  static_cast<unsigned>(a >> 16) & 0xffff, static_cast<unsigned>(a) & 0xfff,
                  static_cast<unsigned>(b >> 48) & 0xfff, static_cast<unsigned long long>(b & 0xffffffffffff));
    return UniqueId(std::string(text.data()) + ":" + std::string(table));
}

void Editor::placeHere(CXRecord& record) {
    if (_location.str().empty()) return;
    CXMutableMultiValue where;
    where.addValue(_location.str(), kCXSubscribeLabel);
    record.setValue(where, kCXRemoteLocationProperty);
}

void Editor::note(Deed::Kind kind, const CXRecord& record, std::string cell, std::string before, std::string after) {
    _unsaved.push_back({kind, _who, shared(record.uniqueId()), std::move(cell), std::move(before), std::move(after)});
}

void Editor::save() {
    const std::lock_guard guard(_report.whole());
    _database.save();
    for (const Deed& deed : _unsaved) _report.deed(deed);
    _unsaved.clear();
}

void Editor::makeAtFirst(size_t people, size_t groups) {
    for (size_t i = 0; i < people; ++i) makePerson();
    for (size_t i = 0; i < groups; ++i) makeGroup();
    save();
}

void Editor::edit(const Habits& habits) {
    const std::vector<Kind> kinds{{habits.text, [&] { setText(); }},
                                  {habits.phone, [&] { changePhones(); }},
                                  {habits.make, [&] { makePerson(); }},
                                  {habits.remove, [&] { removeAnybody(habits.leaveOne); }},
                                  {habits.makeGroup, [&] { makeGroup(); }},
                                  {habits.removeGroup, [&] { remove(anyGroup()); }},
                                  {habits.rename, [&] { rename(); }},
                                  {habits.join, [&] { join(anyGroup(), anybody()); }},
                                  {habits.leave, [&] { leave(); }},
                                  {habits.nest, [&] { nest(anyGroup(), anyGroup()); }},
                                  {habits.unnest, [&] { unnest(false); }},
                                  {habits.turn, [&] { unnest(true); }},
                                  {habits.leaveOne ? 0 : habits.removeAll, [&] { removeAll(); }}};
    const size_t weights = std::accumulate(kinds.begin(), kinds.end(), size_t(0),
                                           [](size_t sum, const Kind& k) { return sum + k.weight; });
    for (size_t i = _chance.between(1, habits.most); i > 0; --i) {
        size_t at = _chance.below(weights);
        for (const Kind& kind : kinds) {
            if (at < kind.weight) {
                kind.make();
                break;
            }
            at -= kind.weight;
        }
    }
    // With a chance of its own: worlds without such choices stay the same else.
    Chance chance(hashOf("choose", hashOf(_stamp, _count)));
    if (chance.happens(habits.choose)) choose(chance);
    save();
}

void Editor::makePeople(size_t count) {
    for (size_t i = 0; i < count; ++i) makePerson();
    save();
}

void Editor::changePhoneOfThose(const std::string& stamp) {
    for (const CXPersonRef& person : people())
        if (wasMadeWith(person->valueForProperty(kCXFirstNameProperty).string(), stamp)) changePhone(*person);
    save();
}

void Editor::takeBack(const std::string& stamp) {
    for (const CXGroupRef& group : groups())
        if (wasMadeWith(group->name(), stamp)) remove(group);
    for (const CXPersonRef& person : people())
        if (wasMadeWith(person->valueForProperty(kCXFirstNameProperty).string(), stamp)) remove(person);
    save();
}

bool Editor::wasMadeWith(const std::string& mark, const std::string& stamp) const {
    return mark.find(stamp + ".") == 1; // behind the letter of the one who made it
}

void Editor::setText() {
    const CXPersonRef person = anybody();
    if (!person) return;
    const char* property = kTexts[_chance.below(kTexts.size())];
    const std::string before = person->valueForProperty(property).string();
    const std::string after = _chance.happens(0.1) && property != kTexts[0] ? "" : freshMark();
    if (before == after) return;
    after.empty() ? person->removeValueForProperty(property) : person->setValue(Value(after), property);
    note(Deed::Kind::set, *person, property, before, after);
}

void Editor::addPhone(CXPerson& person) {
    CXMutableMultiValue phones(person.multiValueForProperty(kCXPhoneProperty).value_or(CXMultiValue()));
    const std::string mark = freshMark();
    phones.addValue(mark + "/" + mark, _chance.happens(0.5) ? kCXHomeLabel : kCXWorkLabel);
    person.setValue(phones, kCXPhoneProperty);
    note(Deed::Kind::set, person, "Phone/" + mark, "", mark);
}

void Editor::changePhones() {
    const CXPersonRef person = anybody();
    if (!person) return;
    CXMutableMultiValue phones(person->multiValueForProperty(kCXPhoneProperty).value_or(CXMultiValue()));
    if (phones.empty() || _chance.happens(0.4)) return addPhone(*person);
    const size_t at = _chance.below(phones.count());
    const std::string was = phones.valueAtIndex(at).string();
    const std::string after = _chance.happens(0.4) ? "" : freshMark();
    if (after.empty())
        phones.removeAtIndex(at);
    else
        phones.replaceValueAtIndex(at, Value(rootOf(was) + "/" + after));
    person->setValue(phones, kCXPhoneProperty);
    note(Deed::Kind::set, *person, "Phone/" + rootOf(was), markOf(was), after);
}

void Editor::changePhone(CXPerson& person) {
    CXMutableMultiValue phones(person.multiValueForProperty(kCXPhoneProperty).value_or(CXMultiValue()));
    if (phones.empty()) return;
    const std::string was = phones.valueAtIndex(0).string(), after = freshMark();
    phones.replaceValueAtIndex(0, Value(rootOf(was) + "/" + after));
    person.setValue(phones, kCXPhoneProperty);
    note(Deed::Kind::set, person, "Phone/" + rootOf(was), markOf(was), after);
}

void Editor::makePerson() {
    const bool own = _location.str().empty();
    const auto person = CXPerson::initWithUniqueId(freshName(own ? kCXPersonTable : kCXSubscribedPersonTable));
    placeHere(*person);
    _database.addRecord(person);
    note(Deed::Kind::makePerson, *person);
    const std::string first = freshMark();
    person->setValue(Value(first), kCXFirstNameProperty);
    note(Deed::Kind::set, *person, kCXFirstNameProperty, "", first);
    addPhone(*person);
    if (_chance.happens(0.4)) join(anyGroup(), person);
}

void Editor::remove(const CXRecordRef& record) {
    if (!record) return;
    note(Deed::Kind::remove, *record);
    _database.removeRecord(record);
}

void Editor::removeAnybody(bool leaveOne) {
    if (!leaveOne || people().size() > 1) remove(anybody());
}

void Editor::removeAll() {
    for (const CXPersonRef& person : people()) {
        remove(person);
        if (_chance.happens(0.5)) save();
    }
}

void Editor::makeGroup() {
    const bool own = _location.str().empty();
    const auto group = CXGroup::initWithUniqueId(freshName(own ? kCXGroupTable : kCXSubscribedGroupTable));
    placeHere(*group);
    _database.addRecord(group);
    note(Deed::Kind::makeGroup, *group);
    const std::string name = freshMark();
    group->setValue(Value(name), kCXGroupNameProperty);
    note(Deed::Kind::set, *group, "Name", "", name);
    for (size_t i = _chance.below(3); i > 0; --i) join(group, anybody());
}

void Editor::rename() {
    const CXGroupRef group = anyGroup();
    if (!group) return;
    const std::string before = group->name(), after = freshMark();
    group->setValue(Value(after), kCXGroupNameProperty);
    note(Deed::Kind::set, *group, "Name", before, after);
}

void Editor::join(const CXGroupRef& group, const CXPersonRef& person) {
    if (group && person && group->addMember(person))
        note(Deed::Kind::set, *group, "Member/" + shared(person->uniqueId()), "", "1");
}

void Editor::leave() {
    const CXGroupRef group = anyGroup();
    if (!group) return;
    const auto members = group->members();
    if (members.empty()) return;
    const CXPersonRef& person = _chance.oneOf(members);
    if (group->removeMember(person)) note(Deed::Kind::set, *group, "Member/" + shared(person->uniqueId()), "1", "");
}

bool Editor::nest(const CXGroupRef& outer, const CXGroupRef& inner) {
    if (!outer || !inner || !outer->mayListSubgroup(inner) || !outer->addSubgroup(inner)) return false;
    note(Deed::Kind::set, *outer, "Group/" + shared(inner->uniqueId()), "", "1");
    return true;
}

void Editor::unnest(bool turned) {
    for (const CXGroupRef& outer : groups()) {
        const auto inner = outer->subgroups();
        if (inner.empty() || _chance.happens(0.3)) continue;
        const CXGroupRef out = _chance.oneOf(inner);
        outer->removeSubgroup(out);
        note(Deed::Kind::set, *outer, "Group/" + shared(out->uniqueId()), "1", "");
        if (turned) nest(out, outer);
        return;
    }
}

// The model does not know of it; the copies have to agree.
void Editor::choose(Chance chance) {
    const auto all = groups();
    if (all.empty()) return;
    const CXGroupRef& group = chance.oneOf(all);
    const auto members = group->members();
    if (members.empty()) return;
    const CXPersonRef& person = chance.oneOf(members);
    const auto phones = person->multiValueForProperty(kCXPhoneProperty);
    if (!phones || phones->empty()) return;
    const bool clears = chance.happens(0.3);
    const auto chosen = clears ? std::nullopt : std::optional(chance.oneOf(phones->entries()).identifier);
    group->setDistributionIdentifier(chosen, kCXPhoneProperty, person);
}

} // namespace rolvane::worlds
