// Random records of two users against a small model in memory.

#include "ApplyWorld.h"

#include "support/CapturingLog.h"

#include <rapidcheck/gtest.h>

using namespace rolvane;
using namespace rolvane::test;

namespace {

const RemoteLocation kCarolsLocation("http://store.example/carol/Contacts");

struct ModelPerson {
    std::string name, owner; // owner "": the database's own
};
struct ModelGroup {
    std::string name, owner;
    std::vector<std::string> members, subgroups;
    std::map<std::string, std::map<std::string, std::string>> choices;
};

struct Step {
    int type;
    std::string user, person, group;
    std::map<std::string, std::string> choices; // of type 9
    std::string name;
};

// What the handlers' rules say, over plain containers. Identifiers are table-qualified; "S" marks a copy.
class Model {
public:
    std::map<std::string, ModelPerson> people;
    std::map<std::string, ModelGroup> groups;

    bool apply(const Step& step) {
        const bool all = step.group == "AllCXGroup";
        switch (step.type) {
        case 1: update(step); return true;
        case 2:
            if (!all) create(step);
            return true;
        case 4:
            if (ModelGroup* group = all ? nullptr : groupOf(step)) group->name = step.name;
            return true;
        case 5:
            if (const auto person = personOf(step); !all && person)
                if (ModelGroup* group = groupOf(step)) addOnce(group->members, *person);
            return true;
        case 6:
            if (const auto sub = subgroupOf(step); !all && sub)
                if (ModelGroup* group = groupOf(step); group && !reaches(*sub, group)) addOnce(group->subgroups, *sub);
            return true;
        case 9: choose(step); return true;
        case 258:
            if (const auto person = personOf(step)) {
                if (all)
                    removePerson(*person);
                else if (ModelGroup* group = groupOf(step))
                    leave(*group, *person);
            }
            return true;
        case 259:
            if (const auto sub = subgroupOf(step)) {
                if (all)
                    removeGroup(*sub);
                else if (ModelGroup* group = groupOf(step))
                    std::erase(group->subgroups, *sub);
            }
            return true;
        case 260:
            if (const auto person = personOf(step)) removePerson(*person);
            return true;
        case 261:
            if (const auto group = find(groups, step.group, "Group", step.user); !all && group) removeGroup(*group);
            return true;
        case 7: return true;
        default: return false;
        }
    }

private:
    static std::string form(const std::string& uid, const std::string& table) {
        return uid.substr(0, uid.find(':') + 1) + table;
    }
    // The copy before the plain record; and only what is the user's to change.
    template <class Map>
    std::optional<std::string> find(const Map& all, const std::string& uid, const std::string& kind,
                                    const std::string& user) const {
        if (!uid.ends_with(kind)) return std::nullopt;
        std::string found = form(uid, "CXSubscribed" + kind);
        if (!all.contains(found) && !uid.ends_with("CXSubscribed" + kind)) found = form(uid, "CX" + kind);
        const auto at = all.find(found);
        if (at == all.end()) return std::nullopt;
        if (user != "<self>" && at->second.owner != user) return std::nullopt;
        return found;
    }
    std::optional<std::string> personOf(const Step& s) const { return find(people, s.person, "Person", s.user); }
    std::optional<std::string> subgroupOf(const Step& s) const { return find(groups, s.person, "Group", s.user); }
    ModelGroup* groupOf(const Step& s) {
        const auto found = find(groups, s.group, "Group", s.user);
        return found ? &groups.at(*found) : nullptr;
    }
    static void addOnce(std::vector<std::string>& list, const std::string& entry) {
        if (std::find(list.begin(), list.end(), entry) == list.end()) list.push_back(entry);
    }
    void update(const Step& step) {
        auto uid = personOf(step);
        if (!uid && find(people, step.person, "Person", "<self>")) return; // somebody else's
        const bool copy = step.person.ends_with("CXSubscribedPerson");
        const bool isNew = !uid;
        ModelPerson& person = people[uid.value_or(step.person)];
        person.name = step.name;
        if (copy)
            person.owner = senderOf(step);
        else if (isNew)
            person.owner = "";
    }
    void create(const Step& step) {
        if (find(groups, step.group, "Group", "<self>") && !find(groups, step.group, "Group", step.user)) return;
        ModelGroup& group = groups[step.group];
        group.name = step.name;
        group.owner = step.group.ends_with("CXSubscribedGroup") ? senderOf(step) : "";
    }
    // Whose location the payload names.
    static std::string senderOf(const Step& step) { return step.user == "carol" ? "carol" : "bob"; }
    bool reaches(const std::string& from, const ModelGroup* to) const {
        const ModelGroup& group = groups.at(from);
        if (&group == to) return true;
        return std::any_of(group.subgroups.begin(), group.subgroups.end(),
                           [&](const std::string& below) { return reaches(below, to); });
    }
    void choose(const Step& step) {
        const auto person = personOf(step);
        ModelGroup* group = groupOf(step);
        if (!person || !group) return;
        auto& chosen = group->choices[*person];
        chosen = step.choices;
        if (chosen.empty()) group->choices.erase(*person);
    }
    static void leave(ModelGroup& group, const std::string& person) {
        if (std::erase(group.members, person)) group.choices.erase(person);
    }
    void removePerson(const std::string& person) {
        people.erase(person);
        for (auto& [uid, group] : groups) {
            std::erase(group.members, person);
            group.choices.erase(person);
        }
    }
    void removeGroup(const std::string& removed) {
        groups.erase(removed);
        for (auto& [uid, group] : groups) std::erase(group.subgroups, removed);
    }
};

class ApplyModel : public ApplyWorld {
public:
    ApplyModel() {
        subscribe(kCarolsLocation);
        save();
    }
    // Ends with the test's own object, so that a property may run on many worlds.
    void TestBody() override {}

    CXDChangeRecordPtr recordOf(const Step& step) {
        Value payload;
        const RemoteLocation from = step.user == "carol" ? kCarolsLocation : kBobsLocation;
        if (step.type == 1) payload = card(step.name.c_str(), from);
        if (step.type == 2) payload = groupPayload(step.name.c_str(), from);
        if (step.type == 4) payload = step.name;
        if (step.type == 9) {
            Dictionary choices;
            for (const auto& [property, identifier] : step.choices) choices.set(property, identifier);
            payload = choices;
        }
        return record(step.type, step.user.c_str(), step.person.c_str(), step.group.c_str(), payload);
    }
    static std::string ownerOf(const CXRecordRef& record) {
        if (!record->isSubscribed()) return "";
        const RemoteLocation location = record->remoteLocation();
        return location == kBobsLocation ? "bob" : location == kCarolsLocation ? "carol" : "nobody";
    }
    Texts actual() {
        Texts all;
        for (const char* table : {"CXPerson", "CXSubscribedPerson"})
            database.forEachPersonModifiedSince(Date::distantPast(), table, [&](const CXRow& row) {
                all.push_back(row.uniqueId.str() + " " + nameOf(row.uniqueId.str().c_str()) + " " +
                              ownerOf(personAt(row.uniqueId.str().c_str())));
            });
        for (const auto& listing : database.listGroups(std::nullopt)) {
            const auto group = groupAt(listing.uniqueId.str().c_str());
            std::string text = listing.uniqueId.str() + " " + group->name() + " " + ownerOf(group);
            for (const auto& member : group->memberUniqueIds()) text += " +" + member.str();
            for (const auto& subgroup : group->subgroupUniqueIds()) text += " >" + subgroup.str();
            for (const char* property : {kCXAddressProperty, kCXEmailProperty, kCXPhoneProperty})
                for (const auto& [uid, name] : everybody())
                    if (auto chosen = group->distributionIdentifierForProperty(property, personAt(uid.c_str())))
                        text += std::string(" ") + property + "." + uid + "=" + *chosen;
            all.push_back(text);
        }
        std::sort(all.begin(), all.end());
        return all;
    }
    std::map<std::string, std::string> everybody() {
        std::map<std::string, std::string> all;
        for (const auto& listing : database.listPeople(std::nullopt)) all[listing.uniqueId.str()] = "";
        return all;
    }
    static Texts expected(const Model& model) {
        Texts all;
        for (const auto& [uid, person] : model.people) all.push_back(uid + " " + person.name + " " + person.owner);
        for (const auto& [uid, group] : model.groups) {
            std::string text = uid + " " + group.name + " " + group.owner;
            for (const auto& member : group.members) text += " +" + member;
            for (const auto& subgroup : group.subgroups) text += " >" + subgroup;
            for (const char* property : {kCXAddressProperty, kCXEmailProperty, kCXPhoneProperty})
                for (const auto& [person, choices] : group.choices)
                    if (const auto chosen = choices.find(property); chosen != choices.end())
                        text += std::string(" ") + property + "." + person + "=" + chosen->second;
            all.push_back(text);
        }
        std::sort(all.begin(), all.end());
        return all;
    }
};

rc::Gen<Step> step() {
    const auto people = rc::gen::element<std::string>("A:CXPerson", "A:CXSubscribedPerson", "B:CXPerson",
                                                      "B:CXSubscribedPerson", "C:CXSubscribedPerson");
    const auto groups = rc::gen::element<std::string>("F:CXGroup", "F:CXSubscribedGroup", "G:CXGroup",
                                                      "G:CXSubscribedGroup", "H:CXSubscribedGroup", "AllCXGroup");
    const auto choices =
        rc::gen::map(rc::gen::container<std::vector<std::string>>(3, rc::gen::element<std::string>("", "x", "y")),
                     [](const std::vector<std::string>& chosen) {
                         std::map<std::string, std::string> made;
                         const char* properties[] = {kCXAddressProperty, kCXEmailProperty, kCXPhoneProperty};
                         for (size_t i = 0; i < 3; i++)
                             if (!chosen[i].empty()) made[properties[i]] = chosen[i];
                         return made;
                     });
    return rc::gen::mapcat(rc::gen::weightedElement<int>({{6, 1},
                                                          {4, 2},
                                                          {1, 3},
                                                          {2, 4},
                                                          {6, 5},
                                                          {4, 6},
                                                          {1, 7},
                                                          {4, 9},
                                                          {1, 257},
                                                          {2, 258},
                                                          {2, 259},
                                                          {1, 260},
                                                          {1, 261}}),
                           [=](int type) {
                               const bool takesGroup = type == 6 || type == 259;
                               return rc::gen::build<Step>(
                                   rc::gen::set(&Step::type, rc::gen::just(type)),
                                   rc::gen::set(&Step::user, rc::gen::element<std::string>("bob", "carol", "<self>")),
                                   rc::gen::set(&Step::person, takesGroup ? groups : people),
                                   rc::gen::set(&Step::group, groups), rc::gen::set(&Step::choices, choices),
                                   rc::gen::set(&Step::name, rc::gen::element<std::string>("One", "Two", "Three")));
                           });
}

} // namespace

RC_GTEST_PROP(ApplyModelled, AnySequenceOfRecordsEndsWhereTheModelDoes, ()) {
    const auto steps = *rc::gen::container<std::vector<Step>>(step());
    const CapturingLog muted;
    ApplyModel world;
    Model model;
    for (const Step& each : steps) {
        const auto record = world.recordOf(each);
        const bool done = world.conduit->applyChangeRecord(record);
        RC_ASSERT(done == model.apply(each));
        const Texts there = world.actual();
        if (there != ApplyModel::expected(model)) RC_LOG() << "after " << record->description() << "\n";
        RC_ASSERT(there == ApplyModel::expected(model));
    }
    world.database.save();
    RC_ASSERT(world.actual() == ApplyModel::expected(model));
}
