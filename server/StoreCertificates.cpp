#include "server/StoreCertificates.h"

#include "foundation/CXException.h"
#include "foundation/Fingerprint.h"
#include "foundation/Paths.h"
#include "foundation/Release.h"

#include <algorithm>
#include <arpa/inet.h>
#include <ctime>
#include <memory>
#include <openssl/bio.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rand.h>
#include <openssl/x509v3.h>

namespace rolvane {

namespace {

using Key = std::unique_ptr<EVP_PKEY, Release<EVP_PKEY_free>>;
using Certificate = std::unique_ptr<X509, Release<X509_free>>;
using Memory = std::unique_ptr<BIO, Release<BIO_free_all>>;
using Extension = std::unique_ptr<X509_EXTENSION, Release<X509_EXTENSION_free>>;

// The one place where OpenSSL's errors become ours.
[[noreturn]] void fail(const std::string& what) {
    char text[256] = "unknown reason";
    if (const unsigned long code = ERR_get_error()) ERR_error_string_n(code, text, sizeof text);
    ERR_clear_error();
    throw CXException("CXPrivateStoreException", "The store's certificate could not be made: " + what + ": " + text);
}

void check(bool good, const char* what) {
    if (!good) fail(what);
}

Key makeKey() {
    Key key(EVP_EC_gen("P-256"));
    check(key != nullptr, "making a key");
    return key;
}

void setName(X509_NAME* name, const std::string& commonName) {
    check(X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_UTF8,
                                     reinterpret_cast<const unsigned char*>(commonName.c_str()), -1, -1, 0) == 1,
          "naming a certificate");
}

void setRandomSerial(X509* certificate) {
    unsigned char bytes[16];
    check(RAND_bytes(bytes, sizeof bytes) == 1, "random serial number");
    bytes[0] &= 0x7f;
    std::unique_ptr<BIGNUM, Release<BN_free>> number(BN_bin2bn(bytes, sizeof bytes, nullptr));
    check(number && BN_to_ASN1_INTEGER(number.get(), X509_get_serialNumber(certificate)), "serial number");
}

void addExtension(X509* certificate, X509* issuer, int kind, const std::string& value) {
    X509V3_CTX context;
    X509V3_set_ctx(&context, issuer, certificate, nullptr, nullptr, 0);
    Extension extension(X509V3_EXT_conf_nid(nullptr, &context, kind, value.c_str()));
    check(extension && X509_add_ext(certificate, extension.get(), -1) == 1, value.c_str());
}

Certificate makeCertificate(EVP_PKEY* key, const std::string& commonName, std::chrono::seconds lifetime) {
    Certificate certificate(X509_new());
    check(certificate && X509_set_version(certificate.get(), X509_VERSION_3) == 1, "a new certificate");
    setRandomSerial(certificate.get());
    setName(X509_get_subject_name(certificate.get()), commonName);
    // A minute of grace for clocks that were set back a little.
    X509_gmtime_adj(X509_getm_notBefore(certificate.get()), -60);
    X509_gmtime_adj(X509_getm_notAfter(certificate.get()), static_cast<long>(lifetime.count()));
    check(X509_set_pubkey(certificate.get(), key) == 1, "the public key");
    return certificate;
}

void sign(X509* certificate, X509* issuer, EVP_PKEY* issuerKey) {
    check(X509_set_issuer_name(certificate, X509_get_subject_name(issuer)) == 1, "the issuer's name");
    check(X509_sign(certificate, issuerKey, EVP_sha256()) > 0, "signing");
}

std::string contents(BIO* memory) {
    char* data = nullptr;
    const long size = BIO_get_mem_data(memory, &data);
    return std::string(data, static_cast<size_t>(size));
}

std::string toPEM(X509* certificate) {
    Memory memory(BIO_new(BIO_s_mem()));
    check(memory && PEM_write_bio_X509(memory.get(), certificate) == 1, "writing a certificate");
    return contents(memory.get());
}

std::string toPEM(EVP_PKEY* key) {
    Memory memory(BIO_new(BIO_s_secmem()));
    check(memory && PEM_write_bio_PKCS8PrivateKey(memory.get(), key, nullptr, nullptr, 0, nullptr, nullptr) == 1,
          "writing the key");
    return contents(memory.get());
}

Certificate readCertificate(const std::string& path) {
    Memory file(BIO_new_file(path.c_str(), "r"));
    Certificate certificate(file ? PEM_read_bio_X509(file.get(), nullptr, nullptr, nullptr) : nullptr);
    ERR_clear_error();
    return certificate;
}

bool keyFits(const std::string& path, X509* certificate) {
    Memory file(BIO_new_file(path.c_str(), "r"));
    Key key(file ? PEM_read_bio_PrivateKey(file.get(), nullptr, nullptr, nullptr) : nullptr);
    const bool fits = key && X509_check_private_key(certificate, key.get()) == 1;
    ERR_clear_error();
    return fits;
}

bool isAddress(const std::string& host) {
    unsigned char buffer[16];
    return inet_pton(AF_INET, host.c_str(), buffer) == 1 || inet_pton(AF_INET6, host.c_str(), buffer) == 1;
}

std::string alternativeNames(const std::vector<std::string>& hosts) {
    std::string names;
    for (const auto& host : hosts)
        names += (names.empty() ? "" : ",") + std::string(isAddress(host) ? "IP:" : "DNS:") + host;
    return names;
}

bool names(X509* certificate, const std::string& host) {
    return isAddress(host) ? X509_check_ip_asc(certificate, host.c_str(), 0) == 1
                           : X509_check_host(certificate, host.data(), host.size(), 0, nullptr) == 1;
}

int numberOfNames(X509* certificate) {
    std::unique_ptr<GENERAL_NAMES, Release<GENERAL_NAMES_free>> all(
        static_cast<GENERAL_NAMES*>(X509_get_ext_d2i(certificate, NID_subject_alt_name, nullptr, nullptr)));
    return all ? sk_GENERAL_NAME_num(all.get()) : 0;
}

std::vector<Certificate> readCertificates(const std::string& path) {
    std::vector<Certificate> all;
    const Memory file(BIO_new_file(path.c_str(), "r"));
    while (file) {
        Certificate next(PEM_read_bio_X509(file.get(), nullptr, nullptr, nullptr));
        if (!next) break;
        all.push_back(std::move(next));
    }
    ERR_clear_error();
    return all;
}

// The certificates in it are somebody else's.
void freeStack(STACK_OF(X509) * stack) {
    sk_X509_free(stack);
}

} // namespace

bool StoreCertificates::ensure(const std::vector<std::string>& hosts, std::chrono::seconds lifetime) {
    if (areGoodFor(hosts, lifetime)) {
        showAuthority(); // stores of earlier versions showed their own certificate alone
        return false;
    }
    make(hosts, lifetime);
    return true;
}

std::string StoreCertificates::fingerprint() const {
    return fingerprintOfCertificate(certificateFile());
}

std::string certificateProblem(const std::string& certificate, const std::string& key) {
    const Certificate read = readCertificate(certificate);
    if (!read) return "\"" + certificate + "\" holds no certificate that can be read.";
    if (!keyFits(key, read.get())) return "\"" + key + "\" holds no key of that certificate.";
    if (X509_cmp_current_time(X509_get0_notAfter(read.get())) <= 0)
        return "The time of the certificate in \"" + certificate + "\" is over.";
    return {};
}

std::string fingerprintOfCertificate(const std::string& file) {
    const Certificate certificate = readCertificate(file);
    return certificate ? fingerprintOf(certificate.get()) : "";
}

bool isKnownToTheSystem(const std::string& file) {
    const std::vector<Certificate> all = readCertificates(file);
    const std::unique_ptr<X509_STORE, Release<X509_STORE_free>> known(X509_STORE_new());
    const std::unique_ptr<X509_STORE_CTX, Release<X509_STORE_CTX_free>> check(X509_STORE_CTX_new());
    const std::unique_ptr<STACK_OF(X509), Release<freeStack>> between(sk_X509_new_null());
    bool good = !all.empty() && known && check && between && X509_STORE_set_default_paths(known.get()) == 1;
    for (const Certificate& each : all) good = good && sk_X509_push(between.get(), each.get()) > 0;
    good = good && X509_STORE_CTX_init(check.get(), known.get(), all.front().get(), between.get()) == 1 &&
           X509_verify_cert(check.get()) == 1;
    ERR_clear_error();
    return good;
}

std::string fingerprintOfAuthority(const std::string& file) {
    const std::vector<Certificate> all = readCertificates(file);
    return all.empty() ? "" : fingerprintOf(all.back().get());
}

bool StoreCertificates::areGoodFor(const std::vector<std::string>& hosts, std::chrono::seconds lifetime) const {
    const Certificate authority = readCertificate(caFile());
    const Certificate server = readCertificate(certificateFile());
    if (!authority || !server || !keyFits(keyFile(), server.get())) return false;
    std::unique_ptr<EVP_PKEY, Release<EVP_PKEY_free>> issuerKey(X509_get_pubkey(authority.get()));
    if (!issuerKey || X509_verify(server.get(), issuerKey.get()) != 1) {
        ERR_clear_error();
        return false;
    }
    std::time_t soon = std::time(nullptr) + std::min<long>(lifetime.count() / 10, 30L * 24 * 3600);
    if (X509_cmp_time(X509_get0_notAfter(server.get()), &soon) <= 0) return false;
    return numberOfNames(server.get()) == static_cast<int>(hosts.size()) &&
           std::all_of(hosts.begin(), hosts.end(), [&](const auto& host) { return names(server.get(), host); });
}

void StoreCertificates::make(const std::vector<std::string>& hosts, std::chrono::seconds lifetime) {
    const Key authorityKey = makeKey();
    const Certificate authority = makeCertificate(authorityKey.get(), "Rolvane private store authority", lifetime);
    addExtension(authority.get(), authority.get(), NID_basic_constraints, "critical,CA:TRUE,pathlen:0");
    addExtension(authority.get(), authority.get(), NID_key_usage, "critical,keyCertSign");
    addExtension(authority.get(), authority.get(), NID_subject_key_identifier, "hash");
    sign(authority.get(), authority.get(), authorityKey.get());

    const Key serverKey = makeKey();
    const Certificate server = makeCertificate(serverKey.get(), hosts.empty() ? "localhost" : hosts.front(), lifetime);
    addExtension(server.get(), authority.get(), NID_basic_constraints, "critical,CA:FALSE");
    addExtension(server.get(), authority.get(), NID_key_usage, "critical,digitalSignature");
    addExtension(server.get(), authority.get(), NID_ext_key_usage, "serverAuth");
    addExtension(server.get(), authority.get(), NID_authority_key_identifier, "keyid");
    addExtension(server.get(), authority.get(), NID_subject_alt_name, alternativeNames(hosts));
    sign(server.get(), authority.get(), authorityKey.get());

    // The certificate that areGoodFor compares goes last: an interrupted renewal is seen and done again.
    CXPathUtils_MakeCompletePath(_directory, 0700);
    writeFileDurably(caFile(), toPEM(authority.get()), 0644);
    writeFileDurably(keyFile(), toPEM(serverKey.get()), _keyMode);
    writeFileDurably(certificateFile(), toPEM(server.get()) + toPEM(authority.get()), _keyMode);
}

void StoreCertificates::showAuthority() const {
    const Certificate authority = readCertificate(caFile()), server = readCertificate(certificateFile());
    const std::string chain = toPEM(server.get()) + toPEM(authority.get());
    if (readFile(certificateFile()) != chain) writeFileDurably(certificateFile(), chain, _keyMode);
}

} // namespace rolvane
