#pragma once

#include "foundation/CXException.h"

#include <string>
#include <string_view>

namespace rolvane {

// The one place where an error number of the operating system becomes an exception: "cannot write "/x/y": No space
// left on device". `doing` is the verb with its preposition if any ("write", "make the directory"). The name is
// kCXFileException unless another is given.
CXException cxSystemException(std::string_view doing, std::string_view path, int error,
                              const char* name = kCXFileException);

} // namespace rolvane
