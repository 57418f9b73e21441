#pragma once

#include <cstdint>
#include <cstring>
#include <string>
#include <string_view>

namespace rolvane {

// The form of a cache file: numbers as the machine has them, texts behind their sizes.

inline void cacheAppend(std::string& out, uint64_t number) {
    out.append(reinterpret_cast<const char*>(&number), sizeof number);
}

inline void cacheAppend(std::string& out, std::string_view text) {
    cacheAppend(out, uint64_t{text.size()});
    out += text;
}

// Reads what `cacheAppend` has written. Past the end all is zero or empty, and isWhole false.
class CacheReader {
public:
    explicit CacheReader(std::string_view text) : _rest(text) {}
    bool isWhole() const { return _isWhole; }
    bool atEnd() const { return _rest.empty(); }
    std::string_view bytes(uint64_t size) {
        if (size > _rest.size()) {
            _isWhole = false;
            _rest = {};
            return {};
        }
        const std::string_view out = _rest.substr(0, size);
        _rest.remove_prefix(size);
        return out;
    }
    uint64_t number() {
        uint64_t out = 0;
        if (const std::string_view here = bytes(sizeof out); here.size() == sizeof out)
            std::memcpy(&out, here.data(), sizeof out);
        return out;
    }
    std::string_view text() { return bytes(number()); }

private:
    std::string_view _rest;
    bool _isWhole = true;
};

} // namespace rolvane
