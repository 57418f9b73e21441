#pragma once

#include "foundation/KeyedArchive.h"
#include "foundation/SharedObject.h"
#include "foundation/StrongString.h"
#include "foundation/Url.h"
#include "foundation/Value.h"

#include <array>
#include <atomic>
#include <compare>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

class CXFileManager;

// What a change is. The values are stored in archives and never change; bit 0x100 marks what takes something away.
enum CXDChangeType : int32_t {
    CXDUpdateRecord = 1,
    CXDCreateStructureForGroup = 2,
    CXDCompositeGroupChange = 3,
    CXDChangeGroupName = 4,
    CXDAddRecordToGroup = 5,
    CXDAddGroupToGroup = 6,
    CXDChangeGroupReadACL = 7,
    CXDChangeGroupReadWriteACL = 8,
    CXDUpdateDistributionList = 9,
    CXDRemoveDistributionListFromGroup = 257,
    CXDRemoveRecordFromGroup = 258,
    CXDRemoveGroupFromGroup = 259,
    CXDDeleteRecord = 260,
    CXDDeleteGroup = 261,
};
inline constexpr int32_t kCXDRemovalBit = 0x100;

// One bit a source; masks are ORs of bits.
enum CXDSyncSource : int32_t {
    CXDSyncSourceCX = 1,
    CXDSyncSourceLocal = 2,
    CXDSyncSourceVaultra = 4,
    CXDSyncSourceConvoka = 8,
    CXDSyncSourcePending = 16,
};

// Where a source keeps a user's data. The engine answers; declared here so that a record can name its location.
class RecordLocator {
public:
    virtual ~RecordLocator() = default;
    // Absolute text of the base location of the user (mapped through the conduit's realUserFromUser) in the conduit
    // that serves the source; nothing when no conduit does. `source` may be a mask of several bits.
    virtual std::optional<RemoteLocation> baseLocation(int32_t source, const std::optional<UserName>& user) const = 0;
};

class CXDChangeRecord;
using CXDChangeRecordPtr = std::shared_ptr<CXDChangeRecord>;
using CXDChangeRecords = std::vector<CXDChangeRecordPtr>;

// One change, noticed in one source and to be carried to others: the unit of work of the daemon. Shared by reference
// between lists; copies share the payload object. Carries no lock: one thread at a time.
class CXDChangeRecord {
public:
    CXDChangeRecord(); // every field zero or absent
    ~CXDChangeRecord();
    CXDChangeRecord(const CXDChangeRecord& other); // all of it, the masks and the delayed payload's place too
    CXDChangeRecord& operator=(const CXDChangeRecord&) = delete;
    // initWithInitialSource:type:user:person:group:payload:. Both masks start at 0.
    CXDChangeRecord(int32_t initialSource, int32_t type, std::optional<UserName> user, std::optional<UniqueId> person,
                    std::optional<UniqueId> group, Value payload = {});

    int32_t initialSource() const { return _initialSource; }
    int32_t type() const { return _changeType; }
    const std::optional<UniqueId>& person() const { return _puid; }
    const std::optional<UniqueId>& group() const { return _guid; }
    const std::optional<UserName>& user() const { return _user; }
    int32_t appliesToSources() const { return _appliesToSources; }
    void setAppliesToSources(int32_t sources) { _appliesToSources = sources; }
    int32_t appliedToSources() const { return _appliedToSources; }
    void setAppliedToSources(int32_t sources) { _appliedToSources = sources; }

    void setPayload(Value payload);
    // A payload kept as BinaryValue bytes until somebody looks inside; equal to setPayload of the decoded value.
    void setEncodedPayload(std::shared_ptr<const Bytes> encoded);
    // The URL equal to the one held: nothing changes, not even the file manager. `manager` is borrowed.
    void setDelayedPayloadURL(const Url& url, CXFileManager* manager);
    // Reads the delayed payload afresh at every call and lays the in-memory entries over it; a failed read gives the
    // in-memory payload. Without a delayed payload: the in-memory one, absent when there is none.
    Value payload();
    std::optional<Url> delayedPayloadURL() const;
    CXFileManager* fileManager() const; // of the delayed payload; none without one
    // Has a call of payload() read the delayed payload? What is in memory alone may be no more than a stamp.
    bool delayedPayloadWasRead() const { return _delayedPayloadWasRead; }
    Value inMemoryPayload() const; // never reads the URL
    // The payload's bytes while it has no delayed part and nobody has looked inside; null otherwise. Whoever needs the
    // content once decodes a tree of its own from them, and none stays in the record.
    std::shared_ptr<const Bytes> encodedPayload() const;
    bool hasDelayedPayload() const { return _delayed != nullptr; }
    // Turns a decoded payload back into its encoded form, what was changed in it included, and lets the tree go; a
    // payload that was given as a value is encoded too. For a record that has been handled but must be kept: many of
    // them then stand in memory as bytes. Who still holds the former value holds a tree of its own from then on.
    void packPayload();

    // Only the types, as unsigned numbers.
    std::strong_ordering compare(const CXDChangeRecord& other) const;
    // Type, initial source, applies-to mask, person, group, user; not payload, not applied-to mask.
    bool isEqual(const CXDChangeRecord& other) const;
    std::string description() const;

    void encodeWithCoder(Coder& coder) const;
    explicit CXDChangeRecord(const Coder& coder); // initWithCoder:
    CXDChangeRecordPtr copy() const;              // shares the payload object; applied-to 0, no delayed payload

    // One copy for each source of the mask, in the order of kSplitOrder. The peer source has no conduit: its bit is not
    // split out.
    CXDChangeRecords splitChangeRecord() const;
    static constexpr std::array<int32_t, 4> kSplitOrder = {CXDSyncSourceLocal, CXDSyncSourceVaultra, CXDSyncSourceCX,
                                                           CXDSyncSourcePending};
    // Folds `other` into this record's payload and makes this record a composite. kCXInvalidArgumentException, before
    // anything has changed, when `other` cannot be merged or this record's payload is not a dictionary.
    void mergeWithGroupChangeRecord(CXDChangeRecord& other);
    // False for what merging refuses: a creation without a name, a distribution-list change without its person or
    // payload. Such a record stands for itself. May read a delayed payload.
    bool canBeMerged();
    bool canApplyOutOfOrder() const;
    bool changeMadeByDataOwner() const;
    std::optional<RemoteLocation> remoteLocation(const RecordLocator& locator) const;

private:
    // A worker sets its own record's while others compare with it.
    struct Mask : std::atomic<int32_t> {
        using std::atomic<int32_t>::atomic;
        using std::atomic<int32_t>::operator=;
        Mask(const Mask& other) : std::atomic<int32_t>(other.load()) {}
        Mask& operator=(const Mask& other) {
            store(other.load());
            return *this;
        }
    };
    struct Payload; // shared by copies: the value, or its encoded form until it is first read
    struct Delayed; // few records have one, and there are many records
    int32_t _changeType = 0;
    int32_t _initialSource = 0;
    Mask _appliesToSources{0};
    int32_t _appliedToSources = 0;
    std::optional<UniqueId> _puid;
    std::optional<UniqueId> _guid;
    std::optional<UserName> _user;
    SharedPointer<Payload> _payload;
    std::unique_ptr<Delayed> _delayed;
    bool _delayedPayloadWasRead = false;
};

} // namespace rolvane
