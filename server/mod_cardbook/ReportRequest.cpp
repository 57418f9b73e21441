#include "server/mod_cardbook/ReportRequest.h"

#include "contacts/vcard/VCardText.h"
#include "server/mod_cardbook/Refused.h"
#include "server/mod_cardbook/XmlText.h"
#include "server/mod_davacl/SyncRequest.h"
#include "server/mod_davacl/XmlElements.h"

namespace rolvane::cardbook {
namespace {

using davacl::attributeOf;
using davacl::child;
using davacl::isDav;
using davacl::textOf;

constexpr size_t kMostNames = 1000; // each is looked for in every card

[[noreturn]] void badRequest(const std::string& words) {
    throw Refused(400, words);
}

AddressData addressDataOf(const apr_xml_doc* doc, const apr_xml_elem* element) {
    AddressData data;
    const std::string type = vcardLower(attributeOf(element, "content-type"));
    const std::string version = attributeOf(element, "version");
    if ((!type.empty() && type != "text/vcard") || (!version.empty() && version != "3.0" && version != "4.0"))
        throw Refused(403, kCardSpace, "supported-address-data", "Cards are text/vcard of version 3.0 or 4.0.");
    data.version = version == "4.0" ? VCardVersion::v4 : VCardVersion::v3;
    for (const apr_xml_elem* e = element->first_child; e; e = e->next) {
        if (!isCard(doc, e, "prop")) continue; // C:allprop says what is the rule anyway
        const std::string name = vcardUpper(attributeOf(e, "name"));
        if (name.empty()) badRequest("A C:prop of an address-data names no property.");
        if (data.lines.size() == kMostNames) badRequest("An address-data names too many properties.");
        data.lines.push_back({name, attributeOf(e, "novalue") == "yes"});
    }
    return data;
}

void readProperties(const apr_xml_doc* doc, const apr_xml_elem* prop, ReportRequest& request) {
    for (const apr_xml_elem* e = prop->first_child; e; e = e->next) {
        if (request.properties.size() == kMostNames) badRequest("The report asks for too many properties.");
        if (isCard(doc, e, "address-data"))
            request.data = addressDataOf(doc, e);
        else
            request.properties.push_back({davacl::spaceOf(doc, e), e->name});
    }
}

std::optional<uint64_t> limitOf(const apr_xml_elem* number) {
    std::optional<uint64_t> value;
    if (!davacl::readNumberOfResults(number, value)) badRequest("nresults is no number above 0.");
    return value;
}

} // namespace

ReportRequest parseReport(const apr_xml_doc* doc) {
    ReportRequest request;
    const apr_xml_elem* root = doc ? doc->root : nullptr;
    if (isCard(doc, root, "addressbook-multiget")) request.kind = ReportRequest::Kind::multiget;
    if (isCard(doc, root, "addressbook-query")) request.kind = ReportRequest::Kind::query;
    if (isDav(root, "sync-collection")) request.kind = ReportRequest::Kind::sync;
    if (request.kind == ReportRequest::Kind::other) return request;
    if (const apr_xml_elem* prop = child(root, "prop")) readProperties(doc, prop, request);
    request.allProperties = child(root, "allprop") != nullptr;
    request.namesOnly = child(root, "propname") != nullptr;
    switch (request.kind) {
    case ReportRequest::Kind::multiget:
        for (const apr_xml_elem* e = root->first_child; e; e = e->next)
            if (isDav(e, "href")) request.hrefs.push_back(textOf(e));
        if (request.hrefs.empty()) badRequest("An addressbook-multiget names one DAV:href at least.");
        break;
    case ReportRequest::Kind::query:
        request.filter = parseFilter(doc, cardChild(doc, root, "filter"));
        request.limit = limitOf(cardChild(doc, cardChild(doc, root, "limit"), "nresults"));
        break;
    default: {
        const char* problem = nullptr;
        const auto sync = davacl::parseSyncRequest(root, problem);
        if (!sync) badRequest(problem);
        if (sync->isDeep) throw Refused(403, kDavSpace, "sync-traversal-supported", "There is nothing below a book.");
        request.token = sync->token;
        request.limit = sync->limit;
    }
    }
    return request;
}

} // namespace rolvane::cardbook
