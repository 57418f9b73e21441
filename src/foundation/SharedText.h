#pragma once

#include <atomic>
#include <compare>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <utility>

namespace rolvane {

// An immutable text that its copies share: a copy costs a counter, and copies are equal without a look at the text. The
// hash is computed once. Any thread.
class SharedText {
public:
    SharedText() = default; // ""
    explicit SharedText(std::string text) : _node(text.empty() ? nullptr : new Node(std::move(text))) {}
    SharedText(const SharedText& other) noexcept : _node(other._node) {
        if (_node) _node->references.fetch_add(1, std::memory_order_relaxed);
    }
    SharedText(SharedText&& other) noexcept : _node(std::exchange(other._node, nullptr)) {}
    SharedText& operator=(SharedText other) noexcept {
        std::swap(_node, other._node);
        return *this;
    }
    ~SharedText() {
        if (_node && _node->references.fetch_sub(1, std::memory_order_acq_rel) == 1) delete _node;
    }

    const std::string& str() const noexcept { return _node ? _node->text : kEmpty; }
    bool empty() const noexcept { return !_node; }
    // hashOf(str()).
    uint32_t hash() const noexcept {
        if (!_node) return hashOf({});
        uint32_t known = _node->hash.load(std::memory_order_relaxed);
        if (known == 0) _node->hash.store(known = hashOf(_node->text), std::memory_order_relaxed);
        return known;
    }
    // Asks the processor to bring near what hash() and the first look at the text need.
    void prefetch() const noexcept { __builtin_prefetch(_node); }
    static uint32_t hashOf(std::string_view text) noexcept { // never 0
        const uint64_t wide = std::hash<std::string_view>{}(text);
        const auto folded = static_cast<uint32_t>(wide ^ (wide >> 32));
        return folded ? folded : 1;
    }

    friend bool operator==(const SharedText& a, const SharedText& b) noexcept {
        return a._node == b._node || (a._node && b._node && a._node->text == b._node->text);
    }
    friend std::strong_ordering operator<=>(const SharedText& a, const SharedText& b) noexcept {
        return a._node == b._node ? std::strong_ordering::equal : a.str() <=> b.str();
    }

private:
    struct Node {
        explicit Node(std::string t) : text(std::move(t)) {}
        std::atomic<uint32_t> references{1};
        std::atomic<uint32_t> hash{0}; // 0: not computed yet
        const std::string text;
    };
    static inline const std::string kEmpty;
    Node* _node = nullptr;
};

} // namespace rolvane
