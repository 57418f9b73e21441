#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace rolvane::davacl {

// Up to where somebody knows the members of a collection (RFC 6578 section 4).
//   urn:x-rolvane:tree:<d|s>:<epoch>:<scope>:<number>:<time>[:<hash>:<base>:<time of the last whole answer>:<0|1>]
// with numbers in hexadecimal. A made-up token gets nothing but readable members.
struct SyncToken {
    bool isDeep = false;
    uint64_t epoch = 0;    // of the journal
    uint64_t scope = 0;    // of collection and rights
    int64_t number = 0;    // of the last change that was told
    int64_t time = 0;      // when that was looked at, in nanoseconds since 1970; 0: long after everything's last change
    struct Cut {           // an answer that was cut
        uint64_t hash = 0; // of the last path of the number that was told
        int64_t base = 0;  // the number of the last whole answer; departures before it need not be told
        int64_t time = 0;  // that one's time
        bool isFirst = false; // there was none; the base is where the pages began
    };
    std::optional<Cut> cut;

    std::string text() const;
    static std::optional<SyncToken> parse(std::string_view text);
};

} // namespace rolvane::davacl
