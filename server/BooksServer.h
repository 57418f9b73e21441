#pragma once

#include "server/HttpdLauncher.h"

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

// How a user's address books are served. Equal options for the same state directory give the same server.
struct BooksOptions {
    std::string stateDirectory; // "" = stateDirectory()/books
    std::string database;       // the contact database's file; must exist when the server starts
    int port = 0;               // 0 = the one of the last start, else a free one
    bool tls = true;
    std::string listen;               // an address of this machine beside the loopback ones; "" = none
    std::vector<std::string> hosts;   // names and addresses in the certificate beside localhost and `listen`
    std::string certificate, key;     // PEM files of the owner's own; "" = made by this machine. Both or none
    int threads = 24;                 // requests at once
    int64_t maximumCard = 10485760;   // bytes
    int64_t maximumReport = 16777216; // bytes of a REPORT's body
    std::string logLevel = "warn";
    bool accessLog = false;
    std::vector<std::string> extraConfiguration; // lines at the end of the configuration; kept

    // The following are not kept from one start to the next.
    bool serviceManager = true; // where the user has a systemd, it listens and starts httpd at the first connection
    bool ownsProcess = false;   // the destructor stops the server (tests)
    std::string httpdProgram = "/usr/sbin/apache2";
    std::string httpdModules = "/usr/lib/apache2/modules";
    std::string cardbookModule; // a file; "" = the one that was built or installed with the program
};

struct BooksStatus {
    bool on = false;      // clients are answered: by a running httpd, or by one that their connection starts
    pid_t pid = 0;        // 0 when httpd does not run
    bool managed = false; // by the user's systemd
    int port = 0;         // 0 when it has never been on
};

// The CardDAV server of one user's contact database: an unprivileged httpd with mod_cardbook, on the loopback addresses
// and, when asked for, on another one, then always with TLS. There is no access without a device's password
// (BooksDevices.h). Where the user has a service manager, a socket unit keeps the port and httpd runs while somebody
// uses it; else httpd is a process in a session of its own. Started by root, httpd runs as www-data, which then may
// change root's files: such a server listens on loopback only.
//
// All state is in the directory, so any process may hold an object on it. One object belongs to one thread. Every
// operation throws kCXPrivateStoreException, whose reason says what to do.
class BooksServer {
public:
    explicit BooksServer(BooksOptions options);
    ~BooksServer(); // stops only what it owns
    BooksServer(const BooksServer&) = delete;
    BooksServer& operator=(const BooksServer&) = delete;

    // The options of the last start in that directory ("" = the default one); nothing when there was none.
    static std::optional<BooksOptions> savedOptions(const std::string& stateDirectory = "");

    // Returns when the port answers. A server that is on with the same options is left alone; with others it is started
    // anew. A port that was chosen once is kept; one that another program holds is an error, as clients know it.
    void on();
    void off(); // returns when nothing listens any more; devices and certificate stay
    BooksStatus status() const;

    std::string stateDirectory() const { return _options.stateDirectory; }
    std::string errorLog() const { return launcher().errorLog(); }
    std::string caFile() const;      // "" where the certificate is the owner's own
    std::string fingerprint() const; // of the certificate; "" without TLS
    // "https://localhost:PORT/", and the same with the host that other machines use; throw before the first start.
    std::string url() const;
    std::string outsideURL() const; // "" while only loopback is listened on

private:
    HttpdLauncher launcher() const;
    std::string settingsFile() const { return _options.stateDirectory + "/books.plist"; }
    int savedPort() const;
    int savedInnerPort() const;
    bool isManaged() const;
    void makeDirectories() const;
    void checkOptions() const;
    void checkPort(int port) const;
    void writeConfiguration(int port, int inner) const;
    bool startProcess(int port, bool mayMove);
    void startUnits(int port);
    void stopAll() const;
    std::vector<std::string> certificateHosts() const;

    BooksOptions _options;
    bool _startedHere = false;
};

} // namespace rolvane
