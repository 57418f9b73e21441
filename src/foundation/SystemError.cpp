#include "foundation/SystemError.h"

#include <fmt/format.h>
#include <system_error>

namespace rolvane {

CXException cxSystemException(std::string_view doing, std::string_view path, int error, const char* name) {
    return CXException(name, fmt::format("cannot {} \"{}\": {}", doing, path, std::generic_category().message(error)));
}

} // namespace rolvane
