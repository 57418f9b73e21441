// The yardstick of a publication: an independent WebDAV client (neon) that does nothing but PUT files, over so many
// connections that are kept alive, from bodies that are in memory before the clock starts.
//
//   rawput URL CONNECTIONS DIRECTORY CA-FILE < LIST
//
// LIST names files below DIRECTORY, a line each; a file goes to URL + "/" + its name, percent-encoded. Credentials come
// from $BENCH_LOGIN ("user:password") and go out unasked. Prints one line of JSON; exit code 1 when a PUT failed.

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <fstream>
#include <iostream>
#include <iterator>
#include <memory>
#include <ne_auth.h>
#include <ne_request.h>
#include <ne_session.h>
#include <ne_socket.h>
#include <ne_ssl.h>
#include <ne_string.h>
#include <ne_uri.h>
#include <nlohmann/json.hpp>
#include <string>
#include <sys/resource.h>
#include <thread>
#include <vector>

namespace {

struct File {
    std::string path, body; // path: as it stands in the request
};

struct Work {
    ne_uri base{};
    std::string authorization;
    std::shared_ptr<ne_ssl_certificate> authority;
    std::vector<File> files;
    std::atomic<size_t> next{0}, failed{0};
};

std::string contentOf(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    if (!in) throw std::runtime_error("cannot read " + path);
    return {std::istreambuf_iterator<char>(in), {}};
}

std::string escaped(const std::string& text) {
    const std::unique_ptr<char, decltype(&std::free)> path(ne_path_escape(text.c_str()), &std::free);
    return path.get();
}

int discard(void*, const char*, size_t) {
    return 0;
}

void put(ne_session* session, Work& work, const File& file) {
    ne_request* request = ne_request_create(session, "PUT", file.path.c_str());
    ne_set_request_body_buffer(request, file.body.data(), file.body.size());
    ne_add_request_header(request, "Authorization", work.authorization.c_str());
    ne_add_request_header(request, "Content-Type", "application/xml; charset=utf-8");
    ne_add_response_body_reader(request, ne_accept_always, discard, nullptr);
    const int result = ne_request_dispatch(request);
    const int status = ne_get_status(request)->code;
    if ((result != NE_OK || status < 200 || status > 204) && work.failed++ < 3)
        std::cerr << file.path << ": status " << status << ", " << ne_get_error(session) << "\n";
    ne_request_destroy(request);
}

void putAll(Work& work) {
    ne_session* session = ne_session_create(work.base.scheme, work.base.host, work.base.port);
    if (work.authority) ne_ssl_trust_cert(session, work.authority.get());
    for (size_t i = work.next++; i < work.files.size(); i = work.next++) put(session, work, work.files[i]);
    ne_session_destroy(session);
}

double seconds(const timeval& time) {
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_usec) / 1e6;
}

double cpuSeconds() {
    rusage usage{};
    getrusage(RUSAGE_SELF, &usage);
    return seconds(usage.ru_utime) + seconds(usage.ru_stime);
}

void read(Work& work, char** arguments) {
    if (ne_uri_parse(arguments[1], &work.base) != 0) throw std::runtime_error("no URL: " + std::string(arguments[1]));
    if (work.base.port == 0) work.base.port = ne_uri_defaultport(work.base.scheme);
    const char* login = std::getenv("BENCH_LOGIN");
    if (!login) throw std::runtime_error("BENCH_LOGIN is not set");
    char* encoded = ne_base64(reinterpret_cast<const unsigned char*>(login), std::strlen(login));
    work.authorization = std::string("Basic ") + encoded;
    std::free(encoded);
    work.authority.reset(ne_ssl_cert_read(arguments[4]), [](ne_ssl_certificate* c) {
        if (c) ne_ssl_cert_free(c);
    });
    for (std::string line; std::getline(std::cin, line);)
        work.files.push_back(
            {std::string(work.base.path) + "/" + escaped(line), contentOf(std::string(arguments[3]) + "/" + line)});
}

int run(char** arguments) {
    Work work;
    read(work, arguments);
    const int connections = std::atoi(arguments[2]);
    const double cpuBefore = cpuSeconds();
    const auto began = std::chrono::steady_clock::now();
    std::vector<std::thread> threads;
    for (int i = 0; i < connections; ++i) threads.emplace_back([&work] { putAll(work); });
    for (std::thread& thread : threads) thread.join();
    const std::chrono::duration<double> wall = std::chrono::steady_clock::now() - began;
    std::cout << nlohmann::json{{"files", work.files.size()},
                                {"failed", work.failed.load()},
                                {"wall", wall.count()},
                                {"cpu", cpuSeconds() - cpuBefore}}
              << "\n";
    ne_uri_free(&work.base);
    return work.failed > 0 ? 1 : 0;
}

} // namespace

int main(int argc, char** argv) {
    if (argc != 5) {
        std::cerr << "usage: rawput URL CONNECTIONS DIRECTORY CA-FILE < LIST\n";
        return 2;
    }
    ne_sock_init();
    try {
        return run(argv);
    } catch (const std::exception& error) {
        std::cerr << "rawput: " << error.what() << "\n";
        return 2;
    }
}
