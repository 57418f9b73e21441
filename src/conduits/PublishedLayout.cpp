#include "conduits/PublishedLayout.h"

#include "acl/CXACLManager.h"
#include "contacts/records/Constants.h"
#include "foundation/Utf8.h"
#include "model/PayloadKeys.h"

#include <algorithm>

namespace rolvane::layout {
namespace {

void appendMissing(Array& list, const Array& additions) {
    for (const Value& added : additions)
        if (!list.contains(added)) list.append(added);
}

void updateList(Dictionary& state, const char* key, const Array& additions, const Array& removals) {
    Array list = state.arrayFor(key);
    appendMissing(list, additions);
    list.removeAllOf(removals);
}

} // namespace

Url contactLocation(const Url& base, const UniqueId& person) {
    return base.cxURLByAppendingComponent(kPeople)
        .cxURLByAppendingComponent(CXACLManager::bucketNameForUID(person))
        .cxURLByAppendingComponent(person.str());
}

Url groupLocation(const Url& base, const UniqueId& group) {
    return base.cxURLByAppendingComponent(group.str());
}

Url groupInfoLocation(const Url& base, const UniqueId& group) {
    return groupLocation(base, group).cxURLByAppendingComponent(kInfo);
}

Url memberMarkerLocation(const Url& base, const UniqueId& group, const UniqueId& person) {
    return groupLocation(base, group).cxURLByAppendingComponent(person.str());
}

Url dateFileLocation(const Url& base) {
    return base.cxURLByAppendingComponent(kDateFile);
}

bool isASpecialFile(std::string_view name) {
    return name == kDateFile || name == kInfo || name == kContacts;
}

bool isARecordsName(const UniqueId& uid) {
    return !uid.empty() && !isASpecialFile(uid.str()) && uid.str() != kPeople && uid.str().front() != '.';
}

bool isASoundName(std::string_view name) {
    constexpr size_t kLongest = 255;
    if (name.empty() || name.size() > kLongest || name.front() == '.' || !isUtf8(name)) return false;
    return std::none_of(name.begin(), name.end(), [](unsigned char c) { return c < 0x20 || c == 0x7f || c == '/'; });
}

Dictionary groupStateAfterComposite(const Dictionary& state, const Dictionary& payload) {
    Dictionary after = Value(state).deepMutableCopy().dictionary();
    updateList(after, kMemberUIDState, payload[kMemberAdds].array(), payload[kMemberRemoves].array());
    updateList(after, kSubgroupUIDState, payload[kSubgroupAdds].array(), payload[kSubgroupRemoves].array());
    if (const Value& name = payload[kCXGroupNameProperty]) after.set(kCXGroupNameProperty, name);
    Dictionary lists = after.dictionaryFor(kDistributionListState);
    lists.addEntriesFrom(payload[kDistributionListAdds].dictionary());
    for (const Value& person : payload[kDistributionListRemoves].array()) lists.remove(person.string());
    return after;
}

Dictionary infoAfterRename(const Value& name) {
    Dictionary info;
    if (name) info.set(kCXGroupNameProperty, name);
    return info;
}

} // namespace rolvane::layout
