#pragma once

#include <cstddef>
#include <string>

namespace rolvane {

// A file that is written whole is a temporary one first: its name, this mark, and six random letters.
inline constexpr const char* kTemporaryMark = ".writing-";

// Removes the temporary files that lie in the directory itself and belong to no process any more; also those of earlier
// versions in the directories of locks, whose names had no mark. A file that is being written is locked by its writer,
// and one that was touched within the last minute is left alone. Returns how many went. A missing directory is no
// error.
size_t removeLeftTemporaryFiles(const std::string& directory);

} // namespace rolvane
