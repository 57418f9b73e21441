#pragma once

#include "server/mod_cardbook/ReportRequest.h"
#include "server/mod_cardbook/Resource.h"

#include <optional>
#include <string>

namespace rolvane::cardbook {

// The live properties. All are protected: a change of one is refused.
extern const dav_liveprop_group kLiveProperties;
int findLiveProperty(const dav_resource* resource, const char* space, const char* name,
                     const dav_hooks_liveprop** hooks) noexcept;
void insertAllLiveProperties(request_rec* r, const dav_resource* resource, dav_prop_insert what,
                             apr_text_header* text) noexcept;
int resourceType(const dav_resource* resource, const char** name, const char** space) noexcept;

// A whole property of a resource, as reports have it; nothing where it has none.
std::optional<std::string> propertyElement(const Resource& resource, const PropertyName& name);
// An element without content.
std::string emptyElement(const PropertyName& name);
// The names that an answer to DAV:allprop and DAV:propname has.
std::vector<PropertyName> propertiesOf(const Resource& resource);

// The value of DAV:sync-token for a book at a number.
std::string syncToken(Library& library, int64_t number);
// The number of a token of that book. Throws Refused, valid-sync-token, with the status `refusal` for any other text.
int64_t numberOfToken(Library& library, const std::string& book, const std::string& token, int refusal);

} // namespace rolvane::cardbook
