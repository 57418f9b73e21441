#pragma once

#include "foundation/StrongString.h"

#include <map>
#include <mutex>
#include <string>

namespace rolvane {

// The lock tokens that this client holds, by endpoint URL, and those that it let go of without the store's having said
// that they are gone: that store may still keep the lock, and whoever asks next takes it over. Any thread.
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
        _abandoned.erase(url);
    }
    void drop(const std::string& url, const LockToken& token) {
        std::lock_guard guard(_mutex);
        const auto found = _tokens.find(url);
        if (found != _tokens.end() && found->second == token) _tokens.erase(found);
    }
    // The same as `drop`, and the lock may still stand on the store.
    void abandon(const std::string& url, const LockToken& token) {
        drop(url, token);
        std::lock_guard guard(_mutex);
        _abandoned[url] = token;
    }
    LockToken abandonedFor(const std::string& url) const {
        std::lock_guard guard(_mutex);
        const auto found = _abandoned.find(url);
        return found == _abandoned.end() ? LockToken() : found->second;
    }

private:
    mutable std::mutex _mutex;
    std::map<std::string, LockToken> _tokens, _abandoned;
};

} // namespace rolvane
