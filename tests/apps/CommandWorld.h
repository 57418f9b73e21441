#pragma once

#include "support/UserWorld.h"

#include <gtest/gtest.h>
#include <map>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

namespace rolvane::test {

// The documented exit codes.
enum : int { kDone = 0, kFailure = 1, kWrongLine = 2, kNoSuchThing = 3, kPart = 4, kNotAllowed = 5, kNotReached = 6 };

// A user at a shell.
class CommandWorld : public UserWorld {
public:
    // Standard output of a command that has to end with 0.
    std::string done(std::vector<std::string> arguments, const std::string& input = {});
    // The document that the command prints with --json; it has to end with `status`.
    nlohmann::json json(std::vector<std::string> arguments, int status = kDone, const std::string& input = {});
    std::string add(const std::string& first, const std::vector<std::string>& more = {}); // the new identifier
    std::string group(const std::string& name, const std::vector<std::string>& members = {});
    // The paths of the published tree, each identifier replaced by the name that the test gave it.
    std::set<std::string> namedTree();
    std::string published(const std::string& path) { return treeDirectory() + "/" + path; }

private:
    std::map<std::string, std::string> _names; // by identifier
};

// One line on standard error that tells it, and the exit code; nothing on standard output.
testing::AssertionResult saysOnce(const Ran& ran, int status, const std::string& part);

std::string contentsOf(const std::string& path);
size_t lineCount(const std::string& text);

} // namespace rolvane::test
