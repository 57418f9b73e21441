#pragma once

#include "conduits/ConduitEngine.h"
#include "foundation/Date.h"

#include <map>
#include <memory>
#include <optional>
#include <string>

namespace rolvane {

class CXFileManager;

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

    virtual void open(); // base: nothing
    // Removes the users of revoked locations from this conduit's prior state. Subclasses persist their last-sync date.
    virtual void close();
    // Base: the comparison of prior and current state of a store.
    virtual CXDChangeRecords changeRecords();
    // The base finds nothing changed; store conduits that read their store override these two.
    virtual Dictionary currentState();
    virtual CXDChangeRecords comparePriorStateToCurrentState(const Dictionary& prior, const Dictionary& current);

    // True: this source is done with the record (applied, cancelled, or of a revoked location). An exception of the
    // base class costs one false and two log lines.
    bool applyChangeRecordIfNeeded(const CXDChangeRecordPtr& record, bool* denied);
    bool applyChangeRecordIfNeeded(const CXDChangeRecordPtr& record) {
        return applyChangeRecordIfNeeded(record, nullptr);
    }

    std::string stringForDictionary(const Dictionary& dictionary) const; // XML property list
    bool saveACLs();                                                     // true always
    virtual std::shared_ptr<CXACLManager> ACLManagerForRemoteLocation(const Url& location);
    std::optional<Url> baseLocationForRemoteLocation(const Url& location) const;
    std::optional<Url> locationForUID(const UniqueId& uid, const std::optional<UserName>& user) const;
    bool isASpecialFile(const std::string& name) const;
    void stampWithRemoteLocation(Dictionary& dictionary, const RemoteLocation& location) const;
    void unstamp(Dictionary& dictionary) const;

protected:
    std::optional<Date> _lastSyncDate;
    ConduitEngine& _engine;
    // Base-location text to manager; made on first use.
    std::optional<std::map<std::string, std::shared_ptr<CXACLManager>>> _ACLManagerMap;
};

} // namespace rolvane
