#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// One line of the answer to a request that waits for news (docs/mod_davacl.md).
struct NewsLine {
    enum class Kind {
        begin, // everything from here on is told; `position` is where it begins
        no,    // of this tree nothing is told: it may not be read
        news,  // something in the tree is another one than at the position before
        still  // nothing has come for a while, and the store is there
    };
    Kind kind = Kind::still;
    size_t tree = 0; // of `no` and `news`: counted from 0, as they were named
    std::string position = {};
    friend bool operator==(const NewsLine&, const NewsLine&) = default;
};

// Takes the answer apart as it comes. What is no answer of that kind is nothing, from then on: lines out of order,
// trees that nobody named, lines that have no end.
class NewsLines {
public:
    explicit NewsLines(size_t trees) : _trees(trees) {}
    // The lines that have become whole; nothing when this is no such answer.
    std::optional<std::vector<NewsLine>> take(std::string_view bytes);

private:
    std::optional<NewsLine> parse(std::string_view line) const;
    const size_t _trees;
    std::string _rest;
    bool _begun = false, _failed = false;
};

} // namespace rolvane
