#pragma once

#include <string>

struct x509_st; // OpenSSL's X509

namespace rolvane {

// The SHA-256 digest of the certificate as people compare it: "0A:1B:...", 32 pairs. "" when there is no memory for it.
std::string fingerprintOf(const x509_st* certificate);

} // namespace rolvane
