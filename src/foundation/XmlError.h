#pragma once

#include <string>

struct _xmlError; // libxml2's error record, so that including this header does not include libxml2

namespace rolvane {

// The one place where an error of libxml2 becomes ours: "line 12: Opening and ending tag mismatch". The caller throws
// it under the name of its own failure. A null error gives "the XML is not well-formed".
std::string cxReasonOfXmlError(const _xmlError* error);

} // namespace rolvane
