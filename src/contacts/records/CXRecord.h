#pragma once

#include "contacts/records/CXMultiValue.h"
#include "contacts/records/CXSearchElement.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "foundation/StrongString.h"
#include "foundation/Value.h"

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

class CXRolvane;
class CXRecord;
using CXRecordRef = std::shared_ptr<CXRecord>;

// A record: a light handle on one row of the contact database, or a record of its own until it is added to one.
// Two lookups of one identifier give the same handle while somebody holds it. Reads see this process's unsaved changes
// first and otherwise what is stored now, other processes' saves included. Writes go to the database's unit of work and
// reach the file at `save`. A handle of a deleted record stays harmless: it reads as empty and its writes do nothing.
// Any thread; the database's own lock guards every operation. A handle must not outlive its CXRolvane's last use:
// after the database object is gone it reads as empty.
class CXRecord : public std::enable_shared_from_this<CXRecord> {
public:
    virtual ~CXRecord();
    CXRecord(const CXRecord&) = delete;
    CXRecord& operator=(const CXRecord&) = delete;

    const UniqueId& uniqueId() const { return _uid; }
    // The identifier used for sharing: normalised; "AllCXGroup" for every all-contacts group.
    virtual UniqueId sharingUniqueId() const;

    // A stored property, or kCXUIDProperty, kCXCreationDateProperty, kCXModificationDateProperty (the last save's
    // date; of the edit while there are unsaved changes). Absent when there is none. Multi-values in their Value form.
    // Containers in the answer are the caller's own; changing them changes nothing stored.
    Value valueForProperty(std::string_view property) const;
    // Nothing when absent or not a multi-value; an empty one when it is stored empty.
    std::optional<CXMultiValue> multiValueForProperty(std::string_view property) const;
    // An absent value removes the property. True when the property now has the value. False, and nothing is changed,
    // for the properties that the database keeps itself, for the name of a group when the value is not a non-empty
    // string, and for a deleted record.
    bool setValue(Value value, std::string_view property);
    bool setValue(const CXMultiValue& value, std::string_view property);
    bool removeValueForProperty(std::string_view property);

    // All stored properties. The identifier and the two dates are not among them. A new dictionary at every call.
    Dictionary dictionaryRepresentation() const;
    // BinaryValue::encode(dictionaryRepresentation()), for stored records as it stands in the row, no tree is built.
    // Never null; shared, immutable.
    std::shared_ptr<const Bytes> encodedRepresentation() const;

    // Replaces all properties by those of the dictionary. `skipUnknownProperties` drops properties that this class does
    // not know and values of the wrong kind (a phone that is no multi-value); `generateMultiValueIDs` gives every
    // multi-value entry a fresh identifier instead of keeping its own. A group without a name in it keeps its name.
    void resetWithDictionary(const Dictionary& dictionary, bool skipUnknownProperties, bool generateMultiValueIDs);

    // Names of the properties in use, in ascending byte order.
    std::vector<std::string> cxUsedProperties() const;

    bool isSubscribed() const { return cxIsSubscribed(_uid); }
    // Of a subscribed record: the location that it came from. Empty for the owner's own records.
    RemoteLocation remoteLocation() const;

    // May its person edit or delete the record? The owner's own: yes. What came by a subscription: when the publisher
    // has granted writing, which is when kCXReadWriteSharingACLProperty of the location's all-contacts group has
    // entries; never once the subscription is gone. Nothing enforces the answer here (the daemon writes copies whatever
    // it is): whoever edits for a person asks first. Of a subscription: may what came by it be edited?
    bool isWritable() const;
    // Why not, with what to do, to be shown to the person; "" when it is writable.
    std::string readOnlyReason() const;

    bool isAttached() const; // belongs to a database and is not deleted
    bool hasUnsavedChanges() const;
    CXRolvane* rolvane() const; // null when it belongs to none; borrowed

    std::string description() const;

protected:
    friend class CXRolvane;
    CXRecord(UniqueId uid, Dictionary properties);                 // not yet in a database
    CXRecord(UniqueId uid, std::weak_ptr<CXRolvane* const> owner); // a row

    // The database under its lock, or null.
    CXRolvane* owner() const;

    UniqueId _uid;

private:
    std::weak_ptr<CXRolvane* const> _owner;
    Dictionary _detached; // properties while it belongs to no database
    bool _isDetached;
};

// Nothing when the property is unknown to the class of the table; used by resetWithDictionary and vCard.
enum class CXPropertyType { string, date, data, boolean, array, multiString, multiDate, multiDictionary, multiAny };
std::optional<CXPropertyType> cxPropertyType(std::string_view table, std::string_view property);
// A copy of the value, containers new, whose texts can stand on a store: characters that an XML document cannot carry
// are left out, bytes that are no UTF-8 become U+FFFD. What setValue and resetWithDictionary store.
Value cxCarriableValue(const Value& value);
// What resetWithDictionary stores: a new dictionary.
Dictionary cxSanitizedProperties(std::string_view table, const Dictionary& dictionary, bool skipUnknownProperties,
                                 bool generateMultiValueIDs);

} // namespace rolvane
