#pragma once

#include "Texts.h"

#include <string>

namespace rolvane::cli {

// "1 person", "2 people": within sentences that are English everywhere. countedText stands in translated ones.
template <class Number>
std::string counted(Number count, const char* one, const char* more) {
    return shownNumber(static_cast<unsigned long long>(count)) + " " + (count == 1 ? one : more);
}

} // namespace rolvane::cli
