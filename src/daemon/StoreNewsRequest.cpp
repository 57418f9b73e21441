#include "daemon/StoreNewsRequest.h"

#include "foundation/Mutex.h"

#include <deque>
#include <new>
#include <sys/eventfd.h>
#include <unistd.h>
#include <utility>

namespace rolvane {

struct StoreNewsRequest::Inbox {
    Inbox() {
        if (event < 0) throw std::bad_alloc();
    }
    ~Inbox() { ::close(event); }
    Inbox(const Inbox&) = delete;
    Inbox& operator=(const Inbox&) = delete;

    void put(NewsLine line) {
        {
            const Lock guard(mutex);
            lines.push_back(std::move(line));
        }
        ring();
    }
    void put(NewsEnd last) {
        {
            const Lock guard(mutex);
            end = std::move(last);
        }
        ring();
    }
    void ring() const {
        const uint64_t one = 1;
        [[maybe_unused]] const ssize_t written = ::write(event, &one, sizeof one);
    }

    const int event = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK); // readable: there is something
    bool ended = false;                                         // the object has gone; the loop's thread
    Mutex mutex;
    std::deque<NewsLine> lines GUARDED_BY(mutex);
    std::optional<NewsEnd> end GUARDED_BY(mutex);
};

StoreNewsRequest::StoreNewsRequest(NewsWatch::Listener listener)
    : _inbox(std::make_shared<Inbox>()), _listener(std::make_shared<NewsWatch::Listener>(std::move(listener))) {}

StoreNewsRequest::~StoreNewsRequest() {
    _inbox->ended = true;
}

std::unique_ptr<NewsWatch::Request> StoreNewsRequest::open(RunLoop& loop, CXDAVManager& client,
                                                           const std::vector<Url>& trees, const std::string& position,
                                                           NewsWatch::Listener listener, StoreNews::Limits limits) {
    std::unique_ptr<StoreNewsRequest> request(new StoreNewsRequest(std::move(listener)));
    const auto inbox = request->_inbox;
    StoreNews::Listener fill{[inbox](NewsLine line) { inbox->put(std::move(line)); },
                             [inbox](NewsEnd end) { inbox->put(std::move(end)); }};
    request->_news = StoreNews::wait(client, trees, position, std::move(fill), limits);
    if (!request->_news) return nullptr;
    request->_port = loop.addPort(inbox->event, [made = request.get()](uint32_t) { made->tell(); });
    return request;
}

// Each call may end this object.
void StoreNewsRequest::tell() {
    const auto inbox = _inbox;
    const auto listener = _listener;
    uint64_t count = 0;
    [[maybe_unused]] const ssize_t got = ::read(inbox->event, &count, sizeof count);
    std::deque<NewsLine> lines;
    std::optional<NewsEnd> end;
    {
        const Lock guard(inbox->mutex);
        lines.swap(inbox->lines);
        end.swap(inbox->end);
    }
    for (const NewsLine& line : lines)
        if (!inbox->ended) listener->line(line);
    if (end && !inbox->ended) listener->ended(*end);
}

} // namespace rolvane
