#include "store/http/JobLine.h"

#include <algorithm>
#include <utility>

namespace rolvane {

namespace {

auto borderIn(std::deque<JobLine::Job>& jobs) {
    return std::partition_point(jobs.begin(), jobs.end(), [](const auto& job) { return !job->request.givesWay; });
}

} // namespace

void JobLine::add(Job job) {
    const auto place = job->request.givesWay ? _jobs.end() : borderIn(_jobs);
    _jobs.insert(place, std::move(job));
}

void JobLine::addAgain(Job job) {
    const auto place = job->request.givesWay ? borderIn(_jobs) : _jobs.begin();
    _jobs.insert(place, std::move(job));
}

JobLine::Job JobLine::takeFirst() {
    Job job = std::move(_jobs.front());
    _jobs.pop_front();
    return job;
}

std::vector<JobLine::Job> JobLine::takeAll(const std::function<bool(const HttpJob&)>& which) {
    std::vector<Job> taken;
    std::deque<Job> left;
    for (Job& job : _jobs) which(*job) ? taken.push_back(std::move(job)) : left.push_back(std::move(job));
    _jobs = std::move(left);
    return taken;
}

} // namespace rolvane
