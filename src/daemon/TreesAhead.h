#pragma once

#include "foundation/Mutex.h"
#include "foundation/RunLoop.h"
#include "foundation/Url.h"

#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace rolvane {

class CXDAVManager;
class ListingMemory;

// Lists the trees that the next pass would have to list whole, on a thread of its own: a listing of 100,000 contacts
// takes seconds, and an edit made meanwhile does not wait for it. The next pass asks for what has changed since. Main
// thread.
class TreesAhead {
public:
    TreesAhead(RunLoop& loop, CXDAVManager& store); // borrowed
    ~TreesAhead();                                  // with a listing under way: every request of the store is given up
    TreesAhead(const TreesAhead&) = delete;
    TreesAhead& operator=(const TreesAhead&) = delete;

    // False where none of the trees has to be listed whole, or one listing is under way. Else `done` is called from the
    // loop, also when a listing has failed: the pass lists then, and finds out why.
    bool begin(const std::vector<Url>& trees, std::function<void()> done);

private:
    using Listed = std::vector<std::pair<Url, std::unique_ptr<ListingMemory>>>;
    void list(const std::vector<Url>& trees); // on the thread
    void take();

    CXDAVManager& _store;
    const int _event;               // readable: the thread is done
    std::set<std::string> _useless; // trees whose listings could not be kept
    std::function<void()> _done;
    std::thread _thread;
    Mutex _mutex;
    std::optional<Listed> _listed GUARDED_BY(_mutex);
    RunLoop::Handle _port;
};

} // namespace rolvane
