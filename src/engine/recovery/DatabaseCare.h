#pragma once

namespace rolvane {

struct EngineParts;

// Key of the daemon's domain: what is damaged in the contact database, for as long as it is; a text for people.
inline constexpr const char* kCXDDamagedDatabase = "CXDDamagedDatabase";

// A pass reads what has changed out of the contact database, and a damaged one would have it tell that contacts are
// gone. So nothing is sent while it is. Main thread.

// Before a pass: false when the database is damaged and cannot be repaired. What was found earlier, by whatever run, is
// repaired first, and told either way.
bool mendDatabase(EngineParts& parts);
// Has reading it shown damage since? It is noted durably then, and told.
bool meetsDamage(EngineParts& parts);

} // namespace rolvane
