#pragma once

#include "foundation/Url.h"
#include "store/dav/CXDAVNode.h"

#include <optional>
#include <string>

namespace rolvane {

class CXDAVManager;

// One question to the network store, answered with a tree. Made, set up, executed once; one thread.
class CXDAVQuery {
public:
    static constexpr int kUnboundedDepth = -1;
    static constexpr int kPropfind = 0; // the one query type

    // The client signs in with its own account; the password never passes through here. `url` is a name of that
    // account; one with the scheme https is asked over TLS whatever the account says.
    CXDAVQuery(CXDAVManager& manager, Url url);

    void setUserAgent(std::string agent) { _agent = std::move(agent); }
    void setDepth(int depth) { _depth = depth; } // 0, 1, or kUnboundedDepth, which is what a new query has
    void setQueryType(int type) { _type = type; }
    void setBody(std::string body) { _body = std::move(body); } // UTF-8, sent as it is

    // The answer's root: see parseDAVTree. Nothing when the query did not succeed. Most servers refuse an unbounded
    // depth (RFC 4918 section 9.1); the query then is asked once more about the resource itself.
    std::optional<CXDAVNode> execute();
    bool succeeded() const { return _succeeded; } // a whole, well-formed multistatus came
    int status() const { return _status; }        // of the last answer; 0 when none can be believed

private:
    std::optional<CXDAVNode> ask(int depth);

    CXDAVManager& _manager;
    const Url _url;
    std::string _agent, _body;
    int _depth = kUnboundedDepth, _type = kPropfind, _status = 0;
    bool _succeeded = false, _refused = false;
};

} // namespace rolvane
