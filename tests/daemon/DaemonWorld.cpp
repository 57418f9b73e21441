#include "DaemonWorld.h"

#include "conduits/PublishedLayout.h"
#include "contacts/database/DaemonMemory.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "engine/memory/EngineState.h"
#include "foundation/Paths.h"
#include "foundation/PropertyList.h"

#include <arpa/inet.h>
#include <fmt/format.h>
#include <netinet/in.h>
#include <poll.h>
#include <sstream>
#include <sys/socket.h>
#include <unistd.h>

namespace rolvane::test {

SilentServer::SilentServer() : _fd(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof address;
    if (::bind(_fd, reinterpret_cast<sockaddr*>(&address), length) != 0 || ::listen(_fd, 64) != 0 ||
        ::getsockname(_fd, reinterpret_cast<sockaddr*>(&address), &length) != 0)
        throw std::runtime_error("no listening socket");
    _port = ntohs(address.sin_port);
}

SilentServer::~SilentServer() {
    ::close(_fd);
}

bool SilentServer::somebodyWaits(double timeoutSeconds) const {
    pollfd waiting{_fd, POLLIN, 0};
    return ::poll(&waiting, 1, static_cast<int>(timeoutSeconds * 1000)) == 1;
}

DaemonWorld::~DaemonWorld() = default;

void DaemonWorld::setDebugLevel(int level) {
    Preferences preferences(stateDirectory() + "/preferences.db");
    preferences.set(kDaemonDomain, "CXDDebugLevel", level);
    preferences.synchronize(kDaemonDomain);
}

CXRolvane& DaemonWorld::database() {
    if (!_database) {
        CXRolvane::Options options;
        options.program = "rolvane";
        _database = std::make_unique<CXRolvane>(options);
    }
    return *_database;
}

void DaemonWorld::addPeople(int count, const std::string& firstName) {
    for (int i = 0; i < count; ++i) {
        const CXPersonRef person = CXPerson::create();
        person->setValue(firstName, kCXFirstNameProperty);
        person->setValue(fmt::format("Number {:04}", i), kCXLastNameProperty);
        database().addRecord(person);
    }
    database().save();
}

void DaemonWorld::publishEverything() {
    CXMutableMultiValue locations;
    locations.addValue(_account.baseLocationFor(_account.user).absoluteString(), kCXPublishLabel);
    database().allGroup()->setValue(CXMultiValue(locations), kCXRemoteLocationProperty);
    database().save();
}

void DaemonWorld::saveAccountOn(PrivateStore& store, const std::string& password) {
    _account.user = UserName(kUser);
    _account.endpoint = store.endpointTemplate();
    _account.caFile = store.caFile();
    writeFileDurably(configDirectory() + "/password", password + "\n");
    _account.passwordSource = {PasswordSource::Kind::file, configDirectory() + "/password"};
    _account.save();
}

void DaemonWorld::saveAccountAt(int port) {
    _account.user = UserName(kUser);
    _account.endpoint = fmt::format("https://127.0.0.1:{}/dav/{{user}}/Contacts", port);
    _account.save();
}

void DaemonWorld::saveAccountOnPlain(int port) {
    _account.user = UserName(kUser);
    _account.endpoint = fmt::format("http://127.0.0.1:{}/dav/{{user}}/Contacts", port);
    _account.secureEndpoint = fmt::format("https://127.0.0.1:{}/dav/{{user}}/Contacts", port);
    _account.plainLoopback = true;
    _account.save();
}

void DaemonWorld::subscribeFarAway() {
    constexpr int kNobodyListens = 1;
    saveAccountAt(kNobodyListens);
    const Url location = _account.baseLocationFor(UserName("bob"));
    database().addRecord(CXSubscription::create(RemoteLocation(location.absoluteString()), true, "Bob"));
    database().save();
}

size_t DaemonWorld::pendingChanges() {
    Preferences preferences(stateDirectory() + "/preferences.db", daemonMemory());
    return EngineState(preferences).getPendingChanges().size();
}

std::unique_ptr<ChildProcess> DaemonWorld::serving(std::vector<std::string> arguments) {
    setDebugLevel(1);
    auto daemon = startManager(std::move(arguments));
    EXPECT_TRUE(daemon->waitForLine(kServing)) << daemon->errors();
    return daemon;
}

std::string DaemonWorld::groupDifferences(const CXGroup& group) {
    const std::string uid = cxNormalizedUID(group.uniqueId()).str();
    if (!tree().contains(uid)) return uid + " is not on the store\n";
    const Dictionary state = PropertyList::fromXML(readFile(treeDirectory() + "/" + uid)).dictionary();
    std::string found;
    if (state[kCXGroupNameProperty].string() != group.name())
        found += uid + " is called " + state[kCXGroupNameProperty].string() + " there\n";
    const auto compare = [&](const char* key, const std::vector<UniqueId>& expected) {
        std::set<std::string> here, there;
        for (const UniqueId& each : expected) here.insert(cxNormalizedUID(each).str());
        for (const Value& each : state[key].array()) there.insert(each.string());
        if (here != there || there.size() != state[key].array().count())
            found += fmt::format("{}: {} has {} entries instead of {}, or others\n", uid, key,
                                 state[key].array().count(), here.size());
    };
    compare("memberUIDState", group.memberUniqueIds());
    compare("subgroupUIDState", group.subgroupUniqueIds());
    return found;
}

std::string DaemonWorld::differences() {
    std::string found;
    const Url base = _account.baseLocationFor(_account.user);
    const size_t prefix = base.path().size() + 1;
    const std::set<std::string> files = tree();
    std::set<std::string> expected;
    Array members;
    for (const CXListing& listing : database().listPeople(RemoteLocation(""))) {
        const UniqueId uid = cxNormalizedUID(listing.uniqueId);
        members.append(uid.str());
        const std::string file = layout::contactLocation(base, uid).path().substr(prefix);
        expected.insert(file);
        if (!files.contains(file)) {
            found += listing.displayName + " is not on the store\n";
            continue;
        }
        const Dictionary stored = PropertyList::fromXML(readFile(treeDirectory() + "/" + file)).dictionary();
        const auto person = std::dynamic_pointer_cast<CXPerson>(database().recordForUniqueId(listing.uniqueId));
        for (const char* property : {kCXFirstNameProperty, kCXLastNameProperty})
            if (!(stored[property] == person->valueForProperty(property)))
                found += listing.displayName + " differs in " + property + "\n";
    }
    for (const std::string& file : files)
        if (file.starts_with("People/") && !expected.contains(file)) found += file + " belongs to nobody\n";
    if (!files.contains("AllCXGroup")) return found + "there is no list of members\n";
    const Dictionary state = PropertyList::fromXML(readFile(treeDirectory() + "/AllCXGroup")).dictionary();
    const Array listed = state["memberUIDState"].array();
    if (listed.count() != members.count())
        found += fmt::format("{} members instead of {}\n", listed.count(), members.count());
    for (const Value& member : members)
        if (!listed.contains(member)) found += member.string() + " is not listed as a member\n";
    for (const Value& member : listed)
        if (!members.contains(member)) found += member.string() + " is listed and belongs to nobody\n";
    for (const CXGroupRef& group : database().allGroup()->subgroups()) found += groupDifferences(*group);
    return found;
}

size_t linesWith(const std::string& text, const std::string& part) {
    std::istringstream lines(text);
    size_t count = 0;
    for (std::string line; std::getline(lines, line);) count += line.find(part) != std::string::npos;
    return count;
}

} // namespace rolvane::test
