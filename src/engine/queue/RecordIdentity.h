#pragma once

#include "model/CXDChangeRecord.h"

#include <cstddef>
#include <functional>

namespace rolvane {

// Hashing by record equality. The applies-to mask is left out of the hash: it changes while records are handled, and a
// record must still be found afterwards.
struct RecordHash {
    size_t operator()(const CXDChangeRecordPtr& record) const { return (*this)(*record); }
    size_t operator()(const CXDChangeRecord& record) const {
        size_t h = std::hash<int64_t>{}((int64_t{record.type()} << 32) ^ record.initialSource());
        mix(h, record.person());
        mix(h, record.group());
        mix(h, record.user());
        return h;
    }

private:
    template <class Text>
    static void mix(size_t& h, const std::optional<Text>& text) {
        h = h * 1099511628211ull ^ (text ? std::hash<Text>{}(*text) : 0x9e3779b97f4a7c15ull);
    }
};

struct RecordEqual {
    bool operator()(const CXDChangeRecordPtr& a, const CXDChangeRecordPtr& b) const { return a->isEqual(*b); }
};

} // namespace rolvane
