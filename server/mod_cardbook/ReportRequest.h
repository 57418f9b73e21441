#pragma once

#include "contacts/vcard/VCardWriter.h"
#include "server/mod_cardbook/CardFilter.h"

#include <apr_xml.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace rolvane::cardbook {

struct PropertyName {
    std::string space, name;
    friend bool operator==(const PropertyName&, const PropertyName&) = default;
};

// The properties that C:address-data asks for (RFC 6352 section 10.4).
struct AddressData {
    VCardVersion version = VCardVersion::v3;
    struct Line {
        std::string name;
        bool withoutValue = false;
    };
    std::vector<Line> lines; // none: the whole card
};

// A REPORT's body.
struct ReportRequest {
    enum class Kind { multiget, query, sync, other };
    Kind kind = Kind::other;
    std::vector<PropertyName> properties; // in their order; address-data is not among them
    bool allProperties = false;
    bool namesOnly = false;
    std::optional<AddressData> data;
    std::vector<std::string> hrefs; // as they stand; multiget
    CardFilter filter;              // query
    std::optional<uint64_t> limit;  // query, sync
    std::string token;              // sync; "" at first
};

// Throws Refused for a body that the RFCs do not allow or that asks for what is not there. Pure.
ReportRequest parseReport(const apr_xml_doc* doc);

} // namespace rolvane::cardbook
