#pragma once

#include "model/CXDChangeRecord.h"

#include <memory>
#include <optional>
#include <utility>

namespace rolvane::test {

// A record whose absent identifiers are null pointers.
inline CXDChangeRecordPtr testRecord(int32_t source, int type, const char* person, const char* group,
                                     Value payload = {}, const char* user = "<self>") {
    const auto uid = [](const char* text) { return text ? std::optional(UniqueId(text)) : std::nullopt; };
    return std::make_shared<CXDChangeRecord>(source, type, UserName(user), uid(person), uid(group), std::move(payload));
}

} // namespace rolvane::test
