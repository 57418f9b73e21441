#pragma once

#include "conduits/CXDConduit.h"
#include "conduits/database/ContactWrites.h"
#include "conduits/store/NewOnStore.h"
#include "foundation/Mutex.h"
#include "foundation/Notification.h"
#include "store/dav/CXDAVManager.h"

#include <atomic>
#include <functional>
#include <future>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <unordered_map>
#include <unordered_set>

namespace rolvane {

struct TreeCondition;

class CXNetworkController;
class CXRolvane;
class Clock;
class Preferences;
class UserAlert;

// Makes the access-list manager of a base location. Exists so that tests can replace it.
using ACLManagerFactory =
    std::function<std::shared_ptr<CXACLManager>(const Url& baseLocation, const LocationOwner& owner)>;

// A contact or group of the user's tree, as the database names it: the owner's own, or a copy.
UniqueId nameInDatabase(const UserName& user, const UniqueId& shared);

// The conduit of the network store: applies change records to the tree of the record's user on the WebDAV store, and
// knows whether the store can be used at all.
//
// Threads: workers call applyChangeRecordIfNeeded side by side for records other than access-list changes; everything
// else, access-list changes included, comes on the main thread while no worker runs.
class CXDVaultraConduit : public CXDConduit {
public:
    static constexpr const char* kLastSyncDateKey = "CXDVaultraConduitLastSyncDate";
    static constexpr const char* kLastWarningDateKey = "CXDLastUserPasswordWarningDate";
    // What no save of the owner's access list has carried yet: base location to what the manager gives as unsaved.
    // Written with the queue, so that another process goes on with it.
    static constexpr const char* kUnsavedAccessListsKey = "CXDUnsavedAccessLists";
    static constexpr double kWarningInterval = 900;   // seconds between two password warnings
    static constexpr bool kSecureRecordWrites = true; // contact records, group states and new groups' "info"

    // All borrowed; they outlive the conduit.
    struct Collaborators {
        CXDAVManager& manager;
        CXNetworkController& network;
        Preferences& preferences;
        Clock& clock;
        NotificationCenter& notifications;     // this process's: the network's changes
        DistributedNotifications& distributed; // the user's processes': "SimulateVaultraNotification"
        UserAlert& alert;
        CXRolvane& rolvane;
        ACLManagerFactory makeACLManager = {};   // none: a CXDAVACLManager on the client
        WithdrawalNotice* withdrawals = nullptr; // none: nothing is kept and nobody is told
    };

    CXDVaultraConduit(ConduitEngine& engine, Collaborators with);
    ~CXDVaultraConduit() override;

    std::optional<std::string> conduitID() const override;
    // "<self>" is the account's user; any other user stays.
    std::optional<UserName> realUserFromUser(const std::optional<UserName>& user) const override;
    int32_t conduitSource() const override;
    CXFileManager* defaultManager() const override;
    std::optional<Url> baseLocationForUser(const std::optional<UserName>& user) const override;
    // False: the change was not made and stays pending; *denied: the store refused it with 403. Off line, and without
    // the lock of the tree, nothing is sent.
    using CXDConduit::applyChangeRecord;
    bool applyChangeRecord(const CXDChangeRecordPtr& record, bool* denied) override;
    void wasRefused(const CXDChangeRecord& record) override;
    void willWrite(const CXDChangeRecords& records) override;
    CXDChangeRecords takeMerged() override;
    std::optional<Date> dateOfContact(const CXDChangeRecord& record) override;
    void willGather() override;
    bool writesInOrder(const UserName& user) override;
    bool findsAgain(const CXDChangeRecord& record) const override;
    // A refused user name or password warns the person, at most once in 15 minutes, and ends the daemon. In a
    // gathering the structure of a tree of which nothing is known is looked after while the pass goes on; what needs it
    // waits.
    void open() override;
    // Asks for the server's date in advance, where the owner publishes nothing that is locked and written meanwhile.
    void willClose() override;
    // The stored last-sync date moves to the server's date; off line, or when the server does not tell it, it stays.
    void close() override;
    void passWasStored() override;
    void passWasNotStored() override;
    // The map's manager, else a new one for the location's base location, which the map then keeps. None when the
    // location has no base location.
    std::shared_ptr<CXACLManager> ACLManagerForRemoteLocation(const Url& location) override;

    // As the base's; also the lists that an earlier process could not save. What is left is noted, without
    // synchronising.
    bool saveACLs() override;

    // As the base's, and what an older copy of the owner's tree has brought back on the store.
    CXDChangeRecords changeRecords() override;
    // As the base's, with every group file that has not changed since it was read last taken from the client's memory.
    Dictionary currentState() override;

    bool vaultraOffLine() const { return _vaultraOffLine; }
    // Touches the owner's clock file and asks for its date; nothing when the store does not answer.
    std::optional<Date> currentServerDate();
    bool sanityCheckPublishStructure();
    bool lockStructureForRecord(const CXDChangeRecord& record); // any thread

    void networkChanged();
    void vaultraSynced();
    bool shouldWarnUserAboutUserNameOrPassword() const;
    void warnUserAboutUserNameOrPassword();

protected:
    CXRolvane& database() const override { return _with.rolvane; }
    Preferences& preferences() const override { return _with.preferences; }
    bool keepsAccessLists() const override; // as the server announces it
    WithdrawalNotice* withdrawalNotice() const override { return _with.withdrawals; }
    // Sends what waits for the lists, tells the person and leaves a note.
    void ownPublicationEnds(const Url& base, bool replaced) override;
    // A tree that was set back or has lost its lists says nothing about anybody's contacts, and is left alone. The
    // owner's own is published again.
    bool isTrusted(const UserName& user, const Dictionary& state) override;
    std::optional<Dictionary> contactsChangedAlone(const UserName& user, const Url& base) override;

private:
    // All that a comparison of a tree with what is known of it looks at; equal ones find the same. Edits of contacts
    // that the database has, here or there, change nothing but whether these contacts are to be read.
    struct Comparison {
        int64_t journal = 0;
        uint64_t states = 0;
        CXDAVManager::TreeMark tree;
        std::set<UniqueId> found; // contacts that were to be read then, as the tree names them
    };
    // Changes of one tree that the gathering under way has found.
    struct Found {
        bool isContactsAlone = true;
        std::set<UniqueId> contacts;
    };
    std::optional<Comparison> comparisonWith(const UserName& user, const Url& base, bool ask);
    std::optional<Dictionary> contactsChangedSince(const UserName& user, const Url& base, const Comparison& before);
    void noteCompared(int64_t journal, const std::map<UserName, Found>& found);
    void beginReading();
    void lookAfterStructure(bool meanwhile);          // while the pass goes on
    void awaitStructure();                            // any thread
    bool isHeld(const CXDChangeRecord& record) const; // any thread
    void publishAgain(const TreeCondition& condition, const Dictionary& state);
    void writeAgain(const std::vector<UniqueId>& groups, Dictionary prior);
    void readPublishAgain();
    void restoreAccessLists();
    bool isBeingMended();
    bool isMended(const Dictionary& prior, const Dictionary& state);
    bool isToBePublishedAgain();
    // -- the own tree of several computers
    void openAsOneOfSeveral();
    bool takesIn(Dictionary prior, const Dictionary& state);               // may the tree be taken in?
    bool keepsInStepWithOthers(Dictionary prior, const Dictionary& state); // false: found out just now
    bool hasTold(const Value& serial);                                     // the tree with that number of this computer
    bool isToTellAgain(const Value& serial);
    void closeTakingIn();
    void isOneOfSeveralNoMore();
    void mendOwnTree(const Dictionary& prior, const Dictionary& state);
    void takeUnlistedAway(Dictionary prior, const Dictionary& state);
    void noteUnlisted(const UniqueId& name);
    void takeNamesAloneOut(Dictionary prior, const Dictionary& state);
    bool somebodyMayWrite(); // besides the owner
    bool allGroupHas(const char* property);
    void compareUnlistedGroups(CXDChangeRecords& records);
    void nameAgain(CXDChangeRecords& records);
    bool wasNeverThere(const UserName& user, const UniqueId& name);
    void compareWhatHadCome(CXDChangeRecords& records);
    std::vector<CXReached> whatHadCome();
    void forgetWhatIsKnown();
    void forgetWhatHasAFile();
    void forgetReached(const std::vector<UniqueId>& records);
    void leaveUnlistedOut(CXDChangeRecords& records);
    void forgetSubscribersRights();
    void noteUnsavedAccessLists();
    // Sets _vaultraOffLine; the error's code, 0 when there was none. `meanwhile`: as of CXDAVManager::canReach.
    int testReachability(const std::function<void()>& meanwhile = {});
    std::optional<Url> baseLocationOf(const CXDChangeRecord& record) const;

    bool mayBeNamed(const CXDChangeRecordPtr& record); // else it is refused for good
    // Each writes one kind of change and sets the result code to the last request's HTTP status.
    bool apply(CXDChangeRecord& record, int& code);
    bool updateRecord(CXDChangeRecord& record, int& code);
    UniqueId inDatabase(const CXDChangeRecord& record);
    void forgetEdit(const CXDChangeRecord& record);
    bool mergesInto(const UserName& user);
    bool createStructureForGroup(CXDChangeRecord& record, int& code);
    bool makeCompositeGroupChange(CXDChangeRecord& record, int& code);
    bool wasDeletedThere(CXDChangeRecord& record);
    void noteNewRecords(const CXDChangeRecords& records);
    bool writeComposite(CXDChangeRecord& record, const Dictionary& payload, int& code);
    Dictionary lastKnownState(const CXDChangeRecord& record);
    bool changeGroupName(CXDChangeRecord& record, int& code);
    bool addRecordToGroup(CXDChangeRecord& record, int& code);
    bool deleteRecord(CXDChangeRecord& record, int& code);
    bool deleteGroup(CXDChangeRecord& record, int& code);
    bool changeGroupReadACL(CXDChangeRecord& record);
    bool changeGroupReadWriteACL(CXDChangeRecord& record);

    Collaborators _with;
    ContactWrites _writes{_with.manager, _with.rolvane};
    NewOnStore _newOnStore{_with.rolvane};
    std::unordered_set<UserName> _writtenInOrder; // in the trees that were asked about; constant while a pass writes
    std::unordered_set<UniqueId> _newRecords;     // in those trees, that no list is known to name; constant likewise
    std::unordered_set<UniqueId> _lookedFor;      // among those that had come, by the last gathering; main thread
    std::unordered_set<UniqueId> _inDoubt;        // had come and were not looked for; constant while a pass writes
    std::atomic<bool> _vaultraOffLine = false;
    std::atomic<bool> _isWrittenByOthers = false; // the own tree, as of the last open
    std::atomic<bool> _isOlderCopy = false;       // the own tree: it is older than the database
    Dictionary _lostList; // of the own tree that is published again, as its files tell it; else empty
    std::atomic<bool> _ownTreeIsHeld = false; // nothing of ours is written there yet
    bool _isOneOfSeveral = false;             // as of the last look; constant while a pass writes, as are these two
    bool _takesIn = false;                    // this pass does nothing else with the own tree
    std::optional<Date> _takenIn;             // the tree, as it was at that date
    std::set<UserName> _leftAlone;            // other trees, until their owners have mended them; as _takesIn
    CXDChangeRecords _leftovers;              // of the gathering that is under way
    std::set<UniqueId> _foundAgain;           // contacts that the next look takes away, too; of this gathering
    std::map<UserName, Dictionary> _read;     // so far: the states of known users
    std::map<UserName, Comparison> _moments;  // the last comparisons that found nothing but contacts
    std::map<UserName, Comparison> _compared; // those that the gathering under way has not made again
    std::map<UserName, Comparison> _lookedAt; // and what it has seen of these trees
    bool _gathering = false;                  // `open` belongs to a gathering
    Mutex _structureLock;
    std::future<void> _structure GUARDED_BY(_structureLock); // the look at the own tree that is under way
    // The account is the manager's for good, and every record asks for its user's base location several times.
    std::future<std::optional<Date>> _serverDate; // asked for in advance
    mutable Mutex _basesLock;
    mutable std::unordered_map<UserName, Url> _bases GUARDED_BY(_basesLock);
    ObservationHandle _simulated, _networkChanged;
};

} // namespace rolvane
