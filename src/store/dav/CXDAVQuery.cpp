#include "store/dav/CXDAVQuery.h"

#include "store/dav/CXDAVManager.h"
#include "store/dav/CXDAVManagerImpl.h"

#include <memory>
#include <strings.h>

namespace rolvane {
namespace {

constexpr size_t kAnswerBytes = 8u << 20;

// What a server says that does not serve this depth; a refused login or an absent resource is no such answer.
bool refusesTheDepth(int status) {
    return status == 400 || status == 403 || status == 405 || status == 501 || status == 507;
}

} // namespace

CXDAVQuery::CXDAVQuery(CXDAVManager& manager, Url url) : _manager(manager), _url(std::move(url)) {}

std::optional<CXDAVNode> CXDAVQuery::ask(int depth) {
    StoreSession& session = _manager.impl()->session;
    const auto target = session.endpoint(_url, strcasecmp(_url.scheme().c_str(), "https") == 0);
    if (!target) return std::nullopt;
    HttpRequest request = StoreSession::request("PROPFIND", *target);
    request.headers = {{"Depth", depth == kUnboundedDepth ? "infinity" : std::to_string(depth)},
                       {"Content-Type", "application/xml; charset=utf-8"}};
    if (!_agent.empty()) request.headers.emplace_back("User-Agent", _agent);
    request.body = std::make_shared<const std::string>(_body);
    request.limits.maxBodyBytes = kAnswerBytes;
    const HttpResponse answer = session.send(std::move(request), depth == kUnboundedDepth ? refusesTheDepth : nullptr);
    _status = answer.status;
    _refused = answer.error == TransportError::tooLarge || refusesTheDepth(answer.status);
    if (!answer.complete() || answer.status != 207) return std::nullopt;
    return parseDAVTree(answer.body);
}

std::optional<CXDAVNode> CXDAVQuery::execute() {
    _succeeded = false;
    if (_type != kPropfind) return std::nullopt;
    auto root = ask(_depth);
    if (!root && _refused && _depth == kUnboundedDepth) root = ask(0);
    _succeeded = root.has_value();
    return root;
}

} // namespace rolvane
