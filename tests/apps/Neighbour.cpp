#include "Neighbour.h"

#include <filesystem>

namespace rolvane::test {

namespace {

constexpr std::pair<const char*, const char*> kDirectories[] = {{"XDG_DATA_HOME", "data"},
                                                                {"XDG_STATE_HOME", "state"},
                                                                {"XDG_CACHE_HOME", "cache"},
                                                                {"XDG_CONFIG_HOME", "config"},
                                                                {"XDG_RUNTIME_DIR", "runtime"}};

} // namespace

Neighbour::Neighbour(CommandWorld& world, const std::string& name, bool withBus) : user(name), _world(world) {
    makeHome(withBus);
    world.store().addUser(user, UserWorld::kPassword);
    setAccount({"--endpoint", world.store().endpointTemplate(), "--ca-file", world.store().caFile()});
}

Neighbour::Neighbour(CommandWorld& world, const std::string& name, const std::vector<std::string>& account)
    : user(name), _world(world) {
    makeHome(true);
    setAccount(account);
}

Neighbour::Neighbour(CommandWorld& world, const std::string& name, NothingYet) : user(name), _world(world) {
    makeHome(true);
}

void Neighbour::makeHome(bool withBus) {
    for (const auto& [variable, directory] : kDirectories) {
        std::filesystem::create_directory(_home / directory);
        std::filesystem::permissions(_home / directory, std::filesystem::perms::owner_all);
    }
    if (withBus) _bus = std::make_unique<PrivateBus>();
}

void Neighbour::setAccount(const std::vector<std::string>& account) {
    std::vector<std::string> arguments = {"account", "set", "--user", user, "--ask-password"};
    arguments.insert(arguments.end(), account.begin(), account.end());
    const Ran made = rolvane(std::move(arguments), std::string(UserWorld::kPassword) + "\n");
    EXPECT_EQ(made.status, kDone) << made;
}

Neighbour::~Neighbour() {
    (void)rolvane({"daemon", "stop"});
}

std::vector<std::string> Neighbour::environment() const {
    std::vector<std::string> variables = _world.home.environment();
    std::erase_if(variables, [](const std::string& variable) {
        return variable.starts_with("XDG_") || variable.starts_with("HOME=") || variable.starts_with("DBUS_");
    });
    variables.push_back("HOME=" + _home.path());
    for (const auto& [variable, directory] : kDirectories)
        variables.push_back(std::string(variable) + "=" + _home / directory);
    if (_bus) variables.push_back("DBUS_SESSION_BUS_ADDRESS=" + _bus->address());
    return variables;
}

Ran Neighbour::rolvane(std::vector<std::string> arguments, const std::string& input) {
    arguments.insert(arguments.begin(), UserWorld::rolvaneProgram());
    ChildProcess child({.arguments = std::move(arguments), .environment = environment(), .input = input});
    if (input.empty()) child.closeInput();
    constexpr double kSeconds = 60;
    const auto ending = child.wait(kSeconds);
    if (!ending) child.kill();
    const int status = !ending ? -1 : ending->signal ? 128 + ending->signal : ending->status;
    return {status, child.output(), child.errors()};
}

std::unique_ptr<ChildProcess> Neighbour::startRolvane(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), UserWorld::rolvaneProgram());
    return std::make_unique<ChildProcess>(
        ChildProcess::Options{.arguments = std::move(arguments), .environment = environment()});
}

std::unique_ptr<ChildProcess> Neighbour::startManager(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), UserWorld::managerProgram());
    return std::make_unique<ChildProcess>(
        ChildProcess::Options{.arguments = std::move(arguments), .environment = environment()});
}

std::string Neighbour::done(std::vector<std::string> arguments) {
    const Ran ran = rolvane(std::move(arguments));
    EXPECT_EQ(ran.status, kDone) << ran;
    return ran.output;
}

nlohmann::json Neighbour::json(std::vector<std::string> arguments, int status) {
    arguments.push_back("--json");
    const Ran ran = rolvane(std::move(arguments));
    EXPECT_EQ(ran.status, status) << ran;
    nlohmann::json data = nlohmann::json::parse(ran.output, nullptr, false);
    EXPECT_FALSE(data.is_discarded()) << "no JSON document: " << ran;
    return data;
}

std::optional<pid_t> Neighbour::daemon() {
    const Ran ran = rolvane({"daemon", "status", "--json"});
    const auto data = nlohmann::json::parse(ran.output, nullptr, false);
    return data.is_discarded() || data["process"].is_null() ? std::nullopt : std::optional<pid_t>(data["process"]);
}

} // namespace rolvane::test
