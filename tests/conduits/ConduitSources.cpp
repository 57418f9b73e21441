#include "ConduitSources.h"

namespace rolvane::test {
namespace {

namespace fs = std::filesystem;

// -- in memory: the contract without a deviation

// A file manager over a map of dictionaries by URL.
class MemoryFiles : public CXFileManager {
public:
    std::optional<Dictionary> dictionaryAtURL(const Url& url, int* code, bool) override {
        const auto found = files.find(url.absoluteString());
        if (code) *code = found == files.end() ? 404 : 200;
        return found == files.end() ? std::nullopt : std::optional(found->second);
    }
    std::optional<FileListing> infoForFilesInContainer(const Url&) override { return FileListing(); }
    std::map<std::string, Dictionary> files;
};

struct MemoryGroup {
    Dictionary info;
    std::set<std::string> members, subgroups;
    Dictionary state, choices;
};

struct MemoryHoldings {
    MemoryFiles files;
    std::map<std::string, MemoryGroup> groups;
};

class MemoryConduit : public CXDConduit {
public:
    MemoryConduit(ConduitEngine& e, MemoryHoldings& holdings, Source& source)
        : CXDConduit(e), _held(holdings), _source(source) {}

    std::optional<std::string> conduitID() const override { return "Memory"; }
    int32_t conduitSource() const override { return CXDSyncSourceConvoka; }
    std::optional<UserName> realUserFromUser(const std::optional<UserName>& user) const override {
        return user == kSelf ? UserName("alice") : user;
    }
    CXFileManager* defaultManager() const override { return &_held.files; }
    std::optional<Url> baseLocationForUser(const std::optional<UserName>& user) const override {
        if (!user) return std::nullopt;
        return Url("http://memory.example")
            .cxURLByAppendingComponent(user->str())
            .cxURLByAppendingComponent("Contacts");
    }
    void open() override {
        _lastSyncDate = _source.preferences.get(kDaemonDomain, "MemoryDate").date().value_or(Date::distantPast());
    }
    void close() override {
        CXDConduit::close();
        _lastSyncDate = _source.clock.now();
        _source.preferences.set(kDaemonDomain, "MemoryDate", *_lastSyncDate);
        _source.preferences.synchronize(kDaemonDomain);
    }
    using CXDConduit::applyChangeRecord;
    bool applyChangeRecord(const CXDChangeRecordPtr& record, bool* denied) override {
        if (denied) *denied = false;
        for (const auto& name : {record->person(), record->group()})
            if (name && !layout::isARecordsName(*name)) return false;
        const std::string person = record->person().value_or(UniqueId()).str();
        const std::string group = record->group().value_or(UniqueId()).str();
        switch (record->type()) {
        case CXDUpdateRecord: return put(*record, record->payload().dictionary());
        case CXDDeleteRecord: return _held.files.files.erase(textOf(*record)), true;
        case CXDCreateStructureForGroup: return _held.groups[group].info = record->payload().dictionary(), true;
        case CXDChangeGroupName: return _held.groups[group].info.set(kCXGroupNameProperty, record->payload()), true;
        case CXDAddRecordToGroup: return _held.groups[group].members.insert(person), true;
        case CXDRemoveRecordFromGroup: return _held.groups[group].members.erase(person), true;
        case CXDAddGroupToGroup: return _held.groups[group].subgroups.insert(person), true;
        case CXDRemoveGroupFromGroup: return _held.groups[group].subgroups.erase(person), true;
        case CXDUpdateDistributionList: return _held.groups[group].choices.set(person, record->payload()), true;
        case CXDCompositeGroupChange:
            _held.groups[group].state =
                layout::groupStateAfterComposite(_held.groups[group].state, record->payload().dictionary());
            return true;
        case CXDDeleteGroup: return _held.groups.erase(group), true;
        case CXDChangeGroupReadACL:
        case CXDChangeGroupReadWriteACL: return true;
        default: return false;
        }
    }

protected:
    CXRolvane& database() const override { return _source.database; }
    Preferences& preferences() const override { return _source.preferences; }

private:
    std::string textOf(const CXDChangeRecord& record) const {
        return locationForUID(*record.person(), record.user())->absoluteString();
    }
    bool put(CXDChangeRecord& record, const Dictionary& payload) {
        _held.files.files[textOf(record)] = payload;
        return true;
    }
    MemoryHoldings& _held;
    Source& _source;
};

class MemorySource : public Source {
public:
    MemorySource() { engine.account = UserName("alice"); }
    std::unique_ptr<CXDConduit> makeConduit() override { return std::make_unique<MemoryConduit>(engine, held, *this); }
    std::optional<Dictionary> contact(const std::string& uid) override {
        for (const auto& [url, dictionary] : held.files.files)
            if (Url(url).cxLastComponent() == uid) return dictionary;
        return std::nullopt;
    }
    std::optional<Dictionary> groupInfo(const std::string& uid) override {
        const auto found = held.groups.find(uid);
        return found == held.groups.end() ? std::nullopt : std::optional(found->second.info);
    }
    std::set<std::string> members(const std::string& group) override { return held.groups[group].members; }
    std::set<std::string> compositeMembers(const std::string& group) override {
        std::set<std::string> all;
        for (const Value& member : held.groups[group].state[kMemberUIDState].array()) all.insert(member.string());
        return all;
    }
    std::map<std::string, std::string> contents() override {
        std::map<std::string, std::string> all;
        for (const auto& [url, dictionary] : held.files.files) all[url] = description(dictionary);
        for (const auto& [uid, group] : held.groups) {
            std::string text = description(group.info) + description(group.state) + description(group.choices);
            for (const auto& member : group.members) text += " +" + member;
            for (const auto& subgroup : group.subgroups) text += " >" + subgroup;
            all[uid] = text;
        }
        return all;
    }
    MemoryHoldings held;
};

// -- the contact database

class DatabaseSource : public Source {
public:
    DatabaseSource() {
        // Somebody may write the owner's data; without that, no record of the owner's is believed.
        CXMutableMultiValue writers;
        writers.addValue("bob", "bob");
        database.allGroup()->setValue(writers, kCXReadWriteSharingACLProperty);
        database.save();
    }
    std::set<Deviation> deviations() const override {
        return {Deviation::CallsTheOwnerByTheMarker, Deviation::HasNoLocations, Deviation::TakesAnyName,
                Deviation::HasNoCompositeChange, Deviation::TakesOnlyTheNameOfANewGroup};
    }
    std::unique_ptr<CXDConduit> makeConduit() override {
        return std::make_unique<CXDCXConduit>(engine,
                                              CXDCXConduit::Collaborators{database, preferences, clock, center});
    }
    std::optional<Dictionary> contact(const std::string& uid) override {
        const auto record = std::dynamic_pointer_cast<CXPerson>(database.recordForUniqueId(UniqueId(uid)));
        return record ? std::optional(record->dictionaryRepresentation()) : std::nullopt;
    }
    CXGroupRef group(const std::string& uid) {
        return std::dynamic_pointer_cast<CXGroup>(database.recordForUniqueId(UniqueId(uid)));
    }
    std::optional<Dictionary> groupInfo(const std::string& uid) override {
        const auto found = group(uid);
        return found ? std::optional(found->dictionaryRepresentation()) : std::nullopt;
    }
    std::set<std::string> members(const std::string& uid) override {
        std::set<std::string> all;
        if (const auto found = group(uid))
            for (const UniqueId& member : found->memberUniqueIds()) all.insert(member.str());
        return all;
    }
    std::set<std::string> compositeMembers(const std::string& uid) override { return members(uid); }
    std::map<std::string, std::string> contents() override {
        std::map<std::string, std::string> all;
        for (const auto& listing : database.listPeople(std::nullopt))
            all[listing.uniqueId.str()] = description(*contact(listing.uniqueId.str()));
        for (const auto& listing : database.listGroups(std::nullopt)) {
            const auto found = group(listing.uniqueId.str());
            std::string text = description(found->dictionaryRepresentation());
            for (const auto& member : found->memberUniqueIds()) text += " +" + member.str();
            for (const auto& subgroup : found->subgroupUniqueIds()) text += " >" + subgroup.str();
            for (const auto& [person, choices] : found->distributionChoices())
                for (const auto& [property, identifier] : choices) text += " " + property + "=" + identifier;
            all[listing.uniqueId.str()] = text;
        }
        return all;
    }
};

// -- the network store, on a real httpd

std::unique_ptr<StoreWorld>& sharedStore() {
    static std::unique_ptr<StoreWorld> store;
    if (!store) {
        PrivateStoreOptions options;
        options.http2 = false; // on HTTP/2 libcurl may lose the answer to a refused upload (docs/limits.md)
        store = std::make_unique<StoreWorld>(options);
    }
    return store;
}

struct AlwaysUp : CXNetworkController {
    bool canReachAddress(const std::string&) override { return true; }
};
struct NoAlert : UserAlert {
    void show(const Text&) override {}
    void tell(const Text&) override {}
};

class NetworkSource : public Source {
public:
    NetworkSource() : _world(*sharedStore()), _client(_world) {
        fs::remove_all(_world.file());
        engine.account = UserName("alice");
    }
    std::set<Deviation> deviations() const override {
        return {Deviation::KeepsMemberMarkers, Deviation::ForgetsOtherInfoOnRename, Deviation::KnowsNoSubgroups,
                Deviation::RefusesTheTreesNamesForGood};
    }
    std::unique_ptr<CXDConduit> makeConduit() override {
        return std::make_unique<CXDVaultraConduit>(
            engine, CXDVaultraConduit::Collaborators{_client.manager, _network, preferences, clock, center,
                                                     _distributed, _alert, database});
    }
    std::optional<Dictionary> contact(const std::string& uid) override {
        return plist("People/" + CXACLManager::bucketNameForUID(UniqueId(uid)) + "/" + uid);
    }
    std::optional<Dictionary> groupInfo(const std::string& uid) override {
        if (!fs::exists(_world.file(uid))) return std::nullopt;
        return plist(uid + "/info").value_or(Dictionary());
    }
    std::set<std::string> members(const std::string& group) override {
        std::set<std::string> all;
        for (const auto& [path, text] : filesBelow(_world.file(group)))
            if (path.ends_with("CXPerson")) all.insert(path);
        return all;
    }
    std::set<std::string> compositeMembers(const std::string& group) override {
        std::set<std::string> all;
        const auto state = plist(fs::is_directory(_world.file(group)) ? group + "/.state" : group);
        for (const Value& member : state.value_or(Dictionary())[kMemberUIDState].array()) all.insert(member.string());
        return all;
    }
    std::map<std::string, std::string> contents() override { return filesBelow(_world.file()); }

private:
    std::optional<Dictionary> plist(const std::string& relative) {
        if (!fs::is_regular_file(_world.file(relative))) return std::nullopt;
        return PropertyList::fromXML(_world.contents(relative)).dictionary();
    }
    StoreWorld& _world;
    Client _client;
    AlwaysUp _network;
    NoAlert _alert;
    LocalNotifications _distributed;
};

// -- the folder that a machine's users share

class FolderSource : public Source {
public:
    FolderSource() {
        fs::create_directory(root);
        engine.account = UserName("alice");
    }
    std::set<Deviation> deviations() const override {
        return {Deviation::KeepsMembersAsKeys, Deviation::WritesContactsBesideTheirURL, Deviation::KeepsDeletedContacts,
                Deviation::KnowsNoSubgroups};
    }
    std::unique_ptr<CXDConduit> makeConduit() override {
        return std::make_unique<CXDLocalConduit>(
            engine, CXDLocalConduit::Collaborators{database, preferences, clock, UserName("alice"), root});
    }
    std::unique_ptr<CXDConduit> makeUsualConduit() override {
        return std::make_unique<CXDLocalConduit>(
            engine, CXDLocalConduit::Collaborators{database, preferences, clock, UserName("alice")});
    }
    std::optional<Dictionary> contact(const std::string& uid) override { return plist("People/" + uid); }
    std::optional<Dictionary> groupInfo(const std::string& uid) override {
        if (!fs::exists(root + "/alice/" + uid)) return std::nullopt;
        return plist(uid + "/info").value_or(Dictionary());
    }
    std::set<std::string> members(const std::string& group) override {
        std::set<std::string> all;
        for (const auto& [path, text] : filesBelow(root + "/alice/" + group))
            if (path.ends_with("CXPerson")) all.insert(path);
        return all;
    }
    std::set<std::string> compositeMembers(const std::string& group) override {
        std::set<std::string> all;
        const auto state = plist(fs::is_directory(root + "/alice/" + group) ? group + "/.state" : group);
        for (const auto& [member, value] : state.value_or(Dictionary())["uidState"].dictionary()) all.insert(member);
        return all;
    }
    std::map<std::string, std::string> contents() override { return filesBelow(root); }

private:
    std::optional<Dictionary> plist(const std::string& relative) {
        const std::string path = root + "/alice/" + relative;
        if (!fs::is_regular_file(path)) return std::nullopt;
        return PropertyList::fromXML(readFile(path)).dictionary();
    }
    const std::string root = directory / "shared";
};

} // namespace

std::ostream& operator<<(std::ostream& out, Deviation deviation) {
    return out << "deviation " << static_cast<int>(deviation);
}

std::map<std::string, std::string> filesBelow(const std::string& directory) {
    std::map<std::string, std::string> all;
    if (!fs::is_directory(directory)) return all;
    for (auto entry = fs::recursive_directory_iterator(directory); entry != fs::recursive_directory_iterator();
         ++entry) {
        const std::string name = entry->path().filename();
        if (name == ".DAV") {
            entry.disable_recursion_pending();
            continue;
        }
        if (entry->is_regular_file() && name != "dateFile")
            all[fs::relative(entry->path(), directory)] = readFile(entry->path());
    }
    return all;
}

const std::vector<SourceKind>& everySource() {
    static const std::vector<SourceKind> kinds = {
        {"InMemory", [] { return std::unique_ptr<Source>(std::make_unique<MemorySource>()); }},
        {"ContactDatabase", [] { return std::unique_ptr<Source>(std::make_unique<DatabaseSource>()); }},
        {"NetworkStore", [] { return std::unique_ptr<Source>(std::make_unique<NetworkSource>()); }},
        {"LocalFolder", [] { return std::unique_ptr<Source>(std::make_unique<FolderSource>()); }}};
    return kinds;
}

void endSharedStore() {
    sharedStore().reset();
}

} // namespace rolvane::test
