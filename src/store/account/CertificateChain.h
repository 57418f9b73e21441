#pragma once

#include "foundation/Date.h"
#include "foundation/Url.h"

#include <optional>
#include <string>
#include <vector>

namespace rolvane {

// A certificate as a server shows it, or as a file has it.
struct ShownCertificate {
    std::string pem;
    std::string fingerprint;     // SHA-256 of the certificate (DER), "AB:CD:..."
    std::string subject, issuer; // the common names, for people; "" without one
    Date from, until;
    bool isAuthority = false; // it says that it may sign others
};

// The chain that the server at an https URL shows, its own certificate first. Nothing is verified, and nothing but the
// handshake is sent: no request, no password. Waits at most 20 seconds. CXException (kCXNetworkException) says why
// there is none.
std::vector<ShownCertificate> certificatesShownAt(const Url& url);

// The certificates of a PEM text; what is no certificate is left out.
std::vector<ShownCertificate> certificatesIn(const std::string& pem);

// The certificate that an invitation names for a chain: the last one, which is the authority's where the server shows
// it. Null for an empty chain.
const ShownCertificate* authorityOf(const std::vector<ShownCertificate>& chain);

// The one with that fingerprint, whatever the letter case and with or without colons; null when there is none.
const ShownCertificate* withFingerprint(const std::vector<ShownCertificate>& chain, const std::string& fingerprint);
// "AB:CD:..." of either form; nothing when it is no SHA-256 fingerprint.
std::optional<std::string> normalFingerprint(const std::string& text);

} // namespace rolvane
