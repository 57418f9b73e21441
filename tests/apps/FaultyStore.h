#pragma once

#include "server/PrivateStore.h"
#include "store/http/HttpTransport.h"
#include "support/FakeHttpServer.h"

#include <functional>
#include <mutex>
#include <optional>

namespace rolvane::test {

// A server in front of a private store that answers some requests itself, as the test says, and hands the
// others on. Plain http on the loopback interface; contacts, which are written over https only, go past it.
class FaultyStore {
public:
    using Fault = std::function<std::optional<FakeAnswer>(const FakeRequest&)>;
    explicit FaultyStore(PrivateStore& store);

    void set(Fault fault); // empty: every request is handed on
    void answerAll(int status, const std::string& body = {}, const std::string& headers = {});
    int port() const { return _server.port(); }
    // What `rolvane account set` needs to go by this server.
    std::vector<std::string> account() const;
    // What the store itself answers. Any thread.
    FakeAnswer handOn(const FakeRequest& request);

private:
    CurlTransport _upstream;
    const std::string _origin, _secure; // the store's
    std::mutex _lock;
    Fault _fault; // guarded by _lock
    FakeHttpServer _server;
};

} // namespace rolvane::test
