#pragma once

#include "foundation/Mutex.h"
#include "store/http/HttpTransport.h"

#include <deque>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

namespace rolvane {

// Fetches URLs that are going to be read, in their order, before they are asked for. At most kWindow requests are under
// way or waiting at a time, and no new ones start while kWaitingBytes of answers wait. Each answer is handed out once.
// Whoever takes one lets go of those before it, so a reader that leaves some out does not stop the rest.
// Any thread; takers wait for an answer that is under way, at most until its deadline.
class ReadAhead {
public:
    static constexpr size_t kWindow = 200;
    static constexpr size_t kWaitingBytes = 16u << 20;
    static constexpr size_t kLargestAnswer = 512u << 10; // a larger file is read when it is its turn

    // Sends one request; must call back exactly once, from any thread.
    using Start = std::function<void(HttpRequest, HttpTransport::Completion)>;
    explicit ReadAhead(Start start) : _start(std::move(start)) {}
    ~ReadAhead() { expect({}); }

    // From now on these, in this order; what was expected before is forgotten. A repeated URL is fetched once.
    void expect(const std::vector<Url>& urls);
    // The answer, if the URL is expected and was not taken before. Nothing, too, when the answer did not come whole.
    std::optional<HttpResponse> take(const Url& url);
    // The file changes: what was fetched of it is no longer true.
    void forget(const Url& url);

    // The request for one; what somebody waits for goes before it.
    static HttpRequest getting(const std::string& url);

private:
    struct Window; // shared with the requests under way
    void refill(const std::shared_ptr<Window>& window);
    std::shared_ptr<Window> current();

    const Start _start;
    Mutex _mutex;
    std::shared_ptr<Window> _window GUARDED_BY(_mutex);
};

} // namespace rolvane
