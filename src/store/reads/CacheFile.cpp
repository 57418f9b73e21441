#include "store/reads/CacheFile.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Paths.h"
#include "store/reads/CacheText.h"

#include <algorithm>
#include <cstring>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr std::string_view kMagic = "RVC1";
constexpr size_t kHead = kMagic.size() + sizeof(uint64_t);

uint64_t sumOf(std::string_view bytes) {
    uint64_t sum = 0xcbf29ce484222325U ^ bytes.size();
    for (; !bytes.empty(); bytes.remove_prefix(std::min(bytes.size(), sizeof(uint64_t)))) {
        uint64_t number = 0;
        std::memcpy(&number, bytes.data(), std::min(bytes.size(), sizeof number));
        sum = (sum ^ number) * 0xd6e8feb86659fd93U;
        sum ^= sum >> 32;
    }
    return sum;
}

} // namespace

std::string CacheFile::read() const {
    if (_path.empty() || access(_path.c_str(), R_OK) != 0) return {};
    try {
        std::string text = readFile(_path, kMostBytes);
        if (text.size() < kHead || !text.starts_with(kMagic)) return {};
        CacheReader behind(std::string_view(text).substr(kMagic.size()));
        const uint64_t sum = behind.number();
        if (sum != sumOf(std::string_view(text).substr(kHead)) || behind.text() != _owner) return {};
        return text.substr(kHead + sizeof(uint64_t) + _owner.size());
    } catch (const CXException& e) {
        CXDLog("What is remembered of the store is left out: %@", e.reason());
        return {};
    }
}

void CacheFile::write(std::string_view content) const {
    if (_path.empty()) return;
    std::string rest;
    rest.reserve(content.size() + _owner.size() + sizeof(uint64_t));
    cacheAppend(rest, std::string_view(_owner));
    rest += content;
    std::string text(kMagic);
    text.reserve(kHead + rest.size());
    cacheAppend(text, sumOf(rest));
    text += rest;
    if (text.size() > kMostBytes) return;
    try {
        writeFileWhole(_path, text);
    } catch (const CXException& e) {
        CXLog("What is remembered of the store could not be saved: %@", e.reason());
    }
}

} // namespace rolvane
