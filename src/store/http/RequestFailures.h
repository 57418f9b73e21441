#pragma once

#include "foundation/Mutex.h"
#include "foundation/Url.h"
#include "store/http/HttpTransport.h"

#include <cstdint>
#include <deque>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

// One request whose answer made a caller's operation fail.
struct RequestFailure {
    std::string method; // "PUT"
    Url name;           // of the file or folder, below its remote location; the address itself where it has no name
    int status = 0;     // 0: no answer, or none that can be believed
    TransportError error = TransportError::none;
    std::string words;                       // see serverWords
    std::optional<double> retryAfterSeconds; // from the moment of the answer
};

// The answer in the server's own words, for a person: one line of at most 200 bytes, valid UTF-8, without markup,
// control characters and characters that turn the direction of writing. Taken from a body of text/plain, HTML or XML
// (where an XML body holds elements alone, the name of the innermost first one). Without a complete answer it is the
// transport's reason, and of a redirect where it leads to. "" when the server said nothing.
std::string serverWords(const HttpResponse& answer);

// The requests of one client that failed. Any thread.
//
// Memory is bounded: of each tree, method and status the first 20 and the last 20 are kept.
class RequestFailures {
public:
    static constexpr size_t kFirst = 20, kLast = 20;
    static constexpr size_t kKinds = 1000; // trees times methods times statuses; more kinds share one place

    void note(RequestFailure failure);
    void note(std::string method, Url name, const HttpResponse& answer);
    // All that were noted since the last call, in the order of their coming.
    std::vector<RequestFailure> take();
    // The latest of them that names the location or something below it.
    std::optional<RequestFailure> latestBelow(const Url& baseName) const;

private:
    struct Numbered {
        uint64_t number;
        RequestFailure failure;
    };
    struct Kept {
        std::vector<Numbered> first;
        std::deque<Numbered> last;
    };
    mutable Mutex _mutex;
    std::map<std::string, Kept> _kinds GUARDED_BY(_mutex);
    uint64_t _noted GUARDED_BY(_mutex) = 0;
};

} // namespace rolvane
