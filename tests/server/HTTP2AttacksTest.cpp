#include "HTTP2Connection.h"
#include "StoreTestWorld.h"

#include "foundation/Paths.h"

#include <filesystem>
#include <functional>
#include <gtest/gtest.h>
#include <map>
#include <memory>
#include <stdexcept>

// What a user of the store, or a stranger, can do with HTTP/2 that HTTP/1.1 does not let through.

namespace rolvane {
namespace {

using Headers = HTTP2Connection::Headers;
using Frame = HTTP2Connection::Frame;

class HTTP2Attacks : public testing::Test {
protected:
    HTTP2Attacks() : store(options()) {
        for (const char* user : {"alice", "sam"}) store.addUser(user, "word");
        store.start();
        const CurlClient alice(store, "alice", "word");
        EXPECT_EQ(alice.request("PUT", "/alice/secret", {}, kSecret).status, 201);
        EXPECT_EQ(CurlClient(store, "sam", "word").request("PUT", "/sam/own", {}, "sam's").status, 201);
    }
    PrivateStoreOptions options() const {
        PrivateStoreOptions all = optionsIn(directory);
        all.threadsPerProcess = 8;
        all.maximumProcesses = 1;
        return all;
    }
    std::map<std::string, std::string> allOfAlice() const {
        std::map<std::string, std::string> all;
        for (const auto& each : std::filesystem::recursive_directory_iterator(store.userDirectory("alice")))
            all[each.path()] = each.is_directory() ? "" : readFile(each.path());
        return all;
    }
    int port() const { return store.status().port; }
    // Everything that the answers to these requests say, on one connection that ends behind them.
    template <class Ask>
    std::string said(Ask ask) const {
        HTTP2Connection connection(port(), 1 << 20);
        std::string text;
        try {
            const uint32_t last = ask(connection);
            for (Frame frame = connection.next(); frame.type != 0xff; frame = connection.next()) {
                text += frame.payload;
                const bool ends = frame.type == HTTP2Connection::kReset || (frame.type <= HTTP2Connection::kHeaders &&
                                                                            frame.flags & HTTP2Connection::kEndStream);
                if (frame.type == HTTP2Connection::kGoAway || (ends && frame.stream == last)) break;
            }
        } catch (const std::runtime_error&) { // the store has ended the connection
        }
        return text;
    }
    void expectThatAliceIsServed() const {
        CurlClient alice(store, "alice", "word");
        for (const char* version : {"--http1.1", "--http2"}) {
            alice.extraArguments = {version};
            EXPECT_EQ(alice.request("GET", "/alice/secret").body, kSecret) << version;
        }
    }
    static constexpr const char* kSecret = "told-to-nobody-else";
    StoreDirectory directory;
    PrivateStore store;
};

TEST_F(HTTP2Attacks, TheListsHoldHoweverARequestIsPut) {
    const std::string place = "/dav/alice/secret";
    const std::string authority = "https://localhost:" + std::to_string(port());
    const std::vector<Headers> more = {{},
                                       {{"content-range", "bytes 0-4/5"}},
                                       {{"new-uri", authority + place}, {"destination", authority + "/dav/sam/own"}},
                                       {{"x-http-method-override", "GET"}, {"x-original-url", "/dav/sam/own"}},
                                       {{":path", "/dav/sam/own"}},
                                       {{":method", "OPTIONS"}},
                                       {{":authority", "elsewhere"}, {"host", "localhost"}},
                                       {{"host", "elsewhere\r\nX: y"}},
                                       {{"transfer-encoding", "chunked"}},
                                       {{"connection", "upgrade"}, {"upgrade", "h2c"}},
                                       {{"authorization", "Basic YWxpY2U6bm9uZQ=="}},
                                       {{"Authorization", "Basic YWxpY2U6bm9uZQ=="}},
                                       {{"content-length", "3"}},
                                       {{"expect", "100-continue"}},
                                       {{"range", "bytes=0-3,0-3,0-3"}},
                                       {{"te", "trailers"}, {"trailer", "authorization"}}};
    const std::vector<std::string> methods = {"GET",    "HEAD", "PUT",   "DELETE",  "PROPFIND", "PROPPATCH",
                                              "MKCOL",  "COPY", "MOVE",  "LOCK",    "UNLOCK",   "ACL",
                                              "REPORT", "POST", "PATCH", "CONNECT", "TRACE",    "get"};
    const std::vector<std::string> paths = {place, "/dav/sam/../alice/secret", "/dav/sam/%2e%2e/alice/secret",
                                            "//dav/alice/secret?x#y"};
    // A connection for each path, as some requests end theirs.
    const auto all = [&](const std::string& user, const std::string& method) {
        std::string text;
        for (const std::string& path : paths)
            text += said([&](HTTP2Connection& c) {
                uint32_t last = 0;
                for (const Headers& headers : more) {
                    const bool hasBody = method == "PUT" || method == "POST" || method == "PATCH";
                    last = c.request(user, method, path, headers, hasBody);
                    if (hasBody) c.data(last, "written by a stranger", true);
                }
                return last;
            });
        return text;
    };
    const auto before = allOfAlice();
    size_t shown = 0;
    const std::string hers = all("alice", "GET");
    for (size_t at = 0; (at = hers.find(kSecret, at)) != std::string::npos; ++at) ++shown;
    EXPECT_GT(shown, paths.size()) << "the requests do arrive";
    std::printf("shown to its owner %zu times of %zu\n", shown, paths.size() * more.size());
    for (const char* user : {"sam", ""})
        for (const std::string& method : methods) {
            const std::string text = all(user, method);
            EXPECT_FALSE(text.empty()) << method;
            EXPECT_EQ(text.find(kSecret), std::string::npos) << user << " " << method;
            const std::string copied = said([&](HTTP2Connection& c) {
                c.request(user, method, place, {{"destination", authority + "/dav/sam/copy"}});
                return c.request(user, method, "/dav/sam/own",
                                 {{"destination", authority + place}, {"overwrite", "T"}});
            });
            EXPECT_EQ(copied.find(kSecret), std::string::npos) << user << " " << method;
        }
    EXPECT_EQ(allOfAlice(), before);
    for (const auto& each : std::filesystem::recursive_directory_iterator(store.userDirectory("sam")))
        if (each.is_regular_file()) {
            EXPECT_EQ(readFile(each.path()).find(kSecret), std::string::npos) << each.path();
        }
    expectThatAliceIsServed();
}

// Many frames that cost their sender next to nothing.
TEST_F(HTTP2Attacks, FloodsOfFramesKeepNobodyWaiting) {
    constexpr int kMany = 5000;
    constexpr uint8_t kPing = 6, kWindowUpdate = 8, kContinuation = 9, kPriority = 2;
    const std::string cancel("\0\0\0\x08", 4), priority("\0\0\0\0\x10", 5), one("\0\0\0\x01", 4);
    const std::vector<std::pair<const char*, std::function<void(HTTP2Connection&, int)>>> floods = {
        {"requests that are taken back",
         [&](HTTP2Connection& c, int) {
             const uint32_t stream = c.request("sam", "GET", "/dav/sam/own");
             c.send({HTTP2Connection::kReset, 0, stream, cancel});
         }},
        {"requests of a stranger that are taken back",
         [&](HTTP2Connection& c, int) {
             const uint32_t stream = c.request("", "PROPFIND", "/dav/alice/", {{"depth", "1"}});
             c.send({HTTP2Connection::kReset, 0, stream, cancel});
         }},
        {"settings",
         [](HTTP2Connection& c, int) {
             c.send({HTTP2Connection::kSettings, 0, 0, ""});
         }},
        {"pings",
         [](HTTP2Connection& c, int) {
             c.send({kPing, 0, 0, "12345678"});
         }},
        {"windows",
         [&](HTTP2Connection& c, int) {
             c.send({kWindowUpdate, 0, 0, one});
         }},
        {"priorities",
         [&](HTTP2Connection& c, int i) {
             c.send({kPriority, 0, static_cast<uint32_t>(2 * i + 1), priority});
         }},
        {"a head without an end",
         [](HTTP2Connection& c, int i) {
             const std::string header = std::string("\0\x01x\x01y", 5);
             c.send({i == 0 ? HTTP2Connection::kHeaders : kContinuation, 0, 1, header});
         }},
        {"bodies of no bytes",
         [](HTTP2Connection& c, int i) {
             if (i == 0) c.request("sam", "PUT", "/dav/sam/f", {}, true);
             c.data(1, "", false);
         }},
        {"requests that nobody ends", [](HTTP2Connection& c, int) { c.request("sam", "PUT", "/dav/sam/f", {}, true); }},
        {"frames of no known type", [](HTTP2Connection& c, int) {
             c.send({0xee, 0, 0, "x"});
         }}};
    for (const auto& [what, frame] : floods) {
        SCOPED_TRACE(what);
        std::vector<std::unique_ptr<HTTP2Connection>> all;
        for (int k = 0; k < 2; ++k) {
            all.push_back(std::make_unique<HTTP2Connection>(port(), 0));
            all.back()->tls.setPatience(1);
            try {
                for (int i = 0; i < kMany; ++i) frame(*all.back(), i);
            } catch (const std::runtime_error&) { // the store has had enough, or reads no more for now
            }
        }
        expectThatAliceIsServed();
    }
}

} // namespace
} // namespace rolvane
