#pragma once

#include "server/HttpdLauncher.h"

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <sys/types.h>
#include <vector>

namespace rolvane {

inline constexpr const char* kCXPrivateStoreException = "CXPrivateStoreException";

enum class StoreAuthentication { none, basic, digest };

// How a private store is laid out and run. Equal options for the same state directory give the same store.
struct PrivateStoreOptions {
    std::string stateDirectory; // "" = stateDirectory()/store
    std::string documentRoot;   // "" = <stateDirectory>/root; may be elsewhere, on a tmpfs for instance
    int port = 0;               // 0 = the one of the last start, else a free one
    bool tls = true;
    StoreAuthentication authentication = StoreAuthentication::basic;
    bool http2 = true;
    bool accessLists = true; // owners say who may read and write their trees; needs authentication
    std::vector<std::string> hosts = {"localhost", "127.0.0.1", "::1"}; // names and addresses in the certificate

    // A store for other machines has a name of its own and listens on all addresses, not on the loopback ones alone.
    std::string name; // "" for a store of this machine
    // TLS: the store's own authority, unless there are files of an administrator's, or a directory of ACME (RFC 8555),
    // where httpd's mod_md fetches a certificate for the name and renews it.
    std::string certificate, certificateKey; // PEM files: the whole chain, and its key
    std::string acmeDirectory, acmeContact;  // a URL, and an address for letters; "" for none
    std::string acmeAuthority;               // PEM: who signed the certificate of that directory; "": the system knows
    std::string quota;                       // that each user's tree may take, such as "2G" or "none"; "": none is kept
    bool slowsGuesses = false;               // pauses after wrong passwords, for each address and user

    int processes = 1; // at start; grows up to maximumProcesses
    int maximumProcesses = 4;
    // httpd closes every kept connection of a process whose threads are all at work, and their clients come back with a
    // TLS handshake each, which is more work. So there are more threads than the processors need.
    int threadsPerProcess = 128;
    int keepAliveSeconds = 15;
    int maximumKeepAliveRequests = 0;            // 0 = no limit
    int passwordCost = 10;                       // of bcrypt (PasswordFile.h); not kept from one start to the next
    std::string logLevel = "warn";               // httpd's LogLevel
    bool accessLog = false;                      // a line a request in logs/access.log
    std::vector<std::string> extraConfiguration; // lines at the end of the configuration

    bool ownsProcess = false; // the destructor stops the store (tests); else it goes on running
    std::chrono::seconds certificateLifetime{std::chrono::hours(24 * 365 * 5)};
    std::vector<std::string> environment; // "NAME=value" for httpd, not kept from one start to the next
    std::string httpdProgram = "/usr/sbin/apache2";
    std::string httpdModules = "/usr/lib/apache2/modules";
    std::string configurationTemplate; // a file; "" = the one that was built or installed with the program
    std::string program;               // rolvane, for what httpd has it do; "" = the program that starts the store
    std::string accessModule;          // a file, mod_davacl; "" likewise, else the one among httpdModules

    bool keepsAccessLists() const { return accessLists && authentication != StoreAuthentication::none; }
    bool needsModule() const { return keepsAccessLists() || authentication == StoreAuthentication::basic; }
};

struct PrivateStoreStatus {
    bool running = false;
    pid_t pid = 0; // 0 when not running
    int port = 0;  // 0 when the store has never been started
};

// A private WebDAV store: an unprivileged httpd on the loopback addresses with its own certificate authority, users and
// lock database below one state directory. It serves <documentRoot>/dav as /dav; every user has the tree /dav/<user>,
// and nothing outside these trees is served. Nobody else reads or writes there but whom the owner's access lists let in
// (docs/mod_davacl.md; the groups are those of <stateDirectory>/conf/groups). The principals are below /principals.
//
// Started by root, httpd runs as www-data (else nobody); where that user cannot reach the state directory or document
// root, it keeps the right to search and read past file modes, and no other.
//
// Any process may hold a PrivateStore on a directory that another one started: all state is in the directory, and an
// advisory lock keeps launchers apart. One object belongs to one thread. Every operation throws
// kCXPrivateStoreException, whose reason says what to do, with httpd's own words where it has some.
class PrivateStore {
public:
    explicit PrivateStore(PrivateStoreOptions options = {});
    ~PrivateStore(); // stops only what it owns
    PrivateStore(PrivateStore&&) noexcept;
    PrivateStore& operator=(PrivateStore&&) = delete;

    // The options of the last start in that directory ("" = the default one); nothing when there was none.
    static std::optional<PrivateStoreOptions> savedOptions(const std::string& stateDirectory = "");

    // Returns when the store answers. A running store is left alone. A port that was chosen once is kept; one that
    // another program holds is an error, not a reason to move, as clients know the store by it.
    void start();

    // Writes the configuration anew, and has a running httpd take it in, open its logs again and use a renewed
    // certificate, while requests go on. Where httpd would not start with it, the former one stays. False when the
    // store does not run.
    bool reload();

    using Stop = HttpdLauncher::Stop;
    // Returns when the process is gone; requests under way are finished first if asked. Nothing when not running.
    void stop(Stop how = Stop::atOnce);

    PrivateStoreStatus status() const;

    // Makes the user and the empty tree, or gives an existing user a new password. A running store takes it in at once;
    // one without access lists is restarted when the set of users changes. Names: letters, digits and . _ - @ +, at
    // most 64, the first a letter, digit or '_'.
    void addUser(const std::string& user, const std::string& password);
    // Takes the account away; the user's files stay. False when there is no such user.
    bool removeUser(const std::string& user);
    std::vector<std::string> users() const; // ascending

    // The user's own quota ("5G", "none"), or "" for that of everybody; a running store takes it in at once.
    void setQuota(const std::string& user, const std::string& quota);
    struct Room {
        std::optional<uint64_t> used; // bytes, as they were counted last; nothing before the first change
        std::string quota;            // as it was set; "" where none is kept
        bool isOwn = false;           // the user's, not everybody's
    };
    Room roomOf(const std::string& user) const;

    std::string stateDirectory() const;
    std::string documentRoot() const;
    std::string userDirectory(const std::string& user) const; // where the files of /dav/<user> are
    std::string caFile() const;                               // PEM, what a client has to trust; made by start()
    std::string errorLog() const;
    std::string baseURL() const;  // "https://localhost:PORT/dav"; throws before the first start
    std::string localURL() const; // the same, by this machine's own name
    // The PEM file of the certificate that clients are shown. "" while ACME has not given one yet.
    std::string certificateFile() const;
    // SHA-256 of the shown certificate that a client has to trust; "" when the system's authorities
    // have signed for it. CXException while there is no certificate.
    std::string authorityFingerprint() const;
    std::string endpointTemplate() const; // baseURL() + "/{user}/Contacts"

private:
    struct Implementation;
    std::unique_ptr<Implementation> _implementation;
};

} // namespace rolvane
