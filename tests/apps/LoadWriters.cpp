#include "LoadWriters.h"

#include <algorithm>
#include <array>
#include <chrono>
#include <curl/curl.h>

namespace rolvane::test {

namespace {

constexpr const char* kPatch =
    "<D:propertyupdate xmlns:D=\"DAV:\"><D:set><D:prop><x xmlns=\"urn:x\">1</x></D:prop></D:set>"
    "</D:propertyupdate>";

size_t discard(char*, size_t size, size_t count, void*) {
    return size * count;
}

// A connection of one thread.
class Client {
public:
    explicit Client(const LoadWriters::Options& options) : _curl(curl_easy_init()) {
        curl_easy_setopt(_curl, CURLOPT_CAINFO, options.caFile.c_str());
        curl_easy_setopt(_curl, CURLOPT_USERPWD, (options.user + ":" + options.password).c_str());
        curl_easy_setopt(_curl, CURLOPT_HTTPAUTH, CURLAUTH_BASIC);
        curl_easy_setopt(_curl, CURLOPT_HTTP_VERSION, CURL_HTTP_VERSION_1_1);
        curl_easy_setopt(_curl, CURLOPT_NOPROXY, "*");
        curl_easy_setopt(_curl, CURLOPT_NOSIGNAL, 1L);
        curl_easy_setopt(_curl, CURLOPT_TIMEOUT, 20L);
        curl_easy_setopt(_curl, CURLOPT_WRITEFUNCTION, discard);
    }
    ~Client() { curl_easy_cleanup(_curl); }
    Client(const Client&) = delete;
    Client& operator=(const Client&) = delete;

    int perform(const char* method, const std::string& url, const std::string& body, const std::string& destination) {
        curl_slist* headers = nullptr;
        if (!destination.empty()) headers = curl_slist_append(headers, ("Destination: " + destination).c_str());
        headers = curl_slist_append(headers, "Content-Type:");
        curl_easy_setopt(_curl, CURLOPT_URL, url.c_str());
        curl_easy_setopt(_curl, CURLOPT_HTTPHEADER, headers);
        curl_easy_setopt(_curl, CURLOPT_HTTPGET, 1L); // forgets the last body
        if (!body.empty()) {
            curl_easy_setopt(_curl, CURLOPT_POSTFIELDSIZE, static_cast<long>(body.size()));
            curl_easy_setopt(_curl, CURLOPT_COPYPOSTFIELDS, body.c_str());
        }
        curl_easy_setopt(_curl, CURLOPT_CUSTOMREQUEST, method);
        long status = 0;
        if (curl_easy_perform(_curl) == CURLE_OK) curl_easy_getinfo(_curl, CURLINFO_RESPONSE_CODE, &status);
        curl_slist_free_all(headers);
        return static_cast<int>(status);
    }

private:
    CURL* _curl;
};

} // namespace

LoadWriters::LoadWriters(Options options, Order& order) : _options(std::move(options)), _order(order) {
    curl_global_init(CURL_GLOBAL_DEFAULT);
    _requests.resize(static_cast<size_t>(_options.threads));
    for (int i = 0; i < _options.threads; ++i) _threads.emplace_back([this, i] { write(i); });
}

LoadWriters::~LoadWriters() {
    _ending = true;
    for (std::thread& thread : _threads) thread.join();
}

void LoadWriters::write(int thread) {
    struct Step {
        const char *method, *name, *body, *destination;
    };
    constexpr std::array<Step, 9> kSteps{{{"PUT", "", "a new file", nullptr},
                                          {"PROPPATCH", "", kPatch, nullptr},
                                          {"PUT", "", "another version", nullptr},
                                          {"MOVE", "", "", "-moved"},
                                          {"DELETE", "-moved", "", nullptr},
                                          {"PUT", "", "once more", nullptr},
                                          {"COPY", "", "", "-moved"},
                                          {"MKCOL", "-inside", "", nullptr},
                                          {"DELETE", "-inside", "", nullptr}}};
    Client client(_options);
    const std::string name = _options.collection + "load-" + std::to_string(thread);
    for (size_t i = 0; !_ending; ++i) {
        const Step& step = kSteps[i % kSteps.size()];
        const std::string body = *step.body && step.body != kPatch ? step.body + std::to_string(i) : step.body;
        const uint64_t began = _order.next();
        const int status =
            client.perform(step.method, name + step.name, body, step.destination ? name + step.destination : "");
        finished(thread, {began, _order.next(), status, step.method});
    }
}

void LoadWriters::finished(int thread, Request request) {
    const std::lock_guard guard(_mutex);
    _requests[static_cast<size_t>(thread)].push_back(request);
    _changed.notify_all();
}

bool LoadWriters::awaitEach(size_t count, uint64_t after) {
    std::unique_lock guard(_mutex);
    return _changed.wait_for(guard, std::chrono::seconds(30), [&] {
        return std::all_of(_requests.begin(), _requests.end(), [&](const std::vector<Request>& requests) {
            const auto first = std::partition_point(requests.begin(), requests.end(),
                                                    [&](const Request& r) { return r.began < after; });
            return static_cast<size_t>(requests.end() - first) >= count;
        });
    });
}

std::vector<LoadWriters::Request> LoadWriters::requests() const {
    const std::lock_guard guard(_mutex);
    std::vector<Request> all;
    for (const auto& requests : _requests) all.insert(all.end(), requests.begin(), requests.end());
    return all;
}

} // namespace rolvane::test
