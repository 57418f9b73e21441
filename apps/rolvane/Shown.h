#pragma once

#include "contacts/database/CXRolvane.h"

#include <CLI/CLI.hpp>
#include <nlohmann/json.hpp>
#include <set>
#include <string>
#include <vector>

namespace rolvane::cli {

// Each reader of the owner's tree gets this of the contact database as it is, unsaved changes included.
struct Shown {
    std::set<UniqueId> people;
    std::vector<CXGroupRef> groups; // by name

    bool empty() const { return people.empty() && groups.empty(); }
    std::string amount() const; // "318 people and 6 groups", "1 person"
    bool isOne() const { return people.size() + groups.size() == 1; }
};
Shown shownToReaders(CXRolvane& database);
// "318 people and 6 groups".
std::string amountText(size_t people, size_t groups);
// "1 user (bob)", "2 users (bob and cid)", "5 users (bob, cid and 3 others)".
std::string usersText(const std::vector<std::string>& users);

// --dry-run: a command tells what it would do, and changes nothing: no byte here or on the store.
void declareTrial(CLI::App& command, bool& dryRun);
nlohmann::ordered_json trialJson(const Shown& what, const std::vector<std::string>& users);

// The part of the first that is missing in the second.
Shown without(const Shown& all, const Shown& those);

} // namespace rolvane::cli
