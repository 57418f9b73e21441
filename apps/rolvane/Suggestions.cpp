#include "Suggestions.h"

#include "Texts.h"

#include "contacts/records/SearchText.h"

#include <algorithm>
#include <set>

namespace rolvane::cli {

namespace {

constexpr size_t kMost = 3;

// Letters that are missing, too many, other ones or two in the wrong order; `most` + 1 for every greater number.
size_t distance(std::string_view a, std::string_view b, size_t most) {
    if (a.size() > b.size()) std::swap(a, b);
    if (b.size() - a.size() > most) return most + 1;
    std::vector<size_t> before(a.size() + 1), last(a.size() + 1), now(a.size() + 1);
    for (size_t j = 0; j <= a.size(); ++j) last[j] = j;
    for (size_t i = 1; i <= b.size(); ++i) {
        now[0] = i;
        for (size_t j = 1; j <= a.size(); ++j) {
            now[j] = std::min({last[j] + 1, now[j - 1] + 1, last[j - 1] + (b[i - 1] == a[j - 1] ? 0 : 1)});
            if (i > 1 && j > 1 && b[i - 1] == a[j - 2] && b[i - 2] == a[j - 1])
                now[j] = std::min(now[j], before[j - 2] + 1);
        }
        if (*std::min_element(now.begin(), now.end()) > most) return most + 1;
        std::swap(before, last);
        std::swap(last, now);
    }
    return std::min(last[a.size()], most + 1);
}

} // namespace

std::vector<std::string> suggestions(const std::string& written, const std::vector<std::string>& candidates) {
    const std::string wanted = cxFoldedForSearch(written);
    const size_t most = wanted.size() < 3 ? 0 : wanted.size() < 6 ? 1 : 2;
    std::set<std::pair<size_t, std::string>> near;
    for (const std::string& candidate : candidates) {
        const std::string name = cxFoldedForSearch(candidate);
        size_t least = distance(wanted, name, most);
        for (size_t begin = 0; begin < name.size();) {
            const size_t end = std::min(name.find(' ', begin), name.size());
            least = std::min(least, distance(wanted, std::string_view(name).substr(begin, end - begin), most));
            begin = end + 1;
        }
        const bool isBegun = wanted.size() >= 2 && name.starts_with(wanted);
        if (isBegun || least <= most) near.emplace(isBegun ? 0 : least, candidate);
        if (near.size() > kMost) near.erase(std::prev(near.end()));
    }
    std::vector<std::string> all;
    for (const auto& [far, candidate] : near) all.push_back(candidate);
    return all;
}

std::string didYouMean(const std::vector<std::string>& suggested) {
    if (suggested.empty()) return "";
    std::string names;
    for (size_t i = 0; i < suggested.size(); ++i)
        names += (i == 0 ? "\"" : i + 1 == suggested.size() ? translated(" or \"") : ", \"") + suggested[i] + "\"";
    return tr(" Did you mean {}?", names);
}

} // namespace rolvane::cli
