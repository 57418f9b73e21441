#include "store/http/HttpTransport.h"

#include "foundation/Mutex.h"

#include <algorithm>
#include <cstdlib>

namespace rolvane {

const char* description(TransportError error) {
    switch (error) {
    case TransportError::none: return "no error";
    case TransportError::unreachable: return "the store could not be reached";
    case TransportError::timedOut: return "the store did not answer in time";
    case TransportError::tls: return "no secure connection to the store could be made";
    case TransportError::tooLarge: return "the store's answer is larger than allowed";
    case TransportError::truncated: return "the store's answer is damaged or ends too early";
    case TransportError::refused: return "the request was not sent";
    case TransportError::aborted: return "the request was abandoned";
    }
    return "unknown error";
}

const std::string* HttpResponse::header(std::string_view lowerCaseName) const {
    for (const auto& [name, value] : headers)
        if (name == lowerCaseName) return &value;
    return nullptr;
}

std::optional<double> retryAfterSeconds(const HttpResponse& answer, const Date& now) {
    constexpr double kLongest = 1e6;
    const std::string* text = answer.header("retry-after");
    if (!text || text->empty()) return std::nullopt;
    if (text->find_first_not_of("0123456789") == std::string::npos) return std::min(kLongest, atof(text->c_str()));
    if (const auto date = Date::fromHTTP(*text)) return std::clamp(date->secondsSince(now), 0.0, kLongest);
    return std::nullopt;
}

std::vector<HttpResponse> HttpTransport::performAll(std::vector<HttpRequest> requests) {
    struct Gathering {
        Mutex mutex;
        Condition changed;
        std::vector<HttpResponse> answers GUARDED_BY(mutex);
        size_t missing GUARDED_BY(mutex);
    };
    auto gathering = std::make_shared<Gathering>();
    {
        const Lock guard(gathering->mutex);
        gathering->answers.resize(requests.size());
        gathering->missing = requests.size();
    }
    for (size_t i = 0; i < requests.size(); ++i)
        start(std::move(requests[i]), [gathering, i](HttpResponse answer) {
            Lock guard(gathering->mutex);
            gathering->answers[i] = std::move(answer);
            if (--gathering->missing == 0) gathering->changed.notify_all();
        });
    Lock lock(gathering->mutex);
    gathering->changed.wait(lock, [&]() REQUIRES(gathering->mutex) { return gathering->missing == 0; });
    return std::move(gathering->answers);
}

} // namespace rolvane
