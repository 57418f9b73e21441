#pragma once

#include "foundation/StrongString.h"
#include "foundation/Url.h"
#include "foundation/Value.h"

#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

// Where the account's password comes from. The password itself is never part of an account, an argument or a log line.
struct PasswordSource {
    enum class Kind {
        none,       // no password: requests go out without credentials
        command,    // the first line that `value`, run by /bin/sh, writes to standard output (at most 10 s, 4 KiB)
        credential, // the file `value` in $CREDENTIALS_DIRECTORY
        file,       // the file at the path `value`; refused when others may read or write it
        keyring     // the item `value` of the user's keyring (SecretService.h)
    };
    Kind kind = Kind::none;
    std::string value;
    friend bool operator==(const PasswordSource&, const PasswordSource&) = default;
};

enum class Authentication { automatic, basic, digest };

// The account of one user on one store: who signs in, where the bytes go, and what remote locations are called.
//
// Names and bytes. A remote location is a name, `http://<nameHost>/<user>/Contacts`; the endpoint template says where
// its bytes are: "https://dav.example.org/dav/{user}/Contacts". `{user}` stands for the percent-encoded user name and
// occurs once, as a whole path segment. `endpointFor` and `nameFor` are each other's inverse for every user.
//
// A plain value; any thread.
class CXDAVAccount {
public:
    UserName user;
    std::string endpoint;       // template, see above; https, or http when plainLoopback
    std::string secureEndpoint; // https template; needed when `endpoint` is plain http: secure requests go there
    std::string nameHost;       // "host[:port]"; empty: the endpoint's host, with its port when it has one
    PasswordSource passwordSource;
    Authentication authentication = Authentication::automatic;
    std::string caFile;         // PEM file of a private authority; empty: the system's authorities
    bool plainLoopback = false; // the store speaks plain http on a loopback address

    // What is wrong with the account, in a sentence for the person; nothing when it can be used.
    std::optional<std::string> problem() const;

    // Absent when no account was ever saved. CXException (kCXNetworkException), naming file and reason, when the file
    // cannot be read or what it holds is not a usable account. `path` empty: defaultPath().
    static std::optional<CXDAVAccount> load(const std::string& path = {});
    void save(const std::string& path = {}) const; // mode 0600; CXException when `problem()` or the write failed
    static std::string defaultPath();              // configDirectory() + "/account.plist"

    Dictionary dictionary() const;
    static CXDAVAccount fromDictionary(const Dictionary& d);

    // The password, without the line end. CXException, naming the source and what to do, when it cannot be had.
    std::string password() const;

    // "http://<nameHost>/<user>/Contacts": the location's name, whoever the user is.
    Url baseLocationFor(const UserName& who) const;
    std::string effectiveNameHost() const;
    // The endpoints' origins (see Url::origin): the only places that ever get the password.
    std::vector<std::string> origins() const;

    // Name -> where its bytes are, https when `securely`. Nothing when the URL is not below a remote location of this
    // account's name host, or when a segment of it is "." or ".." or holds a control character. The scheme of the name
    // (http or https) is not looked at.
    std::optional<Url> endpointFor(const Url& name, bool securely) const;
    // An href of an answer (absolute URL or absolute path) -> the name. Nothing when it leaves the endpoints' origins
    // or trees, or is hostile as above. A trailing slash is dropped.
    std::optional<Url> nameFor(std::string_view href) const;

    friend bool operator==(const CXDAVAccount&, const CXDAVAccount&) = default;
};

// The mapping of one account, taken apart once for many names. Any thread.
class EndpointMap {
public:
    explicit EndpointMap(const CXDAVAccount& account);
    ~EndpointMap();
    EndpointMap(const EndpointMap&) = delete;
    EndpointMap& operator=(const EndpointMap&) = delete;
    std::optional<Url> endpointFor(const Url& name, bool securely) const; // as CXDAVAccount's
    std::optional<Url> nameFor(std::string_view href) const;

private:
    struct Impl;
    std::unique_ptr<Impl> _impl;
};

// True for "localhost", 127.0.0.0/8 and ::1, as written in a URL.
bool isLoopbackHost(std::string_view host);

} // namespace rolvane
