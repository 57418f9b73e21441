#pragma once

#include "server/PrivateStore.h"
#include "support/ChildProcess.h"
#include "support/PrivateBus.h"
#include "support/TempHome.h"

#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace rolvane::test {

// A program that has ended.
struct Ran {
    int status = -1; // exit status, 128 + number after a signal, -1 when it did not end in time and was killed
    std::string output, errors;
};
std::ostream& operator<<(std::ostream& out, const Ran& ran); // all of it, for failure messages

// A person with a home, the two programs and, when asked for, a session bus and a private store with an account on it.
// At the end everything is stopped and gone: a daemon that the contact application started, too. Used by one thread.
class UserWorld {
public:
    static constexpr const char* kUser = "alice";
    static constexpr const char* kPassword = "a long and private word";

    UserWorld();
    ~UserWorld();
    UserWorld(const UserWorld&) = delete;
    UserWorld& operator=(const UserWorld&) = delete;

    TempHome home;

    PrivateBus& bus();                           // started on first use; the programs that start afterwards know it
    PrivateStore& store();                       // started on first use, with the user kUser
    std::vector<std::string> storeConfiguration; // lines for the end of its configuration, set before the first use
    // Where the files of the user's published tree lie.
    std::string treeDirectory() { return store().userDirectory(kUser) + "/Contacts"; }
    // Paths of the files below it, relative, without the server's own; empty when there is no tree.
    std::set<std::string> tree();
    // `rolvane account set` for that store; fails the test when it does not work.
    void makeAccount();

    // The contact application.
    static std::string rolvaneProgram();
    Ran rolvane(std::vector<std::string> arguments, const std::string& input = {}, double timeoutSeconds = 60);
    std::unique_ptr<ChildProcess> startRolvane(std::vector<std::string> arguments);
    // Any program, in this world.
    Ran run(std::vector<std::string> command, const std::string& input = {}, double timeoutSeconds = 60);

    // The daemon, as a child of the test; its log is its standard error.
    static std::string managerProgram();
    std::unique_ptr<ChildProcess> startManager(std::vector<std::string> arguments = {});
    std::optional<pid_t> daemon(); // whichever runs in this home

    std::string write(const std::string& name, const std::string& contents); // a file in the home; its path

private:
    std::unique_ptr<PrivateBus> _bus;
    std::unique_ptr<PrivateStore> _store;
};

} // namespace rolvane::test
