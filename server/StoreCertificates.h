#pragma once

#include <chrono>
#include <string>
#include <sys/types.h>
#include <vector>

namespace rolvane {

// The store's own certificate authority and server certificate (EC P-256), as PEM files in one directory:
//   ca.pem (0644) what clients trust, server.pem the server's certificate and behind it the authority's, for clients
//   that were told its fingerprint, server.key its key (the mode given).
// The authority's key signs one certificate and is never written anywhere, so nobody can sign another one with it; a
// renewal therefore makes a new authority, too.
class StoreCertificates {
public:
    explicit StoreCertificates(std::string directory, mode_t keyMode = 0600)
        : _directory(std::move(directory)), _keyMode(keyMode) {}

    // Makes them when they are missing, unreadable, for other hosts (names or addresses), or within a tenth of their
    // lifetime (at most 30 days) of their end. True when it made them. CXException on failure.
    bool ensure(const std::vector<std::string>& hosts, std::chrono::seconds lifetime);

    // SHA-256 of the server's certificate as clients show it, "AB:CD:..."; "" when there is none.
    std::string fingerprint() const;

    std::string caFile() const { return _directory + "/ca.pem"; }
    std::string certificateFile() const { return _directory + "/server.pem"; }
    std::string keyFile() const { return _directory + "/server.key"; }

private:
    bool areGoodFor(const std::vector<std::string>& hosts, std::chrono::seconds lifetime) const;
    void make(const std::vector<std::string>& hosts, std::chrono::seconds lifetime);
    void showAuthority() const;

    std::string _directory;
    mode_t _keyMode;
};

// SHA-256 of the first certificate in a PEM file, "AB:CD:..."; "" when there is none.
std::string fingerprintOfCertificate(const std::string& file);

// Whether the first certificate of a PEM file leads to an authority of the system, with the others in between.
bool isKnownToTheSystem(const std::string& file);
// SHA-256 of the last certificate in a PEM file, "AB:CD:..."; "" when there is none.
std::string fingerprintOfAuthority(const std::string& file);

// Why a server cannot use these two PEM files, as a sentence; "" when it can.
std::string certificateProblem(const std::string& certificate, const std::string& key);

} // namespace rolvane
