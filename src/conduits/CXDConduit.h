#pragma once

#include "conduits/ConduitEngine.h"
#include "foundation/Date.h"

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

class CXFileManager;
class CXRolvane;
class Preferences;
class WithdrawalNotice;

// One sync source. The engine creates it, opens it, asks it for change records, hands it the records that are addressed
// to it and closes it. No lock of its own: the engine keeps a conduit to one thread, but for applyChangeRecordIfNeeded
// of the network store, which workers call side by side.
class CXDConduit {
public:
    explicit CXDConduit(ConduitEngine& engine); // initWithSyncEngine:; the engine is borrowed and outlives the conduit
    virtual ~CXDConduit();

    // What a source overrides; the base gives the results in the comments.
    virtual std::optional<std::string> conduitID() const;                                        // absent
    virtual std::optional<UserName> realUserFromUser(const std::optional<UserName>& user) const; // unchanged
    virtual int32_t conduitSource() const;                                                       // 0
    virtual CXFileManager* defaultManager() const;                                               // none; borrowed
    virtual std::optional<Url> baseLocationForUser(const std::optional<UserName>& user) const;   // absent
    // Applies one record; sets *denied (when given) when the source refused it for lack of rights. Base: false.
    virtual bool applyChangeRecord(const CXDChangeRecordPtr& record, bool* denied);
    bool applyChangeRecord(const CXDChangeRecordPtr& record) { return applyChangeRecord(record, nullptr); }

    ConduitEngine& engine() const { return _engine; }
    std::optional<Date> lastSyncDate() const { return _lastSyncDate; }

    // A gathering begins: `open` and `changeRecords` follow, and what they ask of the source may be asked at once.
    // Base: nothing.
    virtual void willGather() {}
    virtual void open(); // base: nothing
    // A pass has few contacts left to read; `close` follows unless it fails. Base: nothing.
    virtual void willClose() {}
    // Removes the users of revoked locations from this conduit's prior state, and what was known of their access lists.
    // Subclasses persist their last-sync date.
    virtual void close();
    // Base: the comparison of prior and current state of a store.
    virtual CXDChangeRecords changeRecords();

    // What the store holds now of everybody that concerns this database: the owner's own publication, when something is
    // known of it, and every subscription that this source serves. New containers. A store that could not be read has
    // no entry. A subscription that the store forbids is revoked here.
    virtual Dictionary currentState();
    // Records for the contact database, in order (see StoreComparison.h for the states). Writes the current serial
    // numbers into the prior state. A store that was replaced is cancelled and gives no records.
    virtual CXDChangeRecords comparePriorStateToCurrentState(const Dictionary& prior, const Dictionary& current);
    Dictionary compareGroupPriorStateTo(const Value& prior, const Value& current) const;
    Dictionary comparePriorDistributionListToCurrentDistributionList(const Value& prior, const Value& current) const;

    // One user's store as a per-user state; nothing when it could not be read whole. `forbidden` (may be null): set
    // when the store says that there is nothing (404) or nothing for us (403), else cleared.
    std::optional<Dictionary> fetchWorkingStateForSubscription(const Url& base, bool* forbidden);
    // None, one or two records: what the store's access lists and the contact database's memory of them differ by.
    CXDChangeRecords changeRecordsForACLAtRemoteLocation(const Url& location);
    // {"deletions", "additions"}; an absent array counts as empty.
    static Dictionary compareCurrentACLWithPriorACL(const Value& current, const Value& prior);

    // Ends the owner's publication in the contact database; the location's user is forgotten.
    void cancelPublishing(const RemoteLocation& location);
    // Ends a subscription (or the owner's publication) here: forgets the user and cleans up.
    void cancelSharingTo(const RemoteLocation& location);
    // Takes away what came from the location, in one save. The owner's own: the marks of the publication only. Another
    // user's: the copies and the subscription; before that they are kept where the person finds them again (when they
    // cannot be kept they stay), and afterwards the person is told.
    void removeRecordsAssociateWithRemoteLocation(const RemoteLocation& location);

    // After an apply that succeeded: does the source hold now what the record put there? A source may be done with a
    // record whose object it does not have; nobody may then take it for something that was there and was removed. Base:
    // yes.
    virtual bool holds(const CXDChangeRecord& record);
    // After an apply without effect: may it have one when what follows in the pass has been applied? Base: no.
    virtual bool waitsForWhatFollows(const CXDChangeRecord& /*record*/) { return false; }

    // Will this source call the record done without doing anything, because nobody has the right to such a change?
    // Base: no.
    virtual bool swallows(const CXDChangeRecord& /*record*/) const { return false; }

    // The source has refused a change in a copy of somebody else's contacts, or it was given up with one that was
    // refused: what the source holds instead counts as not seen yet, so that the next comparison offers it. Base:
    // nothing.
    virtual void wasRefused(const CXDChangeRecord& /*record*/) {}
    // These are about to be applied, on other threads. The contact database is saved before the first of them. Main
    // thread. Base: nothing.
    virtual void willWrite(const CXDChangeRecords& /*records*/) {}

    // Contacts that an apply has merged with a version of somebody else's: as updates for the contact database, since
    // the last call. Base: none.
    virtual CXDChangeRecords takeMerged() { return {}; }
    // When the record's contact was put where this source keeps it, by that place's clock. Base: not known.
    virtual std::optional<Date> dateOfContact(const CXDChangeRecord& /*record*/) { return std::nullopt; }

    // True: this source is done with the record (applied, cancelled, or of a revoked location). An exception of the
    // base class costs one false and two log lines.
    bool applyChangeRecordIfNeeded(const CXDChangeRecordPtr& record, bool* denied);
    bool applyChangeRecordIfNeeded(const CXDChangeRecordPtr& record) {
        return applyChangeRecordIfNeeded(record, nullptr);
    }

    // The changes of a group of the owner's that its store does not have yet, and with them the contents of new
    // members. None: this source cannot tell. Base: none.
    virtual std::optional<CXDChangeRecords> changesOfGroupNow(const UniqueId& /*group*/) { return std::nullopt; }

    // Are a tree's contacts to be written before its list of everybody, and other groups behind it? Somebody may read
    // them at any moment. Main thread. Base: no.
    virtual bool writesInOrder(const UserName& /*user*/) { return false; }

    // The next gathering makes the same change by itself, for as long as it is to be made. Base: no.
    virtual bool findsAgain(const CXDChangeRecord& /*record*/) const { return false; }

    // The pass has been stored, or could not be: what the source has given in it is in the contact database, or not.
    virtual void passWasStored() {}
    virtual void passWasNotStored() {}

    std::string stringForDictionary(const Dictionary& dictionary) const; // XML property list
    virtual bool saveACLs();                                             // true always
    virtual std::shared_ptr<CXACLManager> ACLManagerForRemoteLocation(const Url& location);
    std::optional<Url> baseLocationForRemoteLocation(const Url& location) const;
    std::optional<Url> locationForUID(const UniqueId& uid, const std::optional<UserName>& user) const;
    bool isASpecialFile(const std::string& name) const;
    void stampWithRemoteLocation(Dictionary& dictionary, const RemoteLocation& location) const;
    void unstamp(Dictionary& dictionary) const;

protected:
    // What a store conduit touches beside its store. Base: the process's own; borrowed.
    virtual CXRolvane& database() const;
    virtual Preferences& preferences() const;
    virtual WithdrawalNotice* withdrawalNotice() const; // base: none; nothing is kept and nobody is told
    // Whether the state that was just read of a user's store is to be believed. Base: always.
    virtual bool isTrusted(const UserName& user, const Dictionary& state);
    // The contacts whose files have changed since a comparison with the tree found nothing, where nothing else that a
    // comparison looks at has changed: contact -> {"modificationdate"}, as in a per-user state. None is made then.
    // Nothing: the tree is to be compared. Base: nothing.
    virtual std::optional<Dictionary> contactsChangedAlone(const UserName& /*user*/, const Url& /*base*/) {
        return std::nullopt;
    }
    // The store forbids or has lost the owner's published tree, or (`replaced`) has another one. Called before anything
    // of the publication is forgotten. Base: nothing.
    virtual void ownPublicationEnds(const Url& /*base*/, bool /*replaced*/) {}
    // Whether access lists are kept at the source, so that somebody else may have changed them. Base: yes.
    virtual bool keepsAccessLists() const { return true; }

    std::optional<Date> _lastSyncDate;
    ConduitEngine& _engine;
    // Base-location text to manager; made on first use.
    std::optional<std::map<std::string, std::shared_ptr<CXACLManager>>> _ACLManagerMap;

private:
    std::map<UserName, Dictionary> _changedAlone;  // trees that were left out of the state, with their changed contacts
    std::vector<RemoteLocation> locationsToRead(); // the owner's first; also tells the engine of the subscriptions
    // `allIsNew`: every contact is going to be read, so that it can begin while the listing is under way.
    std::optional<Dictionary> fetchWorkingState(const Url& base, bool* forbidden, bool allIsNew);
    void readLocation(const RemoteLocation& location, Dictionary& state);
    bool readGroup(const Url& base, const std::string& name, Dictionary& groupState);
    CXDChangeRecordPtr contactUpdate(const UserName& user, const RemoteLocation& base, const UniqueId& contact) const;
    void compareUser(const UserName& user, const Dictionary& priorState, const Dictionary& current,
                     CXDChangeRecords& records);
    void appendACLChange(CXDChangeType type, const UserName& user, const std::vector<UserName>& current,
                         const Value& prior, CXDChangeRecords& records) const;
};

} // namespace rolvane
