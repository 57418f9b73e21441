#pragma once

#include "contacts/database/CXRolvane.h"
#include "foundation/Preferences.h"
#include "store/account/Account.h"
#include "support/UserWorld.h"

#include <memory>
#include <string>

#include <gtest/gtest.h>

namespace rolvane::test {

// A socket on a free loopback port that takes connections (the kernel does) and never says a word.
class SilentServer {
public:
    SilentServer();
    ~SilentServer();
    SilentServer(const SilentServer&) = delete;
    SilentServer& operator=(const SilentServer&) = delete;
    int port() const { return _port; }
    bool somebodyWaits(double timeoutSeconds) const; // for an answer

private:
    int _fd = -1, _port = 0;
};

// A user whose database, preferences and account are set up by the framework itself, for tests of the daemon's process.
class DaemonWorld : public UserWorld {
public:
    ~DaemonWorld();

    void setDebugLevel(int level);
    // Opened on first use; closed before a test looks at what another process made of the file.
    CXRolvane& database();
    void closeDatabase() { _database.reset(); }
    void addPeople(int count, const std::string& firstName = "Person");
    void publishEverything(); // on the account's location; the account is there before
    CXDAVAccount account() const { return _account; }
    void saveAccountOn(PrivateStore& store, const std::string& password = kPassword);
    void saveAccountAt(int port);      // of a loopback address; without a password
    void saveAccountOnPlain(int port); // the same, of a server that speaks plain http
    // An account whose store is not there, and a subscription on it: reason for a pass that has nothing to do.
    void subscribeFarAway();
    size_t pendingChanges();

    // Started with debug level 1, and in its run loop.
    std::unique_ptr<ChildProcess> serving(std::vector<std::string> arguments = {});

    // How the published tree differs from the database, in words; empty when it does not.
    std::string differences();

private:
    std::string groupDifferences(const CXGroup& group);
    std::unique_ptr<CXRolvane> _database;
    CXDAVAccount _account;
};

size_t linesWith(const std::string& text, const std::string& part);

inline constexpr const char* kServing = "Entering main run loop\\.";

} // namespace rolvane::test
