#include "engine/queue/RefusedChanges.h"

#include "contacts/records/Identifier.h"
#include "engine/recovery/UnderWay.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <algorithm>

namespace rolvane {

namespace {

constexpr const char* kNotBefore = "notBefore";
constexpr const char* kPause = "pause";
constexpr const char* kDenied = "denied";
constexpr const char* kLeftOut = "leftOut";

bool isOfContact(const CXDChangeRecord& record) {
    return record.type() == CXDUpdateRecord || record.type() == CXDDeleteRecord;
}

bool isOfAccessList(const CXDChangeRecord& record) {
    return record.type() == CXDChangeGroupReadACL || record.type() == CXDChangeGroupReadWriteACL;
}

Dictionary refusals(const Dictionary& conduitData) {
    return conduitData[kConduitCX].dictionary()[kRefusedByStore].dictionary();
}

bool rests(const Dictionary& refusals, Date now) {
    const auto notBefore = refusals[kNotBefore].date();
    if (!notBefore) return false;
    const double left = notBefore->secondsSince(now);
    return left > 0 && left <= refusals[kPause].real(); // a clock that was set back makes no rest longer
}

void leaveToNextScan(Dictionary& conduitData, const CXDChangeRecord& record) {
    Dictionary contacts = conduitData.dictionaryFor(kConduitCX);
    if (isOfContact(record)) {
        if (record.person())
            contacts.dictionaryFor(kUnsettledPeople)
                .set(cxUIDWithTableName(*record.person(), kCXPersonTable).str(), true);
    } else if (record.group()) {
        contacts.dictionaryFor(kUnsettledGroups).set(cxUIDWithTableName(*record.group(), kCXGroupTable).str(), true);
    }
}

std::string subjectOf(const CXDChangeRecord& record) {
    if (isOfContact(record))
        return record.person() ? cxUIDWithTableName(*record.person(), kCXPersonTable).str() : std::string();
    return record.group() ? cxUIDWithTableName(*record.group(), kCXGroupTable).str() : std::string();
}

// A member whose contact was refused is not listed before it is there.
bool concernsDenied(const CXDChangeRecord& record, const Dictionary& denied) {
    if (denied.contains(subjectOf(record))) return true;
    return record.person() && (denied.contains(cxUIDWithTableName(*record.person(), kCXPersonTable).str()) ||
                               denied.contains(cxUIDWithTableName(*record.person(), kCXGroupTable).str()));
}

} // namespace

bool hasRefusedChanges(const Dictionary& conduitData) {
    return !refusals(conduitData).empty();
}

size_t countRefusedChanges(const Dictionary& conduitData) {
    const Dictionary contacts = conduitData[kConduitCX].dictionary();
    Dictionary all = contacts[kUnsettledGroups].dictionary().mutableCopy();
    all.addEntriesFrom(contacts[kUnsettledPeople].dictionary());
    all.addEntriesFrom(refusals(conduitData)[kDenied].dictionary());
    return all.count();
}

void noteRefusedChanges(Dictionary& conduitData, const CXDChangeRecords& dropped, const CXDChangeRecords& refused,
                        const FindsAgain& findsAgain, Date now) {
    const CXDChangeRecords own = ownWrites(dropped);
    if (own.empty()) return;
    for (const CXDChangeRecordPtr& record : own)
        if (!findsAgain(*record)) leaveToNextScan(conduitData, *record);
    Dictionary noted = conduitData.dictionaryFor(kConduitCX).dictionaryFor(kRefusedByStore);
    for (const CXDChangeRecordPtr& record : ownWrites(refused))
        noted.dictionaryFor(kDenied).set(subjectOf(*record), true);
    if (rests(noted, now)) return;
    const double pause = std::clamp(2 * noted[kPause].real(), kFirstPause, kLongestPause);
    noted.set(kPause, pause);
    noted.set(kNotBefore, now.addingSeconds(pause));
}

void holdBackRefusedChanges(Dictionary& conduitData, CXDChangeRecords& gathered, const FindsAgain& findsAgain,
                            Date now) {
    Dictionary noted = refusals(conduitData);
    if (noted.empty()) return;
    const auto isOwn = [](const CXDChangeRecordPtr& record) { return isOwnWrite(*record) && !isOfAccessList(*record); };
    const Dictionary denied = noted[kDenied].dictionary();
    const bool allRest = rests(noted, now);
    const bool leaveOut = !allRest && !noted[kLeftOut].boolean() &&
                          std::any_of(gathered.begin(), gathered.end(), [&](const CXDChangeRecordPtr& record) {
                              return isOwn(record) && !concernsDenied(*record, denied);
                          });
    if (!allRest) noted.remove(kLeftOut);
    std::erase_if(gathered, [&](const CXDChangeRecordPtr& record) {
        if (!isOwn(record) || !(allRest || (leaveOut && concernsDenied(*record, denied)))) return false;
        if (!findsAgain(*record)) leaveToNextScan(conduitData, *record);
        if (leaveOut) noted.set(kLeftOut, true);
        return true;
    });
}

void settleRefusedChanges(Dictionary& conduitData, Date now) {
    const Dictionary noted = refusals(conduitData);
    if (noted.empty() || rests(noted, now)) return;
    const Dictionary contacts = conduitData[kConduitCX].dictionary();
    if (contacts[kUnsettledPeople].dictionary().empty() && contacts[kUnsettledGroups].dictionary().empty())
        forgetRefusedChanges(conduitData);
}

void forgetRefusedChange(Dictionary& conduitData, const CXDChangeRecord& taken) {
    if (!hasRefusedChanges(conduitData) || !isOwnWrite(taken)) return;
    const std::string subject = subjectOf(taken);
    if (isOfContact(taken)) conduitData[kConduitCX].dictionary()[kUnsettledPeople].dictionary().remove(subject);
    refusals(conduitData)[kDenied].dictionary().remove(subject);
}

void forgetRefusedChanges(Dictionary& conduitData) {
    Dictionary contacts = conduitData[kConduitCX].dictionary();
    contacts.remove(kUnsettledPeople);
    contacts.remove(kRefusedByStore);
}

} // namespace rolvane
