#pragma once

namespace rolvane::test {

// From here on every write to an SQLite file of this process asks first; false makes the write fail as on a full disk.
// One process-wide; none takes it away.
void interceptWrites(bool (*mayWrite)());

} // namespace rolvane::test
