#pragma once

#include <cstdint>
#include <initializer_list>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane::worlds {

// Numbers that depend on their seed alone, the same on every machine. One thread.
class Chance {
public:
    explicit Chance(uint64_t seed) : _state(seed) {}

    uint64_t next() {
        uint64_t z = (_state += 0x9e3779b97f4a7c15);
        z = (z ^ (z >> 30)) * 0xbf58476d1ce4e5b9;
        z = (z ^ (z >> 27)) * 0x94d049bb133111eb;
        return z ^ (z >> 31);
    }
    size_t below(size_t limit) { return limit == 0 ? 0 : static_cast<size_t>(next() % limit); }
    size_t between(size_t least, size_t most) { return least + below(most - least + 1); }
    bool happens(double probability) { return static_cast<double>(next() >> 11) * 0x1p-53 < probability; }
    template <class T>
    const T& oneOf(const std::vector<T>& all) {
        return all[below(all.size())];
    }

private:
    uint64_t _state;
};

inline uint64_t hashOf(std::string_view text, uint64_t seed = 0) {
    uint64_t hash = 0xcbf29ce484222325 ^ seed;
    for (const char c : text) hash = (hash ^ static_cast<unsigned char>(c)) * 0x100000001b3;
    return Chance(hash).next();
}

} // namespace rolvane::worlds
