#pragma once

#include "store/http/CurlSlot.h"

#include <deque>
#include <functional>
#include <memory>
#include <vector>

namespace rolvane {

// The requests that wait for a connection: those that give way (HttpRequest::givesWay) behind all others, otherwise in
// the order of their coming. One thread.
class JobLine {
public:
    using Job = std::unique_ptr<HttpJob>;

    bool empty() const { return _jobs.empty(); }
    void add(Job job);
    // Before all of its own kind: it has been on its way already.
    void addAgain(Job job);
    void addFirst(Job job) { _jobs.push_front(std::move(job)); }
    Job takeFirst();
    // Takes those out of which it is true.
    std::vector<Job> takeAll(const std::function<bool(const HttpJob&)>& which);

private:
    std::deque<Job> _jobs;
};

} // namespace rolvane
