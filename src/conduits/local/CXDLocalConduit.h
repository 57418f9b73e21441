#pragma once

#include "conduits/CXDConduit.h"
#include "store/files/LocalFiles.h"

#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

class CXSubscribedGroup;
class Clock;
class Preferences;

// The conduit of the folder that the users of one machine share, one subdirectory for each who publishes there. Every
// user may read and replace what is written: directories and files have the mode 0777. While it is open, the whole
// folder is locked by one lock file. The tree is that of a network store but for three things: contacts lie directly in
// "People", without buckets; a group's state keeps its members as the keys of "uidState"; and "PublishAll" marks a user
// who publishes everything. No list says who may do what here.
//
// Others may write anywhere below a user's directory, so no symbolic link in it is followed, and a file that has a
// second name is not written (see LocalFiles). Main thread only.
class CXDLocalConduit : public CXDConduit {
public:
    static constexpr const char* kLastSyncDateKey = "CXDLocalConduitLastSyncDate";
    static constexpr const char* kRoot = "/usr/share/rolvane";

    // References are borrowed and outlive the conduit.
    struct Collaborators {
        CXRolvane& rolvane;
        Preferences& preferences;
        Clock& clock;
        UserName login;           // of the process's user
        std::string root = kRoot; // absolute; exists so that tests can have a folder of their own
    };

    CXDLocalConduit(ConduitEngine& engine, Collaborators with);
    ~CXDLocalConduit() override;

    std::optional<std::string> conduitID() const override;
    // "<self>" is the login name; any other user stays.
    std::optional<UserName> realUserFromUser(const std::optional<UserName>& user) const override;
    int32_t conduitSource() const override;
    CXFileManager* defaultManager() const override; // one a process for kRoot, made on first use
    // Nothing for a user whose name is no name of a directory.
    std::optional<Url> baseLocationForUser(const std::optional<UserName>& user) const override;
    std::string lockPath() const;

    void open() override;
    void close() override;

    // Never sets the flag. What cannot be written does not fail the change; a contact's file that cannot is logged.
    // False for what is not done here: deleting a contact, and every type that is not the folder's business.
    using CXDConduit::applyChangeRecord;
    bool applyChangeRecord(const CXDChangeRecordPtr& record, bool* denied) override;

    // Marks that the record's user publishes all contacts. No change type leads here. False only for a user whose name
    // is no name of a directory.
    bool publishAllGroup(const CXDChangeRecord& record);

protected:
    CXRolvane& database() const override { return _with.rolvane; }
    Preferences& preferences() const override { return _with.preferences; }
    bool keepsAccessLists() const override { return false; }

private:
    // The path below the directory of the record's user; nothing when a name on the way is no name of a file.
    std::optional<std::string> pathFor(const CXDChangeRecord& record,
                                       std::initializer_list<std::string_view> below) const;
    void makeGroupDirectory(const std::string& path);

    bool updateRecord(CXDChangeRecord& record);
    bool createStructureForGroup(CXDChangeRecord& record);
    bool makeCompositeGroupChange(CXDChangeRecord& record);
    bool changeGroupName(CXDChangeRecord& record);
    bool addRecordToGroup(CXDChangeRecord& record);
    bool removeRecordFromGroup(CXDChangeRecord& record);
    bool deleteGroup(CXDChangeRecord& record);

    Collaborators _with;
    LocalFiles _files;
    std::shared_ptr<CXFileManager> _manager;
    std::vector<std::shared_ptr<CXSubscribedGroup>> _subscribedGroups; // kept for the form's sake; nothing uses it
};

} // namespace rolvane
