// What one database's scan makes, applied on another in the form in which a subscriber receives it, gives equal
// contents.

#include "ApplyWorld.h"

#include <random>

using namespace rolvane;
using namespace rolvane::test;

namespace {

// Somebody with a database of their own.
struct Side {
    Side(const std::string& user, const std::string& path, Clock& clock)
        : database({.path = path + "/contacts-" + user + ".db",
                    .program = "RolvaneManager",
                    .clock = &clock,
                    .center = &center,
                    .distributed = nullptr,
                    .runLoop = nullptr}),
          preferences(path + "/preferences-" + user + ".db"),
          conduit(std::make_unique<CXDCXConduit>(
              engine, CXDCXConduit::Collaborators{database, preferences, clock, center, 1, "another program"})) {
        engine.account = UserName(user);
    }
    NotificationCenter center;
    CXRolvane database;
    Preferences preferences;
    FakeEngine engine;
    std::unique_ptr<CXDCXConduit> conduit;
};

const UserName kBob("bob");

class TwoDatabases : public testing::Test {
public:
    TwoDatabases() {
        publisher.database.allGroup()->setValue(oneLocation(kBobsLocation, kCXPublishLabel), kCXRemoteLocationProperty);
        publisher.database.save();
        subscriber.database.addRecord(CXSubscription::create(kBobsLocation));
        subscriber.database.save();
    }

    // The publisher's scan, each record turned into what the subscriber's comparison of the store would make of it:
    // updates, new members and new groups in the subscribed form, everything else as it stands in the store.
    void carry() {
        publisher.conduit->open();
        for (const auto& record : publisher.conduit->changeRecords()) {
            if (const auto received = asReceived(*record)) {
                EXPECT_TRUE(subscriber.conduit->applyChangeRecord(received)) << received->description();
            }
        }
        publisher.conduit->close();
        clock.advance(1);
        subscriber.conduit->close();
    }
    CXDChangeRecordPtr asReceived(CXDChangeRecord& sent) {
        int type = sent.type();
        if (type == CXDRemoveDistributionListFromGroup || type == CXDDeleteRecord) return nullptr; // never received
        auto person = sent.person(), group = sent.group();
        Value payload = sent.payload();
        if (type == CXDUpdateRecord || type == CXDAddRecordToGroup)
            person = cxUIDWithTableName(*person, kCXSubscribedPersonTable);
        if (type == CXDUpdateRecord) {
            Dictionary stamped = payload.dictionary().mutableCopy();
            subscriber.conduit->stampWithRemoteLocation(stamped, kBobsLocation);
            payload = stamped;
        }
        if (type == CXDCreateStructureForGroup) {
            group = cxUIDWithTableName(*group, kCXSubscribedGroupTable);
            Dictionary described = payload.dictionary().mutableCopy();
            described.set(kCXRemoteLocationProperty, oneLocation(kBobsLocation, kCXSubscribeLabel).toValue());
            payload = described;
        }
        return std::make_shared<CXDChangeRecord>(CXDSyncSourceVaultra, type, kBob, person, group, payload);
    }
    // What the engine remembers once everything has been carried: the groups as they stand.
    void settle() {
        Dictionary states = publisher.engine.priorState("CXDCX").dictionaryFor(kSelf.str());
        for (const std::string& known : states.allKeys()) states.remove(known);
        const auto put = [&](const CXGroupRef& group) {
            Array members, subgroups;
            for (const auto& member : group->memberIdentifiers()) members.append(cxNormalizedUID(member));
            for (const auto& subgroup : group->subgroupIdentifiers()) subgroups.append(cxNormalizedUID(subgroup));
            states.set(
                cxUIDWithTableName(group->sharingUniqueId(), kCXGroupTable).str(),
                Dictionary{{"memberUIDState", members},
                           {"subgroupUIDState", subgroups},
                           {kCXGroupNameProperty, group->name()},
                           {"distributionListState", publisher.conduit->currentDistributionListStateForGroup(group)}});
        };
        put(publisher.database.allGroup());
        for (const auto& listing : publisher.database.listGroups(std::nullopt))
            put(std::dynamic_pointer_cast<CXGroup>(publisher.database.recordForUniqueId(listing.uniqueId)));
    }
    void pass() {
        publisher.database.save();
        clock.advance(1);
        carry();
        settle();
        clock.advance(1);
    }

    // Everything of one side in shared form and without the stamp, to be compared line by line.
    static Texts contents(CXRolvane& database, bool subscribed) {
        Texts all;
        const auto line = [](const CXRecordRef& record) {
            Dictionary properties = record->dictionaryRepresentation();
            properties.remove(kCXRemoteLocationProperty);
            return record->sharingUniqueId().str() + " " + Value(properties).description();
        };
        const auto top = subscribed ? database.allGroupForRemoteLocation(kBobsLocation) : database.allGroup();
        for (const auto& person : top->members()) all.push_back(line(person));
        for (const auto& group : top->subgroups()) {
            std::string text = line(group);
            Texts listed;
            for (const auto& member : group->memberIdentifiers()) listed.push_back(" +" + member.str());
            for (const auto& subgroup : group->subgroupIdentifiers()) listed.push_back(" >" + subgroup.str());
            for (const auto& [person, choices] : group->distributionChoices())
                for (const auto& [property, identifier] : choices)
                    listed.push_back(" " + cxNormalizedUID(person).str() + "." + property + "=" + identifier);
            std::sort(listed.begin(), listed.end());
            for (const auto& entry : listed) text += entry;
            all.push_back(text);
        }
        std::sort(all.begin(), all.end());
        return all;
    }
    void expectEqual(const std::string& after) {
        EXPECT_EQ(contents(subscriber.database, true), contents(publisher.database, false)) << after;
    }

    CXPersonRef fullPerson(int number) {
        auto made = CXPerson::create();
        const std::string n = std::to_string(number);
        made->setValue(Value("First" + n), kCXFirstNameProperty);
        made->setValue(Value("Last" + n), kCXLastNameProperty);
        made->setValue(Value(Date(1'000'000.0 * number)), kCXBirthdayProperty);
        made->setValue(Value(Bytes(static_cast<size_t>(2000 + number), static_cast<unsigned char>(number))),
                       kCXPhotoProperty);
        made->setValue(Value(number % 2 == 0), kCXIsCompanyProperty);
        made->setValue(Value(Array{"one", "two"}), kCXCategoriesProperty);
        CXMutableMultiValue mails, phones, addresses;
        mails.addValue("home" + n + "@store.example", kCXHomeLabel);
        mails.addValue("work" + n + "@store.example", kCXWorkLabel);
        phones.addValue("+49 " + n, kCXMobileLabel);
        addresses.addValue(Dictionary{{kCXAddressStreetKey, "Road " + n}, {kCXAddressCityKey, "Zürich"}}, kCXHomeLabel);
        made->setValue(mails, kCXEmailProperty);
        made->setValue(phones, kCXPhoneProperty);
        made->setValue(addresses, kCXAddressProperty);
        publisher.database.addRecord(made);
        return made;
    }
    CXGroupRef newGroup(const std::string& name) {
        auto made = CXGroup::create();
        made->setValue(Value(name), kCXGroupNameProperty);
        publisher.database.addRecord(made);
        return made;
    }
    static void choose(const CXGroupRef& group, const CXPersonRef& person, const char* property, size_t which) {
        const auto values = person->multiValueForProperty(property);
        group->setDistributionIdentifier(values->entries()[which].identifier, property, person);
    }

    TempDirectory directory;
    ManualClock clock{Date(1'800'000'000)};
    Side publisher{"bob", directory.path(), clock};
    Side subscriber{"ada", directory.path(), clock};
};

} // namespace

TEST_F(TwoDatabases, PeopleGroupsSubgroupsDistributionListsAndPhotosArriveFieldByField) {
    std::vector<CXPersonRef> people;
    for (int i = 0; i < 30; i++) people.push_back(fullPerson(i));
    std::vector<CXGroupRef> groups;
    for (const char* name : {"Friends", "Family", "Work", "Übung"}) groups.push_back(newGroup(name));
    for (size_t i = 0; i < people.size(); i++) {
        groups[i % 3]->addMember(people[i]);
        if (i % 5 == 0) groups[3]->addMember(people[i]);
        choose(groups[i % 3], people[i], kCXEmailProperty, i % 2);
    }
    choose(groups[3], people[0], kCXPhoneProperty, 0);
    choose(groups[3], people[0], kCXAddressProperty, 0);
    groups[0]->addSubgroup(groups[1]);
    groups[1]->addSubgroup(groups[2]);
    pass();
    expectEqual("the first pass");
    EXPECT_EQ(subscriber.database.countPeople(kBobsLocation), 30u);

    people[3]->setValue(Value("Changed"), kCXFirstNameProperty);
    people[4]->removeValueForProperty(kCXPhotoProperty);
    groups[2]->setValue(Value("Colleagues"), kCXGroupNameProperty);
    groups[0]->removeMember(people[0]);
    groups[0]->addMember(people[1]);
    groups[0]->removeSubgroup(groups[1]);
    choose(groups[1], people[4], kCXEmailProperty, 1);
    groups[2]->setDistributionIdentifier(std::nullopt, kCXEmailProperty, people[2]);
    fullPerson(99);
    newGroup("New")->addMember(people[7]);
    pass();
    expectEqual("edits");

    publisher.database.removeRecord(people[9]);
    publisher.database.removeRecord(groups[3]);
    pass();
    expectEqual("removals");
}

TEST_F(TwoDatabases, RandomEditsOfThePublisherEndWithEqualContents) {
    std::mt19937 random(20'26);
    const auto below = [&](size_t n) { return std::uniform_int_distribution<size_t>(0, n - 1)(random); };
    std::vector<CXPersonRef> people;
    std::vector<CXGroupRef> groups;
    for (int i = 0; i < 8; i++) people.push_back(fullPerson(i));
    for (int i = 0; i < 4; i++) groups.push_back(newGroup("Group" + std::to_string(i)));
    for (int round = 0; round < 40; round++) {
        for (size_t edits = below(6) + 1; edits > 0; edits--) {
            const auto& person = people[below(people.size())];
            const auto& group = groups[below(groups.size())];
            switch (below(9)) {
            case 0: person->setValue(Value("Name" + std::to_string(round)), kCXFirstNameProperty); break;
            case 1: group->setValue(Value("Group" + std::to_string(round)), kCXGroupNameProperty); break;
            case 2:
            case 3: group->addMember(person); break;
            case 4: group->removeMember(person); break;
            case 5:
                if (const auto& other = groups[below(groups.size())]; group->mayListSubgroup(other))
                    group->addSubgroup(other);
                break;
            case 6: group->removeSubgroup(groups[below(groups.size())]); break;
            case 7: choose(group, person, kCXEmailProperty, below(2)); break;
            case 8:
                if (people.size() > 3) {
                    publisher.database.removeRecord(person);
                    std::erase(people, CXPersonRef(person));
                } else {
                    people.push_back(fullPerson(100 + round));
                }
                break;
            }
        }
        pass();
        expectEqual("round " + std::to_string(round));
        if (HasFailure()) break;
    }
}
