#pragma once

#include "store/http/HttpTransport.h"

#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

namespace rolvane::test {

// Passes requests on, writes down what was asked and answered, and can answer in the store's place. Any thread.
class RecordingTransport : public HttpTransport {
public:
    explicit RecordingTransport(std::shared_ptr<HttpTransport> to = nullptr) : _to(std::move(to)) {}

    struct Exchange {
        std::string method, path;
        std::vector<std::pair<std::string, std::string>> headers;
        int status;
        std::string detail; // of an answer that did not come
        std::string header(std::string_view name) const {
            for (const auto& [n, v] : headers)
                if (n == name) return v;
            return {};
        }
    };
    // Asked before a request is passed on; an answer is given in the store's place.
    using Interceptor = std::function<std::optional<HttpResponse>(const HttpRequest&)>;
    void intercept(Interceptor i) {
        std::lock_guard guard(_mutex);
        _interceptor = std::move(i);
    }

    HttpResponse perform(HttpRequest request) override {
        if (auto answer = intercepted(request)) return *answer;
        const HttpRequest copy = request;
        HttpResponse answer = _to->perform(std::move(request));
        note(copy, answer);
        return answer;
    }
    void start(HttpRequest request, Completion done) override {
        if (auto answer = intercepted(request)) return done(std::move(*answer));
        const HttpRequest copy = request;
        _to->start(std::move(request), [this, copy, done = std::move(done)](HttpResponse answer) {
            note(copy, answer);
            done(std::move(answer));
        });
    }
    void abortAll() override {
        if (_to) _to->abortAll();
    }
    void resume() override {
        if (_to) _to->resume();
    }

    std::vector<Exchange> exchanges() const {
        std::lock_guard guard(_mutex);
        return _exchanges;
    }
    void clear() {
        std::lock_guard guard(_mutex);
        _exchanges.clear();
    }
    // "METHOD METHOD ..." in order
    std::string methods() const {
        std::string out;
        for (const auto& e : exchanges()) out += (out.empty() ? "" : " ") + e.method;
        return out;
    }
    std::string text() const { // for failure messages
        std::string out;
        for (const auto& e : exchanges())
            out += e.method + " " + e.path + " " + std::to_string(e.status) + " " + e.detail + "\n";
        return out;
    }
    size_t count(std::string_view method) const {
        size_t n = 0;
        for (const auto& e : exchanges()) n += e.method == method;
        return n;
    }

private:
    std::optional<HttpResponse> intercepted(const HttpRequest& request) {
        Interceptor i;
        {
            std::lock_guard guard(_mutex);
            i = _interceptor;
        }
        std::optional<HttpResponse> answer;
        if (i) answer = i(request);
        if (!answer && !_to) answer.emplace().error = TransportError::unreachable;
        if (answer) {
            note(request, *answer);
            if (request.sink && answer->status == request.sinkStatus) {
                request.sink(answer->body);
                answer->body.clear();
            }
        }
        return answer;
    }
    void note(const HttpRequest& request, const HttpResponse& answer) {
        std::lock_guard guard(_mutex);
        _exchanges.push_back(
            {request.method, request.url.encodedPath(), request.headers, answer.status, answer.detail});
    }

    const std::shared_ptr<HttpTransport> _to;
    mutable std::mutex _mutex;
    std::vector<Exchange> _exchanges;
    Interceptor _interceptor;
};

inline HttpResponse answerOf(int status, std::vector<std::pair<std::string, std::string>> headers = {},
                             std::string body = {}) {
    HttpResponse r;
    r.status = status;
    r.headers = std::move(headers);
    r.body = std::move(body);
    return r;
}

} // namespace rolvane::test
