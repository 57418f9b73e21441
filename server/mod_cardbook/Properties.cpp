#include "server/mod_cardbook/Properties.h"

#include "server/mod_cardbook/XmlText.h"

#include <charconv>

namespace rolvane::cardbook {
namespace {

constexpr const char* kServerSpace = "http://calendarserver.org/ns/";
constexpr const char* kColorSpace = "http://inf-it.com/ns/ab/";
constexpr std::string_view kTokenStart = "urn:x-rolvane:books:";
constexpr const char* kReports[][2] = {
    {kCardSpace, "addressbook-multiget"}, {kCardSpace, "addressbook-query"}, {kDavSpace, "sync-collection"}};

enum Property {
    kEntityTag = 0x6352,
    kContentType,
    kLastModified,
    kDisplayName,
    kCurrentUserPrincipal,
    kPrincipalURL,
    kPrincipalCollectionSet,
    kOwner,
    kCurrentUserPrivilegeSet,
    kSyncToken,
    kSupportedReportSet,
    kResourceType,
    kHomeSet,
    kDescription,
    kSupportedAddressData,
    kSupportedCollationSet,
    kMaxResourceSize,
    kCollectionTag,
    kColor
};

const char* const kSpaces[] = {kDavSpace, kCardSpace, kServerSpace, kColorSpace, nullptr};
enum Space { kDav, kCards, kServer, kColors };
const dav_liveprop_spec kProperties[] = {{kDav, "getetag", kEntityTag, 0},
                                         {kDav, "getcontenttype", kContentType, 0},
                                         {kDav, "getlastmodified", kLastModified, 0},
                                         {kDav, "displayname", kDisplayName, 0},
                                         {kDav, "current-user-principal", kCurrentUserPrincipal, 0},
                                         {kDav, "principal-URL", kPrincipalURL, 0},
                                         {kDav, "principal-collection-set", kPrincipalCollectionSet, 0},
                                         {kDav, "owner", kOwner, 0},
                                         {kDav, "current-user-privilege-set", kCurrentUserPrivilegeSet, 0},
                                         {kDav, "sync-token", kSyncToken, 0},
                                         {kDav, "supported-report-set", kSupportedReportSet, 0},
                                         {kCards, "addressbook-home-set", kHomeSet, 0},
                                         {kCards, "addressbook-description", kDescription, 0},
                                         {kCards, "supported-address-data", kSupportedAddressData, 0},
                                         {kCards, "supported-collation-set", kSupportedCollationSet, 0},
                                         {kCards, "max-resource-size", kMaxResourceSize, 0},
                                         {kServer, "getctag", kCollectionTag, 0},
                                         {kColors, "addressbook-color", kColor, 0},
                                         {0, nullptr, 0, 0}};

std::string hrefOf(const Resource& resource, Place::Kind kind) {
    return "<D:href>" + xmlText(escapedPath(resource.path({kind, {}, {}}))) + "</D:href>";
}

std::string privilegesOf(const Resource& resource) {
    std::string text;
    const auto add = [&](const char* name) { text += "<D:privilege><D:" + std::string(name) + "/></D:privilege>"; };
    add("read");
    add("read-current-user-privilege-set");
    if (!resource.book || !resource.book->isWritable) return text;
    add("write-content");
    if (resource.place.kind != Place::Kind::book) return text;
    add("write");
    add("bind");
    add("unbind");
    return text;
}

std::string reportsOfBook() {
    std::string text;
    for (const auto& [space, name] : kReports)
        text += "<D:supported-report><D:report><" + std::string(name) + " xmlns=\"" + space +
                "\"/></D:report></D:supported-report>";
    return text;
}

std::string titleOf(const Resource& resource) {
    switch (resource.place.kind) {
    case Place::Kind::book: return resource.book->title;
    case Place::Kind::principal: return resource.r->user;
    case Place::Kind::home: return "Address books";
    default: return {};
    }
}

std::string currentToken(const Resource& resource) {
    Library& library = *resource.library;
    return syncToken(library, library.memory().latest(resource.book->id));
}

// Nothing: the resource has no such property.
std::optional<std::string> valueOf(const Resource& resource, int property) {
    if (!resource.exists()) return std::nullopt;
    const bool isBook = resource.place.kind == Place::Kind::book, isCard = resource.place.kind == Place::Kind::card;
    const auto ofBook = [&](const std::string& value) { return isBook ? std::optional(value) : std::nullopt; };
    switch (property) {
    case kEntityTag:
        if (!isCard) return std::nullopt;
        return xmlText(resource.card ? resource.card->tag
                                     : Library::tagOf(resource.member->uid, resource.member->modified));
    case kContentType: return isCard ? "text/vcard; charset=utf-8" : "httpd/unix-directory";
    case kLastModified:
        if (!isCard) return std::nullopt;
        return (resource.card ? resource.card->modified : resource.member->modified).toHTTP();
    case kDisplayName: {
        const std::string title = titleOf(resource);
        return title.empty() ? std::nullopt : std::optional(xmlText(title));
    }
    case kOwner:
    case kCurrentUserPrincipal: return hrefOf(resource, Place::Kind::principal);
    case kPrincipalURL:
        if (resource.place.kind != Place::Kind::principal) return std::nullopt;
        return hrefOf(resource, Place::Kind::principal);
    case kPrincipalCollectionSet: return hrefOf(resource, Place::Kind::root);
    case kHomeSet:
        if (resource.place.kind != Place::Kind::principal) return std::nullopt;
        return hrefOf(resource, Place::Kind::home);
    case kCurrentUserPrivilegeSet: return privilegesOf(resource);
    case kSyncToken: return isBook ? std::optional(currentToken(resource)) : std::nullopt;
    case kCollectionTag: return isBook ? std::optional("\"" + currentToken(resource) + "\"") : std::nullopt;
    case kSupportedReportSet: return isBook ? reportsOfBook() : std::string();
    case kDescription: return isBook ? std::optional(xmlText(resource.book->description)) : std::nullopt;
    case kColor: return isBook ? std::optional(resource.book->color) : std::nullopt;
    case kSupportedAddressData:
        return ofBook("<C:address-data-type content-type=\"text/vcard\" version=\"3.0\"/>"
                      "<C:address-data-type content-type=\"text/vcard\" version=\"4.0\"/>");
    case kSupportedCollationSet:
        return ofBook("<C:supported-collation>i;ascii-casemap</C:supported-collation>"
                      "<C:supported-collation>i;octet</C:supported-collation>"
                      "<C:supported-collation>i;unicode-casemap</C:supported-collation>");
    case kMaxResourceSize: return ofBook(std::to_string(configurationOf(resource.r).cardBytes()));
    case kResourceType: {
        std::string type = isCard ? "" : "<D:collection/>";
        if (isBook) type += "<C:addressbook xmlns:C=\"" + std::string(kCardSpace) + "\"/>";
        if (resource.place.kind == Place::Kind::principal) type += "<D:principal/>";
        return type;
    }
    default: return std::nullopt;
    }
}

constexpr const char* kPrefixes[] = {"D", "C", "CS", "X"};

std::string nameOf(const dav_liveprop_spec& spec) {
    return std::string(kPrefixes[spec.ns]) + ":" + spec.name;
}

std::string startOf(const dav_liveprop_spec& spec) {
    if (spec.ns == kDav) return nameOf(spec);
    return nameOf(spec) + " xmlns:" + kPrefixes[spec.ns] + "=\"" + kSpaces[spec.ns] + "\"";
}

dav_prop_insert insertProperty(const dav_resource* resource, int property, dav_prop_insert what,
                               apr_text_header* text) noexcept {
    if (!isOurs(resource)) return DAV_PROP_INSERT_NOTDEF;
    dav_prop_insert result = DAV_PROP_INSERT_NOTDEF;
    contained(of(resource).r, [&] {
        const dav_liveprop_spec* spec = nullptr;
        dav_get_liveprop_info(property, &kLiveProperties, &spec);
        const auto value = valueOf(of(resource), property);
        if (!value) return;
        std::string out = "<" + startOf(*spec) + "/>\n";
        if (what == DAV_PROP_INSERT_SUPPORTED)
            out = "<D:supported-live-property D:name=\"" + std::string(spec->name) + "\" D:namespace=\"" +
                  kSpaces[spec->ns] + "\"/>\n";
        if (what == DAV_PROP_INSERT_VALUE) out = "<" + startOf(*spec) + ">" + *value + "</" + nameOf(*spec) + ">\n";
        apr_text_append(resource->pool, text, apr_pstrdup(resource->pool, out.c_str()));
        result = what;
    });
    return result;
}

// mod_dav answers 409 for a resource that is not writable; for others it asks, and the answer says why not.
int isWritable(const dav_resource*, int) noexcept {
    return 1;
}

dav_error* refusePatch(const dav_resource* resource, const apr_xml_elem*, int, void**, int*) noexcept {
    return dav_new_error_tag(resource->pool, HTTP_FORBIDDEN, 0, 0, "The property is computed.", nullptr,
                             "cannot-modify-protected-property");
}

const dav_hooks_liveprop kHooks = {insertProperty, isWritable, kSpaces, refusePatch,
                                   nullptr,        nullptr,    nullptr, nullptr};

const dav_liveprop_spec* specOf(const PropertyName& name) {
    for (const dav_liveprop_spec* spec = kProperties; spec->name; ++spec)
        if (name.name == spec->name && name.space == kSpaces[spec->ns]) return spec;
    return nullptr;
}

} // namespace

const dav_liveprop_group kLiveProperties = {kProperties, kSpaces, &kHooks};

int findLiveProperty(const dav_resource* resource, const char* space, const char* name,
                     const dav_hooks_liveprop** hooks) noexcept {
    return isOurs(resource) ? dav_do_find_liveprop(space, name, &kLiveProperties, hooks) : 0;
}

void insertAllLiveProperties(request_rec*, const dav_resource* resource, dav_prop_insert what,
                             apr_text_header* text) noexcept {
    if (!isOurs(resource) || !resource->exists) return;
    for (const dav_liveprop_spec* spec = kProperties; spec->name; ++spec)
        insertProperty(resource, spec->propid, what, text);
}

int resourceType(const dav_resource* resource, const char** name, const char** space) noexcept {
    *name = nullptr;
    if (!isOurs(resource)) return DECLINED;
    const Place::Kind kind = of(resource).place.kind;
    if (kind != Place::Kind::book && kind != Place::Kind::principal) return DECLINED;
    *name = kind == Place::Kind::book ? "addressbook" : "principal";
    *space = kind == Place::Kind::book ? kCardSpace : kDavSpace;
    return OK;
}

// Reports ----------------------------------------------------------------------------------------------------------

std::optional<std::string> propertyElement(const Resource& resource, const PropertyName& name) {
    if (name.space == kDavSpace && name.name == "resourcetype")
        return "<D:resourcetype>" + *valueOf(resource, kResourceType) + "</D:resourcetype>";
    const dav_liveprop_spec* spec = specOf(name);
    const auto value = spec ? valueOf(resource, spec->propid) : std::nullopt;
    if (!value) return std::nullopt;
    return "<" + startOf(*spec) + ">" + *value + "</" + nameOf(*spec) + ">";
}

std::string emptyElement(const PropertyName& name) {
    if (name.space == kDavSpace) return "<D:" + name.name + "/>";
    return "<" + name.name + " xmlns=\"" + xmlText(name.space) + "\"/>";
}

std::vector<PropertyName> propertiesOf(const Resource& resource) {
    std::vector<PropertyName> all = {{kDavSpace, "resourcetype"}};
    for (const dav_liveprop_spec* spec = kProperties; spec->name; ++spec)
        if (valueOf(resource, spec->propid)) all.push_back({kSpaces[spec->ns], spec->name});
    return all;
}

// Tokens -----------------------------------------------------------------------------------------------------------

std::string syncToken(Library& library, int64_t number) {
    return std::string(kTokenStart) + library.memory().epoch() + ":" + std::to_string(number);
}

int64_t numberOfToken(Library& library, const std::string& book, const std::string& token, int refusal) {
    const auto unknown = [&] {
        return Refused(refusal, kDavSpace, "valid-sync-token",
                       "The token says nothing here any more: synchronise from the beginning, with an empty one.");
    };
    const std::string start = std::string(kTokenStart) + library.memory().epoch() + ":";
    if (!token.starts_with(start)) throw unknown();
    int64_t number = -1;
    const char* end = token.data() + token.size();
    const auto [read, error] = std::from_chars(token.data() + start.size(), end, number);
    BookMemory& memory = library.memory();
    if (error != std::errc() || read != end || number < memory.begun(book) || number > memory.latest(book) ||
        number < memory.forgottenUntil(book))
        throw unknown();
    return number;
}

} // namespace rolvane::cardbook
