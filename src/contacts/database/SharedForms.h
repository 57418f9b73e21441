#pragma once

#include "contacts/records/Identifier.h"
#include "foundation/Value.h"

#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// Turns identifiers of a list of people into the shared form ("CXPerson") without making a text for those that stand in
// a list of before: who lists a hundred thousand people mostly finds the ones that were there. `known` holds shared
// forms; the order of the two lists should be the same but for what was added, moved or taken out. One thread at a
// time.
class SharedForms {
public:
    explicit SharedForms(const Array& known) : _known(known), _next(known.begin()), _end(known.end()) {}

    UniqueId of(std::string_view person);
    std::vector<UniqueId> of(std::vector<UniqueId> people);

private:
    const SharedText* find(std::string_view shared);

    const Array _known; // keeps what the others point into
    std::vector<Value>::const_iterator _next, _end;
    size_t _misses = 0;
    std::string _buffer;
};

} // namespace rolvane
