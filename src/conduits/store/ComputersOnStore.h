#pragma once

#include "foundation/Url.h"
#include "foundation/Value.h"
#include "model/Computers.h"

#include <optional>
#include <string>
#include <vector>

namespace rolvane {

class CXDAVManager;

// The file "computers" of a published tree: which computers of its owner keep it in step. A property list,
//
//   id -> {"name" -> string, "seen" -> date}
//
// Readers of the tree can read it, too. Each operation waits for the store. The client is borrowed.
class ComputersOnStore {
public:
    static constexpr const char* kFile = "computers";

    ComputersOnStore(CXDAVManager& manager, const Url& base);

    // In the order of their identifiers; none where the tree has no such file. Nothing when that could not be learnt.
    std::optional<std::vector<Computer>> read();
    // Replaces the file's entry of the computer, and returns all entries. Nothing when that failed.
    std::optional<std::vector<Computer>> put(const Computer& computer);
    bool remove(const std::string& id); // true: it is not there

private:
    std::optional<std::vector<Computer>> change(const std::string& id, const Value& entry);

    CXDAVManager& _manager;
    const Url _file;
};

// The same as a value of the preferences.
Array valueOfComputers(const std::vector<Computer>& computers);
std::vector<Computer> computersOfValue(const Value& value);

} // namespace rolvane
