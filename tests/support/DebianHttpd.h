#pragma once

#include "support/ChildProcess.h"
#include "support/TempHome.h"

#include <memory>
#include <string>
#include <vector>

namespace rolvane::test {

// A private instance of Debian's httpd with the configuration that its package apache2 ships: the files of /etc/apache2
// are copied to a directory of the object, and the modules, parts and the site that a fresh installation enables are
// enabled there with Debian's own a2enmod, a2enconf and a2ensite. It listens on a free port of 127.0.0.1, as www-data
// when the test is root. The lines for mod_davacl are read from docs/mod_davacl.md, with the paths changed to private
// ones. Used by one thread; std::runtime_error when something cannot be set up.
class DebianHttpd {
public:
    DebianHttpd();
    ~DebianHttpd(); // stops it
    DebianHttpd(const DebianHttpd&) = delete;
    DebianHttpd& operator=(const DebianHttpd&) = delete;

    void enable(const std::string& module);                         // before start()
    void addUser(const std::string& name, const std::string& pw);   // as the page says; before or after start()
    void addServerLines(const std::string& lines);                  // for every virtual host; before start()
    void addSiteLines(const std::string& lines) { _site += lines; } // after the page's; before start()
    void useTLS();                                                  // with a certificate of its own; before start()
    void start();                                                   // returns when it answers
    // Starts it with a configuration that it must refuse; what it said.
    std::string complaint();

    int port() const { return _port; }
    std::string endpoint() const;
    std::string caFile() const;                                  // of a server with TLS
    std::string documents() const { return _directory / "www"; } // the DocumentRoot
    std::string trees() const { return _directory / "dav"; }
    std::string lists() const { return _directory / "davacl"; }
    std::string path(const std::string& name) const { return _directory / name; }
    std::string log() const; // the error log so far
    // Hands a file or directory to the user that httpd runs as.
    void give(const std::string& path) const;

    static std::string linesOfThePage(); // as they stand

private:
    void moveToAnotherPort(); // before a start
    std::vector<std::string> environment() const;
    std::string privatePaths(std::string lines) const;
    void run(std::vector<std::string> command) const;
    void writeSite();
    std::vector<std::string> command() const;

    TempDirectory _directory;
    int _port;
    std::string _site;
    bool _tls = false;
    std::unique_ptr<ChildProcess> _process;
};

} // namespace rolvane::test
