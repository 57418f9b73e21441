#include "server/mod_davacl/SlowThreads.h"

#include <algorithm>
#include <map>

namespace rolvane::davacl {
namespace {

constexpr auto kLongestWait = std::chrono::seconds(60);
constexpr uint64_t kLeastPace = 500; // bytes a second

bool isSlow(const SlowThread& thread) {
    return thread.waited >= kSlow;
}

bool isTooSlow(const SlowThread& thread) {
    return thread.sends &&
           thread.waited > kLongestWait + std::chrono::seconds(static_cast<int64_t>(thread.taken / kLeastPace));
}

} // namespace

std::vector<size_t> surplusOf(const std::vector<SlowThread>& all, size_t most) {
    std::vector<size_t> surplus;
    std::map<std::string, std::vector<size_t>> slow; // of each user, the longest last
    size_t count = 0;
    for (size_t i = 0; i < all.size(); ++i) {
        if (isTooSlow(all[i])) {
            surplus.push_back(i);
        } else if (isSlow(all[i])) {
            slow[all[i].user].push_back(i);
            ++count;
        }
    }
    for (auto& [user, threads] : slow)
        std::stable_sort(threads.begin(), threads.end(),
                         [&](size_t a, size_t b) { return all[a].waited < all[b].waited; });
    for (; count > most; --count) {
        auto& threads = std::max_element(slow.begin(), slow.end(), [](const auto& a, const auto& b) {
                            return a.second.size() < b.second.size();
                        })->second;
        surplus.push_back(threads.back());
        threads.pop_back();
    }
    return surplus;
}

bool hasShareOf(const std::vector<SlowThread>& all, size_t most, const std::string& user) {
    std::map<std::string, size_t> slow = {{user, 0}};
    size_t count = 0;
    for (const SlowThread& each : all)
        if (isSlow(each)) {
            ++slow[each.user];
            ++count;
        }
    return count >= most && slow[user] * slow.size() >= most && slow[user] > 0;
}

} // namespace rolvane::davacl
