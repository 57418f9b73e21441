#include "daemon/TreesAhead.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "store/dav/CXDAVManager.h"
#include "store/reads/ListingMemory.h"

#include <new>
#include <sys/eventfd.h>
#include <unistd.h>
#include <utility>

namespace rolvane {

TreesAhead::TreesAhead(RunLoop& loop, CXDAVManager& store)
    : _store(store), _event(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
    if (_event < 0) throw std::bad_alloc();
    _port = loop.addPort(_event, [this](uint32_t) { take(); });
}

TreesAhead::~TreesAhead() {
    if (_thread.joinable()) {
        _store.abortAll();
        _thread.join();
    }
    _port = {};
    ::close(_event);
}

bool TreesAhead::begin(const std::vector<Url>& trees, std::function<void()> done) {
    if (_thread.joinable()) return false;
    std::vector<Url> whole;
    for (const Url& tree : trees)
        if (!_useless.contains(tree.absoluteString()) && _store.isToBeListed(tree)) whole.push_back(tree);
    if (whole.empty()) return false;
    CXDLog("%d trees are listed before the next pass.", static_cast<int>(whole.size()));
    _done = std::move(done);
    _thread = std::thread([this, whole = std::move(whole)] { list(whole); });
    return true;
}

void TreesAhead::list(const std::vector<Url>& trees) {
    Listed listed;
    for (const Url& tree : trees) {
        listed.emplace_back(tree, nullptr);
        try {
            listed.back().second = _store.listAhead(tree);
        } catch (const CXException& exception) {
            CXLog("A tree could not be listed before the pass: %@", exception);
        }
    }
    {
        const Lock guard(_mutex);
        _listed = std::move(listed);
    }
    const uint64_t one = 1;
    [[maybe_unused]] const ssize_t written = ::write(_event, &one, sizeof one);
}

void TreesAhead::take() {
    uint64_t count = 0;
    [[maybe_unused]] const ssize_t got = ::read(_event, &count, sizeof count);
    std::optional<Listed> listed;
    {
        const Lock guard(_mutex);
        listed.swap(_listed);
    }
    if (!listed) return;
    _thread.join();
    for (auto& [tree, memory] : *listed) {
        const bool isAnswered = memory != nullptr;
        if (!_store.keepListing(tree, std::move(memory)) && isAnswered) _useless.insert(tree.absoluteString());
    }
    std::exchange(_done, nullptr)();
}

} // namespace rolvane
