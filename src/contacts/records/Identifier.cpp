#include "contacts/records/Identifier.h"

#include "foundation/Paths.h"

namespace rolvane {

namespace {

constexpr std::string_view kAllPrefix = "AllCX";

// The table without "All" and "Subscribed": what an all-contacts table must be told apart by.
bool isGroupTable(std::string_view table) {
    return table == kCXGroupTable || table == kCXSubscribedGroupTable;
}
bool isAllTable(std::string_view table) {
    return table == kCXAllGroupUID || table == kCXAllSubscribedGroupTable;
}

UniqueId join(std::string_view uuid, bool hasUUID, std::string_view table) {
    if (!hasUUID) return UniqueId(std::string(table));
    std::string text;
    text.reserve(uuid.size() + 1 + table.size());
    return UniqueId(std::move(text.append(uuid).append(1, ':').append(table)));
}

} // namespace

std::string_view cxTableName(const UniqueId& uid) {
    std::string_view text = uid.str();
    size_t colon = text.rfind(':');
    if (colon != std::string_view::npos) return text.substr(colon + 1);
    return isAllTable(text) ? text : std::string_view();
}

std::string_view cxUUIDPart(const UniqueId& uid) {
    std::string_view text = uid.str();
    size_t colon = text.rfind(':');
    if (colon != std::string_view::npos) return text.substr(0, colon);
    return isAllTable(text) ? std::string_view() : text;
}

UniqueId cxUIDWithTableName(const UniqueId& uid, std::string_view table) {
    if (!table.empty() && cxTableName(uid) == table && !isAllTable(table)) return uid; // shares the text
    bool hasUUID = !isAllTable(uid.str());
    if (isAllTable(cxTableName(uid)) && isGroupTable(table)) {
        std::string all(kAllPrefix.substr(0, 3));
        return join(cxUUIDPart(uid), hasUUID, all.append(table));
    }
    return join(cxUUIDPart(uid), hasUUID, table);
}

UniqueId cxNormalizedUID(const UniqueId& uid) {
    std::string_view table = cxTableName(uid);
    if (table == kCXSubscribedPersonTable) return join(cxUUIDPart(uid), true, kCXPersonTable);
    if (table == kCXSubscribedGroupTable || table == kCXAllSubscribedGroupTable)
        return cxUIDWithTableName(uid, kCXGroupTable);
    return uid;
}

bool cxIsSubscribed(const UniqueId& uid) {
    std::string_view table = cxTableName(uid);
    return table == kCXSubscribedPersonTable || table == kCXSubscribedGroupTable || table == kCXAllSubscribedGroupTable;
}

UniqueId makeUniqueId(std::string_view table) {
    return UniqueId(makeUUID() + ":" + std::string(table));
}

} // namespace rolvane
