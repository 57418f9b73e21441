#pragma once

#include <atomic>
#include <chrono>

namespace rolvane {

class CXDAVManager;

// How far the store is, by how long its answers took: the quickest of some tells the way there and back, since nothing
// makes it shorter. Any thread.
class StoreDistance {
public:
    using Seconds = std::chrono::duration<double>;
    static constexpr int kAnswersToJudge = 4;
    static constexpr Seconds kFar{0.01};

    void answered(Seconds took) {
        double quickest = _quickest;
        while (took.count() < quickest && !_quickest.compare_exchange_weak(quickest, took.count())) {
        }
        ++_answers;
    }
    bool isFar() const { return _answers >= kAnswersToJudge && _quickest >= kFar.count(); }

private:
    std::atomic<double> _quickest{1e9};
    std::atomic<int> _answers{0};
};

// Is the client's store known to be far?
bool isStoreFar(const CXDAVManager& manager);

} // namespace rolvane
