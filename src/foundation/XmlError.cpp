#include "foundation/XmlError.h"

#include <fmt/format.h>
#include <libxml/xmlerror.h>

namespace rolvane {

std::string cxReasonOfXmlError(const _xmlError* error) {
    if (!error || !error->message) return "the XML is not well-formed";
    std::string message = error->message;
    while (!message.empty() && (message.back() == '\n' || message.back() == ' ')) message.pop_back();
    return fmt::format("line {}: {}", error->line, message);
}

} // namespace rolvane
