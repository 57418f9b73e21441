#pragma once

#include <string>

namespace rolvane {

// Who is invited to a store, in one line that a person sends to another:
//   line    = "rolvane:1:" base64url( payload check )   without padding (RFC 4648 section 5)
//   payload = UTF-8, the fields below in their order, each ended by LF
//   check   = the first 4 bytes of the SHA-256 of the payload
// Whoever has the line can sign in as the user until the password in it has been changed. A plain value; any thread.
struct Invitation {
    std::string endpoint; // the account's template
    std::string user;
    std::string fingerprint;  // "AB:CD:..." of the store's authority; "" where the system's authorities know the store
    std::string password;     // "" where the user has one
    std::string passwordPath; // URL path where the store lets the user change the password; "" where it does not
    std::string inviter;      // a user of the store; "" for nobody

    // The line. CXException (kCXNetworkException) when a field holds a line break.
    std::string line() const;
    // Blanks, line breaks and quotation marks around or within the line are passed over, as mail programs put them
    // there. CXException says what is wrong with it and what to do.
    static Invitation fromLine(const std::string& line);

    friend bool operator==(const Invitation&, const Invitation&) = default;
};

// 130 random bits that a person can type: "k7rm-...", lower-case letters and digits that look like no other.
std::string makePassword();

} // namespace rolvane
