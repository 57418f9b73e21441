#include "foundation/Fingerprint.h"

#include <openssl/evp.h>
#include <openssl/x509.h>

namespace rolvane {

std::string fingerprintOf(const x509_st* certificate) {
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int size = 0;
    if (X509_digest(certificate, EVP_sha256(), digest, &size) != 1) return {};
    std::string text;
    for (unsigned int i = 0; i < size; ++i) {
        if (i > 0) text += ':';
        text += "0123456789ABCDEF"[digest[i] >> 4];
        text += "0123456789ABCDEF"[digest[i] & 15];
    }
    return text;
}

} // namespace rolvane
