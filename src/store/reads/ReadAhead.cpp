#include "store/reads/ReadAhead.h"

#include "foundation/Mutex.h"

namespace rolvane {

HttpRequest ReadAhead::getting(const std::string& url) {
    HttpRequest request;
    request.method = "GET";
    request.url = Url(url);
    request.limits.maxBodyBytes = kLargestAnswer;
    request.givesWay = true;
    return request;
}

struct ReadAhead::Window {
    Mutex mutex;
    Condition changed;
    struct Place {
        bool arrived = false;
        HttpResponse answer;
    };
    std::vector<std::string> urls GUARDED_BY(mutex);
    std::unordered_map<std::string, size_t> positions GUARDED_BY(mutex);
    std::unordered_map<size_t, Place> places GUARDED_BY(mutex); // from `first` to `next`: under way or waiting
    size_t first GUARDED_BY(mutex) = 0, next GUARDED_BY(mutex) = 0;
    size_t waitingBytes GUARDED_BY(mutex) = 0;

    bool mayStart() const REQUIRES(mutex) {
        return next < urls.size() && places.size() < kWindow && waitingBytes < kWaitingBytes;
    }
    void drop(size_t position) REQUIRES(mutex) {
        const auto place = places.find(position);
        if (place == places.end()) return;
        if (place->second.arrived) waitingBytes -= place->second.answer.body.size();
        places.erase(place);
    }
    void arrive(size_t position, HttpResponse answer) {
        const Lock guard(mutex);
        const auto place = places.find(position);
        if (place == places.end()) return; // nobody waits for it any more
        place->second.arrived = true;
        place->second.answer = std::move(answer);
        waitingBytes += place->second.answer.body.size();
        changed.notify_all();
    }
};

void ReadAhead::expect(const std::vector<Url>& urls) {
    std::shared_ptr<Window> window;
    if (!urls.empty()) {
        window = std::make_shared<Window>();
        const Lock guard(window->mutex);
        for (const Url& url : urls)
            if (window->positions.emplace(url.absoluteString(), window->urls.size()).second)
                window->urls.push_back(url.absoluteString());
    }
    {
        const Lock guard(_mutex);
        _window = window;
    }
    if (window) refill(window);
}

std::shared_ptr<ReadAhead::Window> ReadAhead::current() {
    const Lock guard(_mutex);
    return _window;
}

// Requests are started without the lock: an answer may come before `start` returns.
void ReadAhead::refill(const std::shared_ptr<Window>& window) {
    for (;;) {
        size_t position = 0;
        std::string url;
        {
            const Lock guard(window->mutex);
            if (!window->mayStart()) return;
            position = window->next++;
            window->places.try_emplace(position);
            url = window->urls[position];
        }
        _start(getting(url), [window, position](HttpResponse answer) { window->arrive(position, std::move(answer)); });
    }
}

std::optional<HttpResponse> ReadAhead::take(const Url& url) {
    const std::shared_ptr<Window> window = current();
    if (!window) return std::nullopt;
    std::optional<HttpResponse> answer;
    {
        Lock lock(window->mutex);
        const auto expected = window->positions.find(url.absoluteString());
        if (expected == window->positions.end()) return std::nullopt;
        const size_t position = expected->second;
        window->positions.erase(expected);
        for (; window->first < position; ++window->first) window->drop(window->first);
        if (position >= window->next) window->next = position + 1; // its turn has come before that of the window
        const auto arrived = [&]() REQUIRES(window->mutex) {
            const auto place = window->places.find(position);
            return place == window->places.end() || place->second.arrived;
        };
        window->changed.wait(lock, arrived);
        if (const auto place = window->places.find(position); place != window->places.end()) {
            if (place->second.answer.complete()) answer = place->second.answer;
            window->drop(position);
        }
    }
    refill(window);
    return answer;
}

void ReadAhead::forget(const Url& url) {
    const std::shared_ptr<Window> window = current();
    if (!window) return;
    const Lock guard(window->mutex);
    window->positions.erase(url.absoluteString()); // its place goes when a later one is taken
}

} // namespace rolvane
