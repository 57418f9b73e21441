#include "support/UserWorld.h"

#include <csignal>
#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <ostream>
#include <poll.h>
#include <sys/file.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace rolvane::test {

namespace fs = std::filesystem;

std::ostream& operator<<(std::ostream& out, const Ran& ran) {
    return out << "exit status " << ran.status << "\nstandard output:\n"
               << ran.output << "standard error:\n"
               << ran.errors;
}

UserWorld::UserWorld() {
    home.setVariable("ROLVANE_MANAGER", managerProgram());
    home.setVariable("LANG", "C.UTF-8");
    home.setVariable("NOTIFY_SOCKET", std::nullopt);
    home.setVariable("CREDENTIALS_DIRECTORY", std::nullopt);
}

UserWorld::~UserWorld() {
    const auto pid = daemon();
    if (!pid) return;
    const int descriptor = static_cast<int>(::syscall(SYS_pidfd_open, *pid, 0));
    ::kill(*pid, SIGKILL);
    pollfd ended{descriptor, POLLIN, 0};
    constexpr int kMilliseconds = 5000;
    if (descriptor >= 0) {
        ::poll(&ended, 1, kMilliseconds);
        ::close(descriptor);
    }
}

PrivateBus& UserWorld::bus() {
    if (!_bus) {
        _bus = std::make_unique<PrivateBus>();
        home.setVariable("DBUS_SESSION_BUS_ADDRESS", _bus->address());
    }
    return *_bus;
}

PrivateStore& UserWorld::store() {
    if (!_store) {
        PrivateStoreOptions options;
        options.stateDirectory = home / "store";
        options.ownsProcess = true;
        options.accessLog = true;
        options.extraConfiguration = storeConfiguration;
        _store = std::make_unique<PrivateStore>(options);
        _store->addUser(kUser, kPassword);
        _store->start();
    }
    return *_store;
}

std::set<std::string> UserWorld::tree() {
    std::set<std::string> files;
    const fs::path root = treeDirectory();
    std::error_code none;
    for (fs::recursive_directory_iterator entry(root, none), end; entry != end; entry.increment(none)) {
        if (entry->path().filename().string().starts_with(".DAV")) {
            entry.disable_recursion_pending();
            continue;
        }
        if (entry->is_regular_file(none)) files.insert(entry->path().lexically_relative(root).string());
    }
    return files;
}

void UserWorld::makeAccount() {
    const Ran made = rolvane({"account", "set", "--user", kUser, "--endpoint", store().endpointTemplate(), "--ca-file",
                              store().caFile(), "--ask-password"},
                             std::string(kPassword) + "\n");
    ASSERT_EQ(made.status, 0) << made;
}

std::string UserWorld::rolvaneProgram() {
    return ROLVANE_PROGRAM;
}

std::string UserWorld::managerProgram() {
    return ROLVANE_MANAGER_PROGRAM;
}

Ran UserWorld::run(std::vector<std::string> command, const std::string& input, double timeoutSeconds) {
    ChildProcess child({.arguments = std::move(command),
                        .environment = home.environment(),
                        .input = input.empty() ? std::string() : input});
    if (input.empty()) child.closeInput();
    const auto ending = child.wait(timeoutSeconds);
    if (!ending) child.kill();
    const int status = !ending ? -1 : ending->signal ? 128 + ending->signal : ending->status;
    return {status, child.output(), child.errors()};
}

Ran UserWorld::rolvane(std::vector<std::string> arguments, const std::string& input, double timeoutSeconds) {
    arguments.insert(arguments.begin(), rolvaneProgram());
    return run(std::move(arguments), input, timeoutSeconds);
}

std::unique_ptr<ChildProcess> UserWorld::startRolvane(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), rolvaneProgram());
    return std::make_unique<ChildProcess>(
        ChildProcess::Options{.arguments = std::move(arguments), .environment = home.environment()});
}

std::unique_ptr<ChildProcess> UserWorld::startManager(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), managerProgram());
    return std::make_unique<ChildProcess>(
        ChildProcess::Options{.arguments = std::move(arguments), .environment = home.environment()});
}

std::optional<pid_t> UserWorld::daemon() {
    // The daemon holds a lock on this file as long as it lives, and its number is the file's text.
    const std::string path = home / "state/rolvane/RolvaneManager.lock";
    std::ifstream file(path);
    pid_t pid = 0;
    if (!(file >> pid) || pid <= 0) return std::nullopt;
    // Its program cannot be read by others than root while it holds a password; its name and its command line can.
    std::ifstream line("/proc/" + std::to_string(pid) + "/cmdline");
    std::string program;
    std::getline(line, program, '\0');
    return fs::path(program).filename() == "RolvaneManager" ? std::optional(pid) : std::nullopt;
}

std::string UserWorld::write(const std::string& name, const std::string& contents) {
    const std::string path = home / name;
    std::ofstream(path, std::ios::binary) << contents;
    return path;
}

} // namespace rolvane::test
