#pragma once

#include "store/http/HttpTransport.h"
#include "store/reads/ReadAhead.h"

#include <memory>
#include <optional>
#include <vector>

namespace rolvane {

// Fetches URLs that are going to be read, before it is known in which order: as many as there is room for. Each answer
// is handed out once; what was not begun is left to whoever reads. Any thread; takers wait for an answer that is under
// way, at most until its deadline.
class EarlyReads {
public:
    static constexpr size_t kUnderWay = 200;
    static constexpr size_t kHeld = 1000; // under way, waiting, or to be sent
    static constexpr size_t kWaitingBytes = ReadAhead::kWaitingBytes;

    explicit EarlyReads(ReadAhead::Start start);
    ~EarlyReads() { clear(); }

    // These as well, as long as fewer than kHeld are held; repeated ones once.
    void add(const std::vector<Url>& urls);
    // True when its request has been sent and its answer was not handed out; it will be when it is taken. One that was
    // not begun never will be, from now on.
    bool claim(const Url& url);
    // The answer, if the URL was begun. Nothing, too, when the answer did not come whole.
    std::optional<HttpResponse> take(const Url& url);
    // The file changes: what was fetched of it is no longer true.
    void forget(const Url& url);
    // Forgets everything.
    void clear();

private:
    struct Shelf; // shared with the requests under way
    static void refill(const std::shared_ptr<Shelf>& shelf);

    const std::shared_ptr<Shelf> _shelf;
};

} // namespace rolvane
