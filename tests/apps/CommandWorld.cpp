#include "CommandWorld.h"

#include <algorithm>
#include <fstream>

namespace rolvane::test {

std::string CommandWorld::done(std::vector<std::string> arguments, const std::string& input) {
    const Ran ran = rolvane(std::move(arguments), input);
    EXPECT_EQ(ran.status, kDone) << ran;
    return ran.output;
}

nlohmann::json CommandWorld::json(std::vector<std::string> arguments, int status, const std::string& input) {
    arguments.push_back("--json");
    const Ran ran = rolvane(std::move(arguments), input);
    EXPECT_EQ(ran.status, status) << ran;
    nlohmann::json data = nlohmann::json::parse(ran.output, nullptr, false);
    EXPECT_FALSE(data.is_discarded()) << "no JSON document: " << ran;
    return data;
}

std::string CommandWorld::add(const std::string& first, const std::vector<std::string>& more) {
    std::vector<std::string> arguments{"add", "--first", first};
    arguments.insert(arguments.end(), more.begin(), more.end());
    std::string uid = done(arguments);
    if (!uid.empty()) uid.pop_back();
    _names[uid] = first;
    return uid;
}

std::string CommandWorld::group(const std::string& name, const std::vector<std::string>& members) {
    std::vector<std::string> arguments{"group", "create", name};
    arguments.insert(arguments.end(), members.begin(), members.end());
    std::string uid = done(arguments);
    if (!uid.empty()) uid.pop_back();
    _names[uid] = name;
    return uid;
}

std::set<std::string> CommandWorld::namedTree() {
    std::set<std::string> named;
    for (std::string path : tree()) {
        const size_t last = path.rfind('/') + 1; // 0 when there is none
        const auto found = _names.find(path.substr(last));
        if (found != _names.end()) path = (path.starts_with("People/") ? "People/" : "") + found->second;
        named.insert(path);
    }
    return named;
}

testing::AssertionResult saysOnce(const Ran& ran, int status, const std::string& part) {
    if (ran.status == status && ran.output.empty() && lineCount(ran.errors) == 1 &&
        ran.errors.starts_with("rolvane: ") && ran.errors.find(part) != std::string::npos)
        return testing::AssertionSuccess();
    return testing::AssertionFailure() << "expected exit status " << status << " and one line that says \"" << part
                                       << "\"; got " << ran;
}

std::string contentsOf(const std::string& path) {
    std::ifstream file(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(file), {});
}

size_t lineCount(const std::string& text) {
    return static_cast<size_t>(std::count(text.begin(), text.end(), '\n'));
}

} // namespace rolvane::test
