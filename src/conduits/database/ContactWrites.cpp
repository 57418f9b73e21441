#include "conduits/database/ContactWrites.h"

#include "conduits/PublishedLayout.h"
#include "conduits/store/CXDVaultraConduit.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/PropertyList.h"
#include "foundation/TestSwitch.h"
#include "model/PayloadKeys.h"
#include "store/dav/CXDAVManager.h"

#include <utility>

namespace rolvane {
namespace {

constexpr int kOk = 200;
constexpr int kForbidden = 403;
constexpr int kChangedMeanwhile = 412;
constexpr int kAttempts = 4;
constexpr double kResolution = 1; // seconds, of a store's dates

Dictionary withoutLocation(const Dictionary& contact) {
    Dictionary rest = contact.mutableCopy();
    rest.remove(kCXRemoteLocationProperty);
    return rest;
}

std::shared_ptr<const Bytes> encoded(const Dictionary& contact) {
    return std::make_shared<const Bytes>(BinaryValue::encode(contact));
}

} // namespace

Dictionary cxAsSent(const Dictionary& contact) {
    return PropertyList::fromXML(PropertyList::toXML(contact)).dictionary();
}

int cxAfterQuestion(CXDAVManager& manager, const Url& base, int code) {
    if (code != kForbidden) return code;
    int ofTree = 0;
    manager.dictionaryAtURL(base.cxURLByAppendingComponent(layout::kInfo), &ofTree, false);
    return ofTree == kForbidden ? kForbidden : 0;
}

CXMergeResult cxMergedWithStore(const std::optional<CXCommonVersion>& common, const Dictionary& here,
                                const Dictionary& there, CXSide later, const std::optional<Date>& written) {
    if (!common) return mergedContact(std::nullopt, here, there, later);
    if (!common->properties) return mergedContact(here, here, there, later); // not edited since
    const auto decoded = [](const Bytes& content) { return cxAsSent(BinaryValue::decode(content).dictionary()); };
    Dictionary base = decoded(*common->properties);
    std::vector<Dictionary> older; // what came, if it did, before that
    for (const auto& [properties, edited] : common->sent) {
        const Dictionary sent = decoded(*properties);
        base = cxBaseAfterSending(base, sent, there);
        if (edited && written && edited->secondsSince(*written) < kResolution) older.push_back(sent);
    }
    CXMergeResult merge = mergedContact(base, here, there, later);
    for (const Dictionary& sent : older) cxYieldWhatWasSent(merge, sent);
    return merge;
}

bool ContactWrites::put(const Place& place, const Dictionary& content, int& code) {
    return _manager.write(PropertyList::toXML(content), place.location, CXDVaultraConduit::kSecureRecordWrites, &code);
}

void ContactWrites::willWrite(const Url& location, const UniqueId& uniqueId,
                              const std::function<Dictionary()>& content) {
    if (isLeftOut("content before the write")) return;
    const auto common = _rolvane.commonVersion(uniqueId);
    if (common && common->properties) _rolvane.setSentVersion(uniqueId, encoded(content()));
    if (common || _manager.remembersVersion(location)) return;
    _new.insert(uniqueId);
    _rolvane.setCommonVersion(uniqueId, encoded(content()));
}

bool ContactWrites::write(const Place& place, const Dictionary& ours, int& code) {
    bool done = false;
    if (!place.merges || isLeftOut("merging")) {
        done = put(place, ours, code);
    } else {
        const bool isNew = _new.contains(place.uniqueId) ||
                           (!_rolvane.commonVersion(place.uniqueId) && !_manager.remembersVersion(place.location));
        // Nothing says that a store has had the contact. It may have come there all the same.
        if (isNew) _manager.expectAbsence(place.location, CXDVaultraConduit::kSecureRecordWrites);
        done = isNew && put(place, ours, code);
        if (!done && (!isNew || code == kChangedMeanwhile)) done = writeOver(place, ours, code);
    }
    if (done) _rolvane.setCommonVersion(place.uniqueId, encoded(ours));
    return done;
}

bool ContactWrites::writeOver(const Place& place, const Dictionary& ours, int& code) {
    for (int attempt = 0; attempt < kAttempts; ++attempt) {
        const auto there = _manager.readVersion(place.location, CXDVaultraConduit::kSecureRecordWrites, &code);
        if (there.failed) {
            code = cxAfterQuestion(_manager, place.base, code);
            return false;
        }
        if (!there.contact) {
            if (writeWhereNoneIs(place, ours, code)) return true;
        } else if (there.isKnown) {
            if (put(place, ours, code)) return true;
        } else {
            if (writeMerged(place, ours, *there.contact, there.lastModified, code)) return true;
            _manager.forgetVersion(place.location); // it was read, and nobody has it
        }
        if (code != kChangedMeanwhile) return false;
    }
    return false;
}

// The list of everybody says whether the store has lost the file or somebody has deleted the contact. Without the list
// the edit waits.
bool ContactWrites::writeWhereNoneIs(const Place& place, const Dictionary& ours, int& code) {
    if (place.wasListed && place.wasListed()) {
        const Url everybody = layout::groupLocation(place.base, UniqueId(std::string(layout::kAllGroup)));
        const auto list = _manager.dictionaryAtURL(everybody, CXDVaultraConduit::kSecureRecordWrites, &code);
        const Value members = list ? (*list)[kMemberUIDState] : Value();
        if (!members.isArray()) {
            code = cxAfterQuestion(_manager, place.base, code);
            return false;
        }
        if (!members.array().containsString(cxNormalizedUID(place.uniqueId).str())) {
            if (place.wasNeverThere) {
                code = 0; // the next look at the tree names it again
                return false;
            }
            CXLog("%@ has been deleted by somebody else, and is not written any more", place.location);
            _manager.forgetVersion(place.location);
            return true;
        }
    }
    return put(place, ours, code);
}

bool ContactWrites::writeMerged(const Place& place, const Dictionary& ours, const Dictionary& theirs,
                                const std::optional<Date>& theirDate, int& code) {
    const auto common = _rolvane.commonVersion(place.uniqueId);
    const Dictionary here = withoutLocation(cxAsSent(ours)), there = withoutLocation(theirs);
    const CXSide later = laterSide(common ? common->edited : std::nullopt, theirDate, here, there);
    const CXMergeResult merge = cxMergedWithStore(common, here, there, later, theirDate);
    CXDLog("%@ has been changed by somebody else, too: merged", place.location);
    _rolvane.noteConflictsAtOnce(place.uniqueId, merge.conflicts);
    bool done = merge.contact == there;
    code = kOk;
    if (!done) {
        Dictionary content = merge.contact.mutableCopy();
        if (const Value& location = ours[kCXRemoteLocationProperty]) content.set(kCXRemoteLocationProperty, location);
        done = put(place, content, code);
    }
    if (done && merge.contact != here) {
        const Lock guard(_lock);
        _merged.push_back({place, merge.contact});
    }
    return done;
}

std::vector<ContactWrites::Merged> ContactWrites::takeMerged() {
    const Lock guard(_lock);
    return std::exchange(_merged, {});
}

void ContactWrites::giveUpMerged() {
    for (const Merged& each : takeMerged()) _manager.forgetVersion(each.place.location);
}

} // namespace rolvane
