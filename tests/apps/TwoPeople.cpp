#include "TwoPeople.h"

#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "foundation/PropertyList.h"
#include "store/dav/CXDAVManager.h"

#include <filesystem>

namespace rolvane::test {

namespace {

std::string sharedForm(const UniqueId& uid) {
    return cxNormalizedUID(uid).str();
}

template <class Identifiers, class Text>
std::string listText(const Identifiers& listed, const Text& textOf) {
    std::set<std::string> names;
    size_t count = 0;
    for (const auto& each : listed) {
        names.insert(textOf(each));
        ++count;
    }
    std::string text = count == names.size() ? "" : " (somebody twice)";
    for (const std::string& name : names) text += " " + name;
    return text;
}

std::string groupText(const std::string& name, const std::string& members) {
    return name + ":" + members;
}

} // namespace

TwoPeople::TwoPeople(size_t count) {
    world.bus();
    world.makeAccount();
    alice = std::make_unique<CXRolvane>(CXRolvane::Options{
        .path = world.home / "data/rolvane/contacts.db", .program = "rolvane", .center = &aliceCenter});
    std::vector<CXPersonRef> made;
    for (size_t i = 0; i < count; ++i) {
        auto person = CXPerson::create();
        person->setValue(Value("Person " + std::to_string(i)), kCXFirstNameProperty);
        alice->addRecord(person);
        made.push_back(person);
        people.push_back(person->uniqueId());
        written[sharedForm(people.back())].insert("Person " + std::to_string(i));
    }
    for (size_t i = 0; i < kGroups; ++i) {
        auto group = CXGroup::create();
        group->setValue(Value("Circle " + std::to_string(i)), kCXGroupNameProperty);
        alice->addRecord(group);
        for (size_t member = i; member < count; member += 3) group->addMember(made[member]);
        groups.push_back(group->uniqueId());
    }
    alice->save();
    world.done({"publish"});
    location = world.json({"status"})["store"]["location"];
    bobsProgram = std::make_unique<Neighbour>(world, "bob");
    world.done({"share", "bob", "--write"});
    bob = std::make_unique<CXRolvane>(
        CXRolvane::Options{.path = bobsProgram->databasePath(), .program = "rolvane", .center = &bobCenter});
}

TwoPeople::~TwoPeople() = default;

CXPersonRef TwoPeople::personOf(CXRolvane& database, size_t i) const {
    const UniqueId uid = &database == bob.get() ? cxUIDWithTableName(people[i], kCXSubscribedPersonTable) : people[i];
    return std::dynamic_pointer_cast<CXPerson>(database.recordForUniqueId(uid));
}

CXGroupRef TwoPeople::groupOf(CXRolvane& database, size_t i) const {
    const UniqueId uid = &database == bob.get() ? cxUIDWithTableName(groups[i], kCXSubscribedGroupTable) : groups[i];
    return std::dynamic_pointer_cast<CXGroup>(database.recordForUniqueId(uid));
}

void TwoPeople::edit(CXRolvane& database, const std::string& who, int number) {
    const size_t which = random() % people.size();
    const CXPersonRef person = personOf(database, which);
    const bool renames = random() % 5 != 0;
    const CXGroupRef group = renames ? nullptr : groupOf(database, random() % kGroups);
    const bool adds = random() % 2 != 0;
    if (!person || (!renames && !group)) return; // has not come yet
    if (renames) {
        const std::string name = who + " " + std::to_string(number);
        written[sharedForm(people[which])].insert(name);
        person->setValue(Value(name), kCXFirstNameProperty);
    } else if (adds) {
        group->addMember(person);
    } else {
        group->removeMember(person);
    }
    database.save();
}

std::map<std::string, std::string> TwoPeople::view(CXRolvane& database) const {
    const RemoteLocation from(&database == bob.get() ? location : std::string());
    std::map<std::string, std::string> all;
    for (const CXListing& each : database.listPeople(from)) {
        Dictionary content = database.recordForUniqueId(each.uniqueId)->dictionaryRepresentation().mutableCopy();
        content.remove(kCXRemoteLocationProperty);
        all[sharedForm(each.uniqueId)] = Value(content).description();
    }
    for (const CXListing& each : database.listGroups(from)) {
        const auto group = std::dynamic_pointer_cast<CXGroup>(database.recordForUniqueId(each.uniqueId));
        all[sharedForm(each.uniqueId)] = groupText(group->name(), listText(group->memberUniqueIds(), sharedForm));
    }
    return all;
}

std::map<std::string, std::string> TwoPeople::storeView(Names named) {
    std::map<std::string, std::string> all;
    const auto dictionary = [&](const std::string& path) {
        return PropertyList::fromXML(contentsOf(world.published(path))).dictionary();
    };
    for (const std::string& path : world.tree())
        if (path.starts_with("People/")) {
            Dictionary content = dictionary(path).mutableCopy();
            content.remove(kCXRemoteLocationProperty); // bob's copies say where they came from
            all[path.substr(path.rfind('/') + 1)] = Value(content).description();
        }
    for (const UniqueId& group : groups) {
        const std::string name = group.str();
        const bool isFolder = std::filesystem::is_directory(world.published(name));
        const Dictionary state = dictionary(isFolder ? name + "/" + CXDAVManager::kStateName : name);
        std::vector<std::string> members;
        for (const Value& member : state["memberUIDState"].array())
            if (named == Names::all || all.contains(member.string())) members.push_back(member.string());
        all[name] =
            groupText(state[kCXGroupNameProperty].string(), listText(members, [](const std::string& v) { return v; }));
    }
    return all;
}

void TwoPeople::expectEqual(const std::map<std::string, std::string>& expected,
                            const std::map<std::string, std::string>& found, const std::string& what) const {
    EXPECT_EQ(expected.size(), people.size() + kGroups) << what;
    EXPECT_EQ(found.size(), expected.size()) << what;
    for (const auto& [name, value] : expected)
        EXPECT_EQ(found.contains(name) ? found.at(name) : "nothing", value) << what << ", " << name;
    for (const auto& [name, value] : found)
        EXPECT_TRUE(expected.contains(name)) << what << ", " << name << ": " << value;
}

void TwoPeople::expectEverySurvivingNameWasWritten(CXRolvane& database) const {
    for (size_t i = 0; i < people.size(); ++i) {
        const CXPersonRef person = personOf(database, i);
        ASSERT_TRUE(person);
        const std::string name = person->valueForProperty(kCXFirstNameProperty).string();
        EXPECT_TRUE(written.at(sharedForm(people[i])).contains(name)) << name;
    }
}

} // namespace rolvane::test
