#pragma once

#include <cstdint>

namespace rolvane {

class CXRolvane;

// Does the journal hold nothing but edits of people behind one position, up to another? Then the database has the same
// people and groups at both, and its groups say the same. Looks at so many entries; where they are many, or some were
// dropped from the journal, the answer is no.
bool areEditsOfPeopleAlone(CXRolvane& database, int64_t from, int64_t to);

} // namespace rolvane
