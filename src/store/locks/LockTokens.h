#pragma once

#include "foundation/Mutex.h"
#include "foundation/StrongString.h"

#include <algorithm>
#include <deque>
#include <map>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// The locks of one client by endpoint URL: the tokens that it holds; those that it let go of without the store's having
// said that they are gone; and the marks of requests for a lock whose answer it did not hear. The store may still keep
// the latter two, and whoever asks next takes them over. Any thread.
class LockTokens {
public:
    LockToken tokenFor(const std::string& url) const {
        Lock guard(_mutex);
        const auto found = _tokens.find(url);
        return found == _tokens.end() ? LockToken() : found->second;
    }
    void set(const std::string& url, const LockToken& token) {
        Lock guard(_mutex);
        _tokens[url] = token;
        _abandoned.erase(url);
        if (const auto found = _unheard.find(url); found != _unheard.end()) found->second.toBeLookedFor = false;
    }
    void drop(const std::string& url, const LockToken& token) {
        Lock guard(_mutex);
        const auto found = _tokens.find(url);
        if (found != _tokens.end() && found->second == token) _tokens.erase(found);
    }
    // The same as `drop`, and the lock may still stand on the store.
    void abandon(const std::string& url, const LockToken& token) {
        drop(url, token);
        Lock guard(_mutex);
        _abandoned[url] = token;
    }
    LockToken abandonedFor(const std::string& url) const {
        Lock guard(_mutex);
        const auto found = _abandoned.find(url);
        return found == _abandoned.end() ? LockToken() : found->second;
    }
    void forgetAbandoned(const std::string& url) {
        Lock guard(_mutex);
        _abandoned.erase(url);
    }

    // A lock whose owner carries the mark may stand, though no answer has told of it.
    void expectUnheard(const std::string& url, const std::string& mark) {
        constexpr size_t kKept = 16; // a URL's; older locks have come to their end
        Lock guard(_mutex);
        Unheard& unheard = _unheard[url];
        unheard.marks.push_back(mark);
        if (unheard.marks.size() > kKept) unheard.marks.pop_front();
        unheard.toBeLookedFor = true;
    }
    // Whether the owner of a lock that stands there carries such a mark.
    bool isUnheard(const std::string& url, std::string_view owner) const {
        Lock guard(_mutex);
        const auto found = _unheard.find(url);
        if (found == _unheard.end()) return false;
        const auto& marks = found->second.marks;
        return std::any_of(marks.begin(), marks.end(),
                           [&](const std::string& mark) { return owner.find(mark) != std::string_view::npos; });
    }
    // The store has said that no such lock stands. A request may still be on its way, so the marks are kept.
    void lookedForUnheard(const std::string& url) {
        Lock guard(_mutex);
        if (const auto found = _unheard.find(url); found != _unheard.end()) found->second.toBeLookedFor = false;
    }

    // Whether, and where, the store may keep a lock of ours that nobody here holds.
    bool isLeftBehind(const std::string& url) const {
        Lock guard(_mutex);
        const auto found = _unheard.find(url);
        return _abandoned.contains(url) || (found != _unheard.end() && found->second.toBeLookedFor);
    }
    std::vector<std::string> leftBehind() const {
        Lock guard(_mutex);
        std::vector<std::string> urls;
        for (const auto& [url, token] : _abandoned) urls.push_back(url);
        for (const auto& [url, unheard] : _unheard)
            if (unheard.toBeLookedFor && !_abandoned.contains(url)) urls.push_back(url);
        return urls;
    }

    // A store that has shown that it keeps no locks there is not asked for one until then (seconds since boot).
    void needNone(const std::string& url, double until) {
        Lock guard(_mutex);
        _noneNeeded[url] = until;
    }
    bool needsNone(const std::string& url, double now) const {
        Lock guard(_mutex);
        const auto found = _noneNeeded.find(url);
        return found != _noneNeeded.end() && now < found->second;
    }

private:
    struct Unheard {
        std::deque<std::string> marks;
        bool toBeLookedFor = false;
    };
    mutable Mutex _mutex;
    std::map<std::string, LockToken> _tokens GUARDED_BY(_mutex), _abandoned GUARDED_BY(_mutex);
    std::map<std::string, Unheard> _unheard GUARDED_BY(_mutex);
    std::map<std::string, double> _noneNeeded GUARDED_BY(_mutex);
};

} // namespace rolvane
