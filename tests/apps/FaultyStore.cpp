#include "FaultyStore.h"

namespace rolvane::test {

namespace {

CurlTransportOptions trusting(const std::string& caFile) {
    CurlTransportOptions options;
    options.caFile = caFile;
    return options;
}

} // namespace

FaultyStore::FaultyStore(PrivateStore& store)
    : _upstream(trusting(store.caFile())), _origin(store.baseURL()), _secure(store.endpointTemplate()),
      _server([this](const FakeRequest& request) {
          Fault fault;
          {
              const std::lock_guard guard(_lock);
              fault = _fault;
          }
          const auto answer = fault ? fault(request) : std::nullopt;
          return answer ? *answer : handOn(request);
      }) {}

void FaultyStore::set(Fault fault) {
    const std::lock_guard guard(_lock);
    _fault = std::move(fault);
}

void FaultyStore::answerAll(int status, const std::string& body, const std::string& headers) {
    set([=](const FakeRequest&) { return FakeAnswer::status(status, body, headers); });
}

std::vector<std::string> FaultyStore::account() const {
    return {"account",
            "set",
            "--endpoint",
            _server.origin() + "/dav/{user}/Contacts",
            "--secure-endpoint",
            _secure,
            "--host",
            Url(_origin).host() + ":" + std::to_string(Url(_origin).port().value_or(443)),
            "--plain-loopback"};
}

FakeAnswer FaultyStore::handOn(const FakeRequest& request) {
    HttpRequest out;
    out.method = request.method;
    out.url = Url(Url(_origin).origin() + request.target);
    for (const auto& [name, value] : request.headers)
        if (name != "host" && name != "content-length" && name != "connection" && name != "user-agent" &&
            name != "expect" && name != "accept-encoding")
            out.headers.emplace_back(name, value);
    if (!request.body.empty() || request.method == "PUT") out.body = std::make_shared<const std::string>(request.body);
    const HttpResponse in = _upstream.perform(std::move(out));
    if (!in.complete()) return FakeAnswer::raw({}); // the connection ends
    std::string headers;
    for (const auto& [name, value] : in.headers)
        if (name != "content-length" && name != "transfer-encoding" && name != "connection" && name != "keep-alive")
            headers += name + ": " + value + "\r\n";
    return FakeAnswer::status(in.status, in.body, headers);
}

} // namespace rolvane::test
