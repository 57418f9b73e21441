#pragma once

#include "foundation/Date.h"
#include "foundation/Value.h"

#include <optional>
#include <string>
#include <vector>

namespace rolvane {

enum class CXSide { ours, theirs };

// A single value that both sides have changed. The dictionaries hold it under the property's name, with what belongs
// together with it (a photo and its media type); a name that is missing means that this side has no such value.
struct CXMergeConflict {
    std::string property;
    Dictionary kept, lost;
    CXSide winner = CXSide::ours;
    friend bool operator==(const CXMergeConflict&, const CXMergeConflict&) = default;
};

struct CXMergeResult {
    Dictionary contact;
    std::vector<CXMergeConflict> conflicts; // in order of the properties' names
};

// Merges what two sides have made of one contact, property by property, against the last version that both had.
//
// - A property that one side alone has changed is as that side has it. Removing it is a change.
// - Entries of multi-values are told apart by identifier, else by label and value. Entries that either side has added
//   or changed are kept, also where both changed the same one; an entry leaves that one side removed and the other one
//   left as it was. The entries of theirs come first, and what is said twice is there once.
// - Lists of strings are merged by element.
// - Any other value is single. Where both sides changed it to different values, the value of `later` is kept and the
//   other one is a conflict. A photo and its type are one value, a birthday as a date and as a text, too.
//
// Without a base nothing counts as common: every value of either side is an addition, and nothing is lost.
// Where a remote location is put is not merged: the result has none. Merging the result with the same `ours` again
// gives the same result. Pure; containers of the result are shared with neither side.
CXMergeResult mergedContact(const std::optional<Dictionary>& base, const Dictionary& ours, const Dictionary& theirs,
                            CXSide later);

// The base for merging with `theirs` where `sent`, a later version of ours, may have come to the other side or not. An
// entry or single value of theirs that is as it was sent was had by both; so was an entry missing on purpose. All else
// is as in `base`. An entry that was new in `sent` and lies there, changed or not, says that all of it came: then it is
// the base itself. Pure; the result shares its containers with the arguments.
Dictionary cxBaseAfterSending(const Dictionary& base, const Dictionary& sent, const Dictionary& theirs);
// Where `sent` may have come and is older than theirs, a single value of ours that it held gives way to another one of
// theirs, whatever else was edited here since: the other side may have seen it and replaced it. It stays noted as a
// conflict.
void cxYieldWhatWasSent(CXMergeResult& merge, const Dictionary& sent);

// The side of the later date. Of equal dates, and where one is missing, the side whose content is the greater one as
// encoded bytes: whoever merges comes to the same.
CXSide laterSide(const std::optional<Date>& ours, const std::optional<Date>& theirs, const Dictionary& ourContact,
                 const Dictionary& theirContact);

} // namespace rolvane
