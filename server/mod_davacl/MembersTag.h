#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace rolvane::davacl {

// A text that tells the state of a directory's direct members: whenever one is added, removed, replaced, written or
// touched, the text is another one. It is made of each entry's name, kind, inode, size and times; contents are not
// read.
//
// Nothing when the directory cannot be read, and while its newest entry is younger than `kSettleSeconds` (or dated in
// the future): file systems tell times in steps, and within one step a second change would not show.
std::optional<std::string> membersTag(const std::string& directory, int64_t nowInNanoseconds);

inline constexpr double kSettleSeconds = 3;

} // namespace rolvane::davacl
