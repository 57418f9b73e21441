#pragma once

#include "foundation/Url.h"
#include "store/reads/NewsLines.h"

#include <functional>
#include <memory>
#include <string>
#include <vector>

namespace rolvane {

class CXDAVManager;

// How a request that waited for news has ended.
struct NewsEnd {
    int status = 0;          // of the answer; 0: none came, or it was cut off or no such answer
    bool whole = false;      // the store has ended a good answer itself
    std::string detail = {}; // for people
};

// One request that waits for news of trees, on a connection of its own over HTTP/1.1. Ends with the object.
class StoreNews {
public:
    struct Limits {
        // A silence that is longer is an end: more than twice the heartbeat of a store.
        double silentSeconds = 120;
        double longestSeconds = 86400;
    };
    // Called on a thread of the request's own, in order, `ended` once and last; neither may wait for anything. Not
    // called any more when the destructor has returned.
    struct Listener {
        std::function<void(NewsLine)> line;
        std::function<void(NewsEnd)> ended;
    };
    // Begins to wait in the name of the client's account. Null, and nobody is called, where the store has not said that
    // it tells news, where none of the trees is on it, and where the password cannot be had. From the position on;
    // where that is empty, from the one that the store gave first in this run.
    static std::unique_ptr<StoreNews> wait(CXDAVManager& client, const std::vector<Url>& trees,
                                           const std::string& position, Listener listener, Limits limits);
    ~StoreNews();
    StoreNews(const StoreNews&) = delete;
    StoreNews& operator=(const StoreNews&) = delete;

private:
    struct Impl;
    explicit StoreNews(std::unique_ptr<Impl> impl);
    std::unique_ptr<Impl> _impl;
};

} // namespace rolvane
