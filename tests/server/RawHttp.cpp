#include "RawHttp.h"

#include "server/StoreConfiguration.h"

#include <algorithm>
#include <arpa/inet.h>
#include <atomic>
#include <cstdio>
#include <netinet/in.h>
#include <openssl/evp.h>
#include <stdexcept>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

namespace rolvane {
namespace {

std::string base64(const std::string& text) {
    static constexpr char digits[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    std::string out;
    unsigned bits = 0;
    int held = 0;
    for (const unsigned char c : text) {
        bits = bits << 8 | c;
        for (held += 8; held >= 6; held -= 6) out += digits[bits >> (held - 6) & 63];
    }
    if (held) out += digits[bits << (6 - held) & 63];
    while (out.size() % 4) out += '=';
    return out;
}

std::string md5(const std::string& text) {
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int length = 0;
    EVP_Digest(text.data(), text.size(), digest, &length, EVP_md5(), nullptr);
    std::string hex;
    for (unsigned int i = 0; i < length; ++i) {
        constexpr char kDigits[] = "0123456789abcdef";
        hex += {kDigits[digest[i] >> 4], kDigits[digest[i] & 15]};
    }
    return hex;
}

int connectTo(int port) {
    const int s = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<uint16_t>(port));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    const timeval limit{20, 0};
    setsockopt(s, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
    if (connect(s, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0)
        throw std::runtime_error("the store does not listen");
    return s;
}

void sendAll(int s, const std::string& text) {
    for (size_t done = 0; done < text.size();) {
        const ssize_t count = send(s, text.data() + done, text.size() - done, MSG_NOSIGNAL);
        if (count <= 0) return; // the answer tells why
        done += static_cast<size_t>(count);
    }
}

std::string headOf(const RawRequest& request) {
    std::string text = request.method + " " + request.path + " HTTP/1.1\r\nConnection: close\r\n";
    const bool hasHost = std::any_of(request.headers.begin(), request.headers.end(),
                                     [](const auto& header) { return header.first == "Host"; });
    if (!hasHost) text += "Host: localhost\r\n";
    if (!request.user.empty())
        text += "Authorization: Basic " + base64(request.user + ":" + rawPasswordOf(request.user)) + "\r\n";
    for (const auto& [name, value] : request.headers) text += name + ": " + value + "\r\n";
    if (!request.body.empty()) text += "Content-Length: " + std::to_string(request.body.size()) + "\r\n";
    return text + "\r\n";
}

RawAnswer receive(int s) {
    std::string text;
    char part[16384];
    for (ssize_t count = 0; (count = recv(s, part, sizeof part, 0)) > 0;) text.append(part, static_cast<size_t>(count));
    RawAnswer answer;
    const size_t end = text.find("\r\n\r\n");
    if (!text.starts_with("HTTP/1.1 ") || end == std::string::npos) return answer;
    answer.status = std::stoi(text.substr(9, 3));
    answer.headers = text.substr(0, end + 2);
    answer.body = text.substr(end + 4);
    return answer;
}

} // namespace

std::string rawPasswordOf(const std::string& user) {
    return "secret of " + user;
}

std::string nonceIn(const RawAnswer& answer) {
    const std::string mark = " nonce=\"";
    const size_t at = answer.headers.find(mark);
    if (at == std::string::npos) throw std::runtime_error("the store does not ask for Digest: " + answer.headers);
    const size_t from = at + mark.size();
    return answer.headers.substr(from, answer.headers.find('"', from) - from);
}

std::string rawDigest(const std::string& user, const RawRequest& request, const std::string& nonce) {
    static std::atomic<unsigned> uses = 0; // of a nonce, counted on over all of them
    char count[9];
    std::snprintf(count, sizeof count, "%08x", ++uses);
    const std::string secret = md5(user + ":" + kStoreRealm + ":" + rawPasswordOf(user));
    const std::string what = md5(request.method + ":" + request.path);
    const std::string response = md5(secret + ":" + nonce + ":" + count + ":c:auth:" + what);
    return "Digest username=\"" + user + "\", realm=\"" + kStoreRealm + "\", nonce=\"" + nonce + "\", uri=\"" +
           request.path + "\", algorithm=MD5, qop=auth, cnonce=\"c\", nc=" + count + ", response=\"" + response + "\"";
}

std::string RawAnswer::precondition() const {
    size_t at = body.find("<D:error");
    if (at == std::string::npos) return {};
    at = body.find('<', at + 1);
    const size_t name = body.find(':', at) + 1;
    return body.substr(name, body.find_first_of("/> ", name) - name);
}

RawAnswer rawRequest(int port, const RawRequest& request) {
    return RawUpload(port, request, request.body.size()).finish();
}

RawUpload::RawUpload(int port, const RawRequest& request, size_t firstBytes)
    : _socket(connectTo(port)), _rest(request.body.substr(firstBytes)) {
    sendAll(_socket, headOf(request) + request.body.substr(0, firstBytes));
}

RawUpload::~RawUpload() {
    close(_socket);
}

bool RawUpload::awaitContinue() {
    std::string text;
    char c = 0;
    while (!text.ends_with("\r\n\r\n") && recv(_socket, &c, 1, 0) == 1) text += c;
    return text.starts_with("HTTP/1.1 100 ");
}

RawAnswer RawUpload::finish() {
    sendAll(_socket, _rest);
    return receive(_socket);
}

RawLines::RawLines(int port, const RawRequest& request) : _socket(connectTo(port)) {
    const timeval limit{60, 0};
    setsockopt(_socket, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
    sendAll(_socket, headOf(request) + request.body);
}

RawLines::~RawLines() {
    close(_socket);
}

bool RawLines::receive() {
    char part[4096];
    const ssize_t count = recv(_socket, part, sizeof part, 0);
    if (count > 0) _raw.append(part, static_cast<size_t>(count));
    return count > 0;
}

bool RawLines::receiveUntil(const std::string& mark) {
    while (_raw.find(mark) == std::string::npos)
        if (!receive()) return false;
    return true;
}

int RawLines::status() {
    if (_status >= 0) return _status;
    _status = 0;
    if (!receiveUntil("\r\n\r\n") || !_raw.starts_with("HTTP/1.1 ")) return _status;
    _status = std::stoi(_raw.substr(9, 3));
    _raw.erase(0, _raw.find("\r\n\r\n") + 4);
    return _status;
}

std::optional<std::string> RawLines::line() {
    if (status() != 200) return std::nullopt;
    while (_text.find('\n') == std::string::npos) {
        if (_ended || !receiveUntil("\r\n")) return std::nullopt;
        const size_t size = std::stoul(_raw, nullptr, 16), head = _raw.find("\r\n") + 2;
        _ended = size == 0;
        while (_raw.size() < head + size + 2)
            if (!receive()) return std::nullopt;
        _text += _raw.substr(head, size);
        _raw.erase(0, head + size + 2);
    }
    const size_t end = _text.find('\n');
    const std::string line = _text.substr(0, end);
    _text.erase(0, end + 1);
    return line;
}

} // namespace rolvane
