#include "conduits/EditsAlone.h"

#include "contacts/database/CXRolvane.h"

#include <algorithm>
#include <vector>

namespace rolvane {

namespace {
constexpr int64_t kFewEntries = 500;
}

bool areEditsOfPeopleAlone(CXRolvane& database, int64_t from, int64_t to) {
    if (to < from || to - from > kFewEntries) return false;
    const auto count = static_cast<size_t>(to - from);
    if (count == 0) return true;
    const std::vector<CXJournalEntry> entries = database.journalEntries(from, count);
    return entries.size() == count && entries.back().sequence == to &&
           std::all_of(entries.begin(), entries.end(), [](const CXJournalEntry& entry) {
               return entry.kind == CXChangeKind::updated && entry.uniqueId.endsWith("Person");
           });
}

} // namespace rolvane
