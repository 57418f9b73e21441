#pragma once

#include "CommandWorld.h"

namespace rolvane::test {

// Another person on the store of a world, with a home, a session bus and a daemon of their own. At the end the daemon
// is gone. Used by one thread.
class Neighbour {
public:
    // Signs up at the world's store.
    Neighbour(CommandWorld& world, const std::string& user, bool withBus = true);
    // On another store, where the user is known by UserWorld::kPassword: options of `rolvane account set`.
    Neighbour(CommandWorld& world, const std::string& user, const std::vector<std::string>& account);
    // On a computer where nothing is set up.
    struct NothingYet {};
    Neighbour(CommandWorld& world, const std::string& user, NothingYet nothing);
    ~Neighbour();
    Neighbour(const Neighbour&) = delete;
    Neighbour& operator=(const Neighbour&) = delete;

    Ran rolvane(std::vector<std::string> arguments, const std::string& input = {});
    std::string done(std::vector<std::string> arguments); // it has to end with 0
    nlohmann::json json(std::vector<std::string> arguments, int status = kDone);
    std::optional<pid_t> daemon();
    std::unique_ptr<ChildProcess> startRolvane(std::vector<std::string> arguments);
    std::unique_ptr<ChildProcess> startManager(std::vector<std::string> arguments = {});
    std::vector<std::string> environment() const; // of every program of this person
    std::string databasePath() const { return _home / "data/rolvane/contacts.db"; }
    const std::string& homePath() const { return _home.path(); }

    const std::string user;

private:
    void makeHome(bool withBus);
    void setAccount(const std::vector<std::string>& account);

    CommandWorld& _world;
    TempDirectory _home;
    std::unique_ptr<PrivateBus> _bus;
};

} // namespace rolvane::test
