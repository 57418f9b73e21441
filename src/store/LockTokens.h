#pragma once

#include "foundation/StrongString.h"

#include <map>
#include <mutex>
#include <string>

namespace rolvane {

// The lock tokens that this client holds, by endpoint URL. Any thread.
class LockTokens {
public:
    LockToken tokenFor(const std::string& url) const {
        std::lock_guard guard(_mutex);
        const auto found = _tokens.find(url);
        return found == _tokens.end() ? LockToken() : found->second;
    }
    void set(const std::string& url, const LockToken& token) {
        std::lock_guard guard(_mutex);
        _tokens[url] = token;
    }
    void drop(const std::string& url, const LockToken& token) {
        std::lock_guard guard(_mutex);
        const auto found = _tokens.find(url);
        if (found != _tokens.end() && found->second == token) _tokens.erase(found);
    }

private:
    mutable std::mutex _mutex;
    std::map<std::string, LockToken> _tokens;
};

} // namespace rolvane
