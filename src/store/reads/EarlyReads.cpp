#include "store/reads/EarlyReads.h"

#include "foundation/Mutex.h"

#include <deque>
#include <unordered_map>

namespace rolvane {

struct EarlyReads::Shelf {
    struct Place {
        bool begun = false, arrived = false;
        HttpResponse answer;
    };
    using PlaceRef = std::shared_ptr<Place>;

    explicit Shelf(ReadAhead::Start s) : start(std::move(s)) {}

    const ReadAhead::Start start;
    Mutex mutex;
    Condition changed;
    std::unordered_map<std::string, PlaceRef> places GUARDED_BY(mutex);
    std::deque<std::string> toBegin GUARDED_BY(mutex); // some of them may be gone from the places
    size_t underWay GUARDED_BY(mutex) = 0, waitingBytes GUARDED_BY(mutex) = 0;
    bool refilling GUARDED_BY(mutex) = false;

    // The next one that there is room for.
    std::optional<std::pair<std::string, PlaceRef>> next() REQUIRES(mutex) {
        while (!toBegin.empty() && underWay < kUnderWay && waitingBytes < kWaitingBytes) {
            std::string url = std::move(toBegin.front());
            toBegin.pop_front();
            const auto found = places.find(url);
            if (found == places.end() || found->second->begun) continue;
            found->second->begun = true;
            ++underWay;
            return std::pair(std::move(url), found->second);
        }
        return std::nullopt;
    }
    // Nobody is going to take it, or somebody has.
    void drop(std::unordered_map<std::string, PlaceRef>::iterator found) REQUIRES(mutex) {
        if (found->second->arrived) waitingBytes -= found->second->answer.body.size();
        places.erase(found);
    }
    bool stands(const std::string& url, const PlaceRef& place) const REQUIRES(mutex) {
        const auto found = places.find(url);
        return found != places.end() && found->second == place;
    }
    void arrive(const std::string& url, const PlaceRef& place, HttpResponse answer) {
        const Lock guard(mutex);
        --underWay;
        place->arrived = true;
        if (stands(url, place)) {
            place->answer = std::move(answer);
            waitingBytes += place->answer.body.size();
        }
        changed.notify_all();
    }
};

EarlyReads::EarlyReads(ReadAhead::Start start) : _shelf(std::make_shared<Shelf>(std::move(start))) {}

// Requests are started without the lock: an answer may come before `start` returns, and refills then.
void EarlyReads::refill(const std::shared_ptr<Shelf>& shelf) {
    for (Lock lock(shelf->mutex);;) {
        if (shelf->refilling) return; // whoever does it looks again
        auto begun = shelf->next();
        if (!begun) return;
        shelf->refilling = true;
        lock.unlock();
        const auto& [url, place] = *begun;
        shelf->start(ReadAhead::getting(url), [shelf, url = url, place = place](HttpResponse answer) {
            shelf->arrive(url, place, std::move(answer));
            refill(shelf);
        });
        lock.lock();
        shelf->refilling = false;
    }
}

void EarlyReads::add(const std::vector<Url>& urls) {
    {
        const Lock guard(_shelf->mutex);
        for (const Url& url : urls) {
            if (_shelf->places.size() >= kHeld) break;
            const auto [found, isNew] = _shelf->places.try_emplace(url.absoluteString());
            if (!isNew) continue;
            found->second = std::make_shared<Shelf::Place>();
            _shelf->toBegin.push_back(found->first);
        }
    }
    refill(_shelf);
}

bool EarlyReads::claim(const Url& url) {
    const Lock guard(_shelf->mutex);
    const auto found = _shelf->places.find(url.absoluteString());
    if (found == _shelf->places.end()) return false;
    if (found->second->begun) return true;
    _shelf->drop(found);
    return false;
}

std::optional<HttpResponse> EarlyReads::take(const Url& url) {
    std::optional<HttpResponse> answer;
    {
        Lock lock(_shelf->mutex);
        const std::string& name = url.absoluteString();
        auto found = _shelf->places.find(name);
        if (found == _shelf->places.end()) return std::nullopt;
        const Shelf::PlaceRef place = found->second;
        if (place->begun)
            _shelf->changed.wait(
                lock, [&]() REQUIRES(_shelf->mutex) { return place->arrived || !_shelf->stands(name, place); });
        if (!_shelf->stands(name, place)) return std::nullopt;
        found = _shelf->places.find(name);
        HttpResponse arrived = place->answer;
        const bool begun = place->begun;
        _shelf->drop(found);
        if (begun && arrived.complete()) answer = std::move(arrived);
    }
    refill(_shelf);
    return answer;
}

void EarlyReads::forget(const Url& url) {
    const Lock guard(_shelf->mutex);
    const auto found = _shelf->places.find(url.absoluteString());
    if (found != _shelf->places.end()) _shelf->drop(found);
    _shelf->changed.notify_all();
}

void EarlyReads::clear() {
    const Lock guard(_shelf->mutex);
    _shelf->places.clear();
    _shelf->toBegin.clear();
    _shelf->waitingBytes = 0;
    _shelf->changed.notify_all();
}

} // namespace rolvane
