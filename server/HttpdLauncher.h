#pragma once

#include "server/StoreProcess.h"

#include <optional>
#include <string>
#include <vector>

namespace rolvane {

// Starts, finds and stops an httpd of this user's that has a state directory of its own: conf/httpd.conf,
// run/httpd.pid, logs/error.log, launcher.lock and startup.log lie in it. The private store and the server of the
// address books have one each. Any process may hold a launcher on a directory that another one uses. One object belongs
// to one thread. Every operation throws CXPrivateStoreException, whose reason begins with the service's name and says
// what to do.
class HttpdLauncher {
public:
    struct Service {
        std::string name; // begins every message: "The store"
        std::string stateDirectory;
        std::string program; // httpd's
        std::string modules; // httpd's directory of modules
    };
    explicit HttpdLauncher(Service service) : _service(std::move(service)) {}

    // Held while a launcher starts, stops or changes something; one that comes second waits. Closing it gives it back.
    FileHandle lock() const;
    // The master process, when it runs.
    std::optional<StoreProcess> running() const;
    // Refuses when the program or one of the modules ("mod_dav.so") is not installed.
    void checkProgram(const std::vector<std::string>& neededModules) const;
    // Ends workers whose master was killed: they go on serving and hold the port.
    void endOrphans() const;
    // Starts httpd and returns when it answers on the loopback port. When it does not, it is ended before this throws.
    // Of this process's environment it knows only what StoreProcess::launch says, and the given variables.
    void launch(const StoreIdentity& identity, int port, bool tls, const std::vector<std::string>& environment) const;

    // httpd's own words about its configuration; "" when it would start with it.
    std::string complaint(const StoreIdentity& identity) const;

    enum class Stop { gracefully, atOnce };
    void stop(Stop how) const; // returns when the process is gone; nothing when it does not run

    std::string configurationFile() const { return _service.stateDirectory + "/conf/httpd.conf"; }
    std::string pidFile() const { return _service.stateDirectory + "/run/httpd.pid"; }
    std::string errorLog() const { return _service.stateDirectory + "/logs/error.log"; }

    // A path without symbolic links and without a slash at its end, as httpd compares paths as texts: no section of the
    // configuration would apply below a link.
    static std::string withoutLinks(const std::string& path);

private:
    [[noreturn]] void fail(const std::string& reason) const; // the service's name comes before it
    void waitUntilReady(const StoreProcess& process, int port, bool tls, size_t logStart) const;
    std::string explanation(size_t logStart) const;
    std::string outputFile() const { return _service.stateDirectory + "/startup.log"; }

    Service _service;
};

} // namespace rolvane
