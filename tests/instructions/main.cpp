// Core paths whose instructions are counted under callgrind: each with the same input, in a process of its own.
//
//   instructions DIRECTORY PATH     runs one path; the instructions below `rolvane_measured` count
//   instructions --list             the names of the paths
//
// The directory is empty and gets databases. `compare` beside this file counts, and compares with what is kept.

#include "FakeEngine.h"
#include "conduits/database/CXDCXConduit.h"
#include "conduits/store/StoreComparison.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/records/Constants.h"
#include "contacts/records/ContactMerge.h"
#include "contacts/records/Identifier.h"
#include "contacts/records/SearchText.h"
#include "contacts/vcard/VCardImport.h"
#include "contacts/vcard/VCardReader.h"
#include "contacts/vcard/VCardScanner.h"
#include "engine/memory/PriorStates.h"
#include "engine/queue/ChangeQueue.h"
#include "engine/queue/Mingler.h"
#include "foundation/BinaryValue.h"
#include "foundation/Preferences.h"
#include "foundation/PropertyList.h"
#include "model/PayloadKeys.h"
#include "store/dav/Multistatus.h"
#include "store/reads/ListingMemory.h"

#include <fmt/format.h>
#include <functional>
#include <iostream>
#include <map>
#include <sstream>
#include <stdexcept>

using namespace rolvane;

// Callgrind counts while this runs, and knows it by its name.
extern "C" __attribute__((noinline)) void rolvane_measured(const std::function<void()>& path) {
    path();
}

namespace {

constexpr size_t kPeople = 400;
const RemoteLocation kLocation("http://store.example/ada/Contacts");

std::string uidOf(size_t i) {
    return fmt::format("{:08X}-0000-4000-8000-{:012X}", i * 2654435761U % 0xffffffffU, i);
}

std::string cards() {
    std::string all;
    for (size_t i = 0; i < kPeople; ++i)
        all += fmt::format("BEGIN:VCARD\r\nVERSION:4.0\r\nUID:urn:uuid:{}\r\nFN:Fräulein Numéro {}\r\n"
                           "N:Numéro {};Fräulein;;;\r\nORG:Works {};Hall {}\r\nTEL;TYPE=home:+49 30 {:08}\r\n"
                           "TEL;TYPE=cell:+49 170 {:08}\r\nEMAIL;TYPE=home:n{}@example.org\r\n"
                           "ADR;TYPE=home:;;Long Lane {};Town {};;{:05};Land\r\n"
                           "NOTE:Somebody of whom there are many.\\nThis one has the number {}.\r\n{}END:VCARD\r\n",
                           uidOf(i), i, i, i % 97, i % 7, i, i, i, i, i % 13, i, i,
                           i % 10 ? "" : fmt::format("CATEGORIES:Group {}\r\n", i / 10 % 4));
    return all;
}

std::vector<Dictionary> people() {
    std::istringstream in(cards());
    VCardScanner scanner(in, "cards", [](const VCardError& e) { throw std::runtime_error(e.description()); });
    std::vector<Dictionary> all;
    VCardError error;
    while (auto card = scanner.next())
        if (auto entity = vcardEntityFromCard(*card, error)) all.push_back(std::move(entity->properties));
    return all;
}

struct Publisher {
    explicit Publisher(const std::string& directory)
        : database(options(directory)), preferences(directory + "/preferences.db"),
          conduit(engine, {database, preferences, Clock::system(), center}) {}
    static CXRolvane::Options options(const std::string& directory) {
        CXRolvane::Options options;
        options.path = directory + "/contacts.db";
        options.program = "rolvane";
        return options;
    }
    void import() {
        std::istringstream in(cards());
        VCardImport import(database);
        import.addStream(in, "cards", 0);
        import.finish();
    }
    CXDChangeRecords captured() {
        import();
        CXMutableMultiValue locations;
        locations.addValue(Value(kLocation), kCXPublishLabel);
        database.allGroup()->setValue(CXMultiValue(locations), kCXRemoteLocationProperty);
        database.save();
        conduit.open();
        return conduit.changeRecords();
    }
    CXRolvane database;
    Preferences preferences;
    NotificationCenter center;
    test::FakeEngine engine;
    CXDCXConduit conduit;
};

// As a store lists a bucket.
std::string listing() {
    std::string all = "<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<D:multistatus xmlns:D=\"DAV:\">\n";
    for (size_t i = 0; i < kPeople; ++i)
        all += fmt::format(
            "<D:response>\n<D:href>/dav/ada/Contacts/People/7/{}:CXPerson</D:href>\n<D:propstat>\n<D:prop>\n"
            "<D:resourcetype/><D:getcontentlength>{}</D:getcontentlength>\n"
            "<D:getlastmodified>Tue, 14 Nov 2023 22:15:{:02} GMT</D:getlastmodified>\n"
            "<D:getetag>\"7c3-{:x}\"</D:getetag>\n</D:prop>\n<D:status>HTTP/1.1 200 OK</D:status>\n"
            "</D:propstat>\n</D:response>\n",
            uidOf(i), 1900 + i, i % 60, i * 7919);
    return all + "</D:multistatus>\n";
}

Dictionary treeOf(size_t count, Date modified) {
    Dictionary state{{kSerialNumber, "serial"}}, files;
    Array members;
    for (size_t i = 0; i < count; ++i) {
        const std::string name = uidOf(i) + ":CXPerson";
        files.set(name, Dictionary{{kModificationDate, modified}});
        members.append(name);
    }
    state.dictionaryFor(kPeopleState).set(kMemberUIDState, files);
    state.dictionaryFor(std::string(kCXAllGroupUID)).set(kMemberUIDState, members);
    return state;
}

void require(bool holds, const char* what) {
    if (!holds) throw std::runtime_error(std::string("not as expected: ") + what);
}

using Path = std::function<void(const std::string& directory)>;

void readCards(const std::string&) {
    std::istringstream in(cards());
    size_t read = 0;
    rolvane_measured([&] {
        VCardScanner scanner(in, "cards", [](const VCardError&) {});
        VCardError error;
        while (auto card = scanner.next()) read += vcardEntityFromCard(*card, error).has_value();
    });
    require(read == kPeople, "cards");
}

void importCards(const std::string& directory) {
    Publisher publisher(directory);
    rolvane_measured([&] { publisher.import(); });
    require(publisher.database.countPeople(RemoteLocation("")) == static_cast<int64_t>(kPeople), "people");
}

void scan(const std::string& directory) {
    Publisher publisher(directory);
    publisher.captured();
    publisher.conduit.open();
    CXDChangeRecords captured;
    rolvane_measured([&] { captured = publisher.conduit.changeRecords(); });
    require(captured.size() >= kPeople, "captured");
}

void mingle(const std::string& directory) {
    Publisher publisher(directory);
    const CXDChangeRecords captured = publisher.captured();
    CXDChangeRecords mingled;
    rolvane_measured([&] {
        Mingler mingler;
        mingler.mingle(captured);
        mingled = mingler.takeMingled();
    });
    require(mingled.size() >= kPeople, "mingled");
}

void flatten(const std::string& directory) {
    Publisher publisher(directory);
    const CXDChangeRecords captured = publisher.captured();
    CXDChangeRecords flat;
    rolvane_measured([&] {
        flat = flattenGroupChanges(captured);
        sortByType(flat);
    });
    require(flat.size() >= kPeople, "flat");
}

void fold(const std::string& directory) {
    Publisher publisher(directory);
    CXDChangeRecords flat = flattenGroupChanges(publisher.captured());
    Dictionary data;
    rolvane_measured([&] {
        for (const CXDChangeRecordPtr& record : flat) didApplyChange(data, *record, CXDSyncSourceVaultra);
    });
    require(!data.empty(), "folded");
}

void storeStates(const std::string&) {
    const Dictionary state = treeOf(kPeople * 5, Date(1.7e9));
    Value read;
    rolvane_measured([&] { read = BinaryValue::decode(BinaryValue::encode(state)); });
    require(read == Value(state), "states");
}

void compareTree(const std::string&) {
    const Dictionary prior = treeOf(kPeople * 5, Date(1.7e9)), current = treeOf(kPeople * 5 + 1, Date(1.7e9));
    StoreUser user{UserName("bob"), kLocation, CXDSyncSourceVaultra, false, Date(1.7e9), {}, {}};
    user.contactUpdate = [](const UniqueId& contact) {
        return std::make_shared<CXDChangeRecord>(CXDSyncSourceVaultra, CXDUpdateRecord, UserName("bob"), contact,
                                                 std::nullopt);
    };
    CXDChangeRecords records;
    rolvane_measured([&] { records = compareStoreStates(prior, current, user); });
    require(records.size() == 2, "one contact has come");
}

void readListing(const std::string&) {
    const std::string body = listing();
    std::optional<std::vector<MultistatusEntry>> entries;
    rolvane_measured([&] {
        MultistatusReader reader;
        reader.feed(body);
        entries = reader.finish();
    });
    require(entries && entries->size() == kPeople, "entries");
}

void mergeContacts(const std::string&) {
    const std::vector<Dictionary> base = people();
    std::vector<Dictionary> ours, theirs;
    for (const Dictionary& each : base) {
        ours.push_back(Value(each).deepMutableCopy().dictionary());
        ours.back().set(kCXNoteProperty, "ours");
        theirs.push_back(Value(each).deepMutableCopy().dictionary());
        theirs.back().set(kCXNicknameProperty, "theirs");
    }
    size_t both = 0;
    rolvane_measured([&] {
        for (size_t i = 0; i < base.size(); ++i) {
            const Dictionary merged = mergedContact(base[i], ours[i], theirs[i], CXSide::ours).contact;
            both += merged[kCXNoteProperty] == Value("ours") && merged[kCXNicknameProperty] == Value("theirs");
        }
    });
    require(both == kPeople, "both changes");
}

void search(const std::string& directory) {
    Publisher publisher(directory);
    publisher.import();
    size_t found = 0;
    rolvane_measured([&] {
        for (const char* words : {"fraulein 77", "170 00000077", "number 77 many"})
            found += publisher.database.peopleFound(CXSearchQuery(words)).size();
    });
    require(found >= 3, "found");
}

void writeContacts(const std::string&) {
    const std::vector<Dictionary> all = people();
    size_t bytes = 0;
    rolvane_measured([&] {
        for (const Dictionary& each : all)
            bytes += PropertyList::fromXML(PropertyList::toXML(each)).dictionary().count();
    });
    require(bytes > kPeople, "contacts");
}

const std::map<std::string, Path> kPaths{
    {"compare-a-tree", compareTree}, {"flatten-changes", flatten},      {"fold-changes", fold},
    {"import-cards", importCards},   {"merge-contacts", mergeContacts}, {"mingle-changes", mingle},
    {"read-a-listing", readListing}, {"read-cards", readCards},         {"scan-the-database", scan},
    {"search-people", search},       {"store-states", storeStates},     {"write-contacts", writeContacts},
};

} // namespace

int main(int argc, char** argv) {
    if (argc == 2 && std::string(argv[1]) == "--list") {
        for (const auto& [name, path] : kPaths) std::cout << name << "\n";
        return 0;
    }
    const auto path = argc == 3 ? kPaths.find(argv[2]) : kPaths.end();
    if (path == kPaths.end()) {
        std::cerr << "usage: instructions DIRECTORY PATH | instructions --list\n";
        return 2;
    }
    try {
        path->second(argv[1]);
        return 0;
    } catch (const CXException& error) {
        std::cerr << "instructions: " << error.reason() << "\n";
    } catch (const std::exception& error) {
        std::cerr << "instructions: " << error.what() << "\n";
    }
    return 1;
}
