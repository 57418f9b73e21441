#include "server/mod_cardbook/CardText.h"

#include "foundation/PropertyList.h"

namespace rolvane::cardbook {
namespace {

constexpr std::string_view kUUIDPrefix = "urn:uuid:";

std::string keptUID(const Dictionary& properties) {
    const auto lines = vcardKeptLines(properties, "UID");
    return lines.empty() ? std::string() : vcardUnescape(lines.front().value);
}

// A copy that may be changed, without the lines that no card shows.
Dictionary withoutOwnLines(const Dictionary& properties) {
    Dictionary shown = properties.mutableCopy();
    if (!properties.contains(kCXVCardExtraProperty)) return shown;
    shown.set(kCXVCardExtraProperty, properties[kCXVCardExtraProperty].deepMutableCopy());
    for (const char* name : {kVCardCategoryOrderLine, kVCardMissingMemberLine, kVCardJoinedUIDLine})
        vcardReplaceKeptLines(shown, name, {});
    return shown;
}

} // namespace

std::string uidTextOf(const UniqueId& uid, const Dictionary& properties) {
    const std::string kept = keptUID(properties);
    return kept.empty() ? std::string(kUUIDPrefix) + std::string(cxUUIDPart(uid)) : kept;
}

VCardEntity personEntity(const UniqueId& uid, const Dictionary& properties) {
    VCardEntity entity;
    entity.uid = std::string(kUUIDPrefix) + std::string(cxUUIDPart(uid));
    entity.properties = withoutOwnLines(properties);
    return entity;
}

std::string personText(const UniqueId& uid, const Dictionary& properties, VCardVersion version) {
    return vcardText(personEntity(uid, properties), version);
}

VCardEntity groupEntity(CXRolvane& rolvane, const CXGroup& group) {
    VCardEntity entity;
    entity.isGroup = true;
    entity.uid = std::string(kUUIDPrefix) + std::string(cxUUIDPart(group.uniqueId()));
    const Dictionary properties = group.dictionaryRepresentation();
    rolvane.forEachMember(group, [&](const CXRow& row) {
        constexpr std::string_view kKeptUID = "UID";
        const std::string_view bytes(reinterpret_cast<const char*>(row.encoded->data()), row.encoded->size());
        // Decoding everybody for the few who came with a UID of their own would cost more than all the rest.
        const bool mayHaveOne = bytes.find(kKeptUID) != std::string_view::npos;
        entity.members.push_back(
            uidTextOf(row.uniqueId, mayHaveOne ? BinaryValue::decode(*row.encoded).dictionary() : Dictionary()));
    });
    for (const CXGroupRef& subgroup : group.subgroups())
        entity.subgroups.push_back(uidTextOf(subgroup->uniqueId(), subgroup->dictionaryRepresentation()));
    for (const VCardLine& line : vcardKeptLines(properties, kVCardMissingMemberLine))
        entity.members.push_back(vcardUnescape(line.value));
    entity.properties = withoutOwnLines(properties);
    return entity;
}

Bytes groupDigestText(const VCardEntity& entity) {
    Array members, subgroups;
    for (const std::string& uid : entity.members) members.append(uid);
    for (const std::string& uid : entity.subgroups) subgroups.append(uid);
    return BinaryValue::encode(
        Dictionary{{"properties", entity.properties}, {"members", members}, {"subgroups", subgroups}});
}

} // namespace rolvane::cardbook
