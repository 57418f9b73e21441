#include "server/mod_davacl/NewcomerBound.h"

#include <algorithm>
#include <iterator>
#include <map>

namespace rolvane::davacl {

std::vector<size_t> surplusOf(const std::vector<Newcomer>& all, std::chrono::steady_clock::time_point now) {
    std::map<std::string, std::vector<size_t>> byAddress;
    for (size_t i = 0; i < all.size(); ++i) byAddress[all[i].address].push_back(i);
    std::vector<size_t> surplus;
    for (const auto& entry : byAddress) {
        const std::vector<size_t>& members = entry.second;
        size_t held = members.size();
        const auto isCrowded = [&](size_t i) { return members.size() > 2 * all[i].most; };
        std::vector<size_t> silent;
        std::copy_if(members.begin(), members.end(), std::back_inserter(silent), [&](size_t i) {
            return !all[i].busy && now - all[i].heard >= (isCrowded(i) ? kShortPatience : kPatience);
        });
        std::stable_sort(silent.begin(), silent.end(), [&](size_t a, size_t b) { return all[a].heard < all[b].heard; });
        for (const size_t i : silent) {
            if (held <= all[i].most) break;
            surplus.push_back(i);
            --held;
        }
    }
    return surplus;
}

} // namespace rolvane::davacl
