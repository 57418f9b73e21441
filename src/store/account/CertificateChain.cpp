#include "store/account/CertificateChain.h"

#include "foundation/CXException.h"
#include "foundation/Fingerprint.h"
#include "foundation/Release.h"

#include <algorithm>
#include <cstring>
#include <ctime>
#include <curl/curl.h>
#include <memory>
#include <openssl/bio.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

namespace rolvane {

namespace {

constexpr size_t kMost = 32; // certificates of one chain

using Certificate = std::unique_ptr<X509, Release<X509_free>>;
using Memory = std::unique_ptr<BIO, Release<BIO_free_all>>;

std::string commonName(const X509_NAME* name) {
    char text[256] = "";
    if (X509_NAME_get_text_by_NID(const_cast<X509_NAME*>(name), NID_commonName, text, sizeof text) < 0) return {};
    return text;
}

Date dateOf(const ASN1_TIME* time) {
    std::tm parts{};
    if (ASN1_TIME_to_tm(time, &parts) != 1) return Date();
    return Date(static_cast<double>(timegm(&parts)));
}

std::string pemOf(X509* certificate) {
    const Memory memory(BIO_new(BIO_s_mem()));
    char* data = nullptr;
    if (!memory || PEM_write_bio_X509(memory.get(), certificate) != 1) return {};
    const long size = BIO_get_mem_data(memory.get(), &data);
    return std::string(data, static_cast<size_t>(size));
}

} // namespace

std::vector<ShownCertificate> certificatesIn(const std::string& pem) {
    std::vector<ShownCertificate> all;
    const Memory memory(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
    while (memory && all.size() < kMost) {
        const Certificate one(PEM_read_bio_X509(memory.get(), nullptr, nullptr, nullptr));
        if (!one) break;
        all.push_back({pemOf(one.get()), fingerprintOf(one.get()), commonName(X509_get_subject_name(one.get())),
                       commonName(X509_get_issuer_name(one.get())), dateOf(X509_get0_notBefore(one.get())),
                       dateOf(X509_get0_notAfter(one.get())), X509_check_ca(one.get()) > 0});
    }
    ERR_clear_error();
    return all;
}

std::vector<ShownCertificate> certificatesShownAt(const Url& url) {
    static const CURLcode ready = curl_global_init(CURL_GLOBAL_DEFAULT);
    const std::unique_ptr<CURL, Release<curl_easy_cleanup>> handle(curl_easy_init());
    if (ready != CURLE_OK || !handle) throw CXException(kCXNetworkException, "The network library cannot be used.");
    char words[CURL_ERROR_SIZE] = "";
    CURL* const h = handle.get();
    curl_easy_setopt(h, CURLOPT_URL, url.absoluteString().c_str());
    curl_easy_setopt(h, CURLOPT_PROTOCOLS_STR, "https");
    curl_easy_setopt(h, CURLOPT_CONNECT_ONLY, 1L);
    curl_easy_setopt(h, CURLOPT_CERTINFO, 1L);
    // Whoever calls compares the fingerprint, which says more than any verification.
    curl_easy_setopt(h, CURLOPT_SSL_VERIFYPEER, 0L);
    curl_easy_setopt(h, CURLOPT_SSL_VERIFYHOST, 0L);
    curl_easy_setopt(h, CURLOPT_TIMEOUT, 20L);
    curl_easy_setopt(h, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(h, CURLOPT_ERRORBUFFER, words);
    const CURLcode code = curl_easy_perform(h);
    if (code != CURLE_OK)
        throw CXException(kCXNetworkException, "No secure connection to " + url.origin() + " (" +
                                                   std::string(*words ? words : curl_easy_strerror(code)) +
                                                   "). Check the address, and whether the store runs.");
    curl_certinfo* shown = nullptr;
    std::string pem;
    if (curl_easy_getinfo(h, CURLINFO_CERTINFO, &shown) == CURLE_OK && shown)
        for (int i = 0; i < shown->num_of_certs; ++i)
            for (const curl_slist* line = shown->certinfo[i]; line; line = line->next)
                if (std::strncmp(line->data, "Cert:", 5) == 0) pem += std::string(line->data + 5) + "\n";
    std::vector<ShownCertificate> chain = certificatesIn(pem);
    if (chain.empty())
        throw CXException(kCXNetworkException, "The server at " + url.origin() + " shows no certificate.");
    return chain;
}

const ShownCertificate* authorityOf(const std::vector<ShownCertificate>& chain) {
    return chain.empty() ? nullptr : &chain.back();
}

std::optional<std::string> normalFingerprint(const std::string& text) {
    std::string digits;
    for (const char c : text) {
        if (c == ':' || c == ' ') continue;
        if (!std::isxdigit(static_cast<unsigned char>(c))) return std::nullopt;
        digits += static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
    }
    if (digits.size() != 64) return std::nullopt;
    std::string out;
    for (size_t i = 0; i < digits.size(); i += 2) out += (i ? ":" : "") + digits.substr(i, 2);
    return out;
}

const ShownCertificate* withFingerprint(const std::vector<ShownCertificate>& chain, const std::string& fingerprint) {
    const auto wanted = normalFingerprint(fingerprint);
    const auto found = std::find_if(chain.begin(), chain.end(),
                                    [&](const ShownCertificate& one) { return one.fingerprint == wanted; });
    return found == chain.end() ? nullptr : &*found;
}

} // namespace rolvane
