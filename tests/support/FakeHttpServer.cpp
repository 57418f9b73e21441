#include "FakeHttpServer.h"

#include <algorithm>
#include <arpa/inet.h>
#include <cctype>
#include <chrono>
#include <netinet/in.h>
#include <optional>
#include <poll.h>
#include <stdexcept>
#include <sys/socket.h>
#include <unistd.h>

namespace rolvane::test {

namespace {

std::string lowered(std::string text) {
    for (char& c : text) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    return text;
}

// Reads one request, keeping in `buffer` what follows it. Nothing when the client has gone.
std::optional<FakeRequest> readRequest(int fd, std::string& buffer) {
    const auto more = [&] {
        char chunk[16384];
        const ssize_t n = recv(fd, chunk, sizeof chunk, 0);
        if (n > 0) buffer.append(chunk, static_cast<size_t>(n));
        return n > 0;
    };
    size_t end;
    while ((end = buffer.find("\r\n\r\n")) == std::string::npos)
        if (!more()) return std::nullopt;
    FakeRequest r;
    const std::string head = buffer.substr(0, end + 2);
    buffer.erase(0, end + 4);
    size_t at = head.find("\r\n");
    const std::string first = head.substr(0, at);
    r.method = first.substr(0, first.find(' '));
    r.target = first.substr(r.method.size() + 1, first.rfind(' ') - r.method.size() - 1);
    for (at += 2; at < head.size();) {
        const size_t line = head.find("\r\n", at), colon = head.find(':', at);
        if (colon < line) {
            const size_t value = head.find_first_not_of(' ', colon + 1);
            r.headers[lowered(head.substr(at, colon - at))] = value < line ? head.substr(value, line - value) : "";
        }
        at = line + 2;
    }
    const size_t length = r.headers.contains("content-length") ? std::stoul(r.headers["content-length"]) : 0;
    while (buffer.size() < length)
        if (!more()) return std::nullopt;
    r.body = buffer.substr(0, length);
    buffer.erase(0, length);
    return r;
}

} // namespace

FakeAnswer FakeAnswer::status(int status, const std::string& body, const std::string& headers) {
    return raw("HTTP/1.1 " + std::to_string(status) + " Said\r\nContent-Length: " + std::to_string(body.size()) +
                   "\r\n" + headers + "\r\n" + body,
               false);
}

FakeHttpServer::FakeHttpServer(Script script) : _script(std::move(script)) {
    _listener = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof address;
    if (bind(_listener, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 || listen(_listener, 128) != 0 ||
        getsockname(_listener, reinterpret_cast<sockaddr*>(&address), &length) != 0)
        throw std::runtime_error("the fake server found no port");
    _port = ntohs(address.sin_port);
    _acceptor = std::thread([this] { accept(); });
}

FakeHttpServer::~FakeHttpServer() {
    _ending = true;
    shutdown(_listener, SHUT_RDWR);
    _acceptor.join();
    close(_listener);
    std::vector<std::thread> threads;
    {
        std::lock_guard guard(_mutex);
        for (const int fd : _open) shutdown(fd, SHUT_RDWR);
        threads.swap(_threads);
    }
    for (auto& t : threads) t.join();
}

void FakeHttpServer::accept() {
    while (!_ending) {
        const int fd = ::accept4(_listener, nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0) return;
        std::lock_guard guard(_mutex);
        if (_ending) {
            close(fd);
            return;
        }
        _open.push_back(fd);
        _threads.emplace_back([this, fd, number = ++_connections] { serve(fd, number); });
    }
}

void FakeHttpServer::serve(int fd, int number) {
    std::string buffer;
    while (auto request = readRequest(fd, buffer)) {
        request->connection = number;
        {
            std::lock_guard guard(_mutex);
            _requests.push_back(*request);
        }
        if (!answer(fd, _script(*request))) break;
    }
    std::lock_guard guard(_mutex);
    _open.erase(std::find(_open.begin(), _open.end(), fd));
    close(fd);
}

bool FakeHttpServer::pause(double seconds) const {
    using namespace std::chrono;
    const auto end = steady_clock::now() + duration<double>(seconds);
    while (!_ending && steady_clock::now() < end) std::this_thread::sleep_for(milliseconds(5));
    return !_ending;
}

bool FakeHttpServer::answer(int fd, const FakeAnswer& answer) {
    if (answer.silent) {
        char byte;
        while (recv(fd, &byte, 1, 0) > 0) {
        }
        return false;
    }
    const auto sendAll = [&](const std::string& bytes) {
        size_t at = 0;
        while (at < bytes.size()) {
            const ssize_t n = send(fd, bytes.data() + at, bytes.size() - at, MSG_NOSIGNAL);
            if (n <= 0) return false;
            at += static_cast<size_t>(n);
        }
        return true;
    };
    for (const auto& piece : answer.pieces)
        if ((piece.pauseSeconds > 0 && !pause(piece.pauseSeconds)) || !sendAll(piece.bytes)) return false;
    while (answer.forever)
        if ((answer.pieces.back().pauseSeconds > 0 && !pause(answer.pieces.back().pauseSeconds)) ||
            !sendAll(answer.pieces.back().bytes))
            return false;
    return !answer.closes;
}

void FakeHttpServer::closeConnections() {
    std::lock_guard guard(_mutex);
    for (const int fd : _open) shutdown(fd, SHUT_RDWR);
}

std::vector<FakeRequest> FakeHttpServer::requests() const {
    std::lock_guard guard(_mutex);
    return _requests;
}

} // namespace rolvane::test
