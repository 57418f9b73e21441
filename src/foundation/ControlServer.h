#pragma once

#include "foundation/ControlMessage.h"
#include "foundation/ControlSocket.h"
#include "foundation/Mutex.h"

#include <functional>
#include <map>
#include <set>
#include <sys/types.h>
#include <thread>

namespace rolvane {

// The daemon's end of the control socket: hears what commands post, answers that it has heard, and tells them what they
// observe. A thread of its own answers, so a command learns within a moment that the daemon lives, however long the
// main thread is busy with a pass.
//
// Bounds: at most kMostPeers at a time and kMostOfOneProcess of one process, the next ones are let go at once; a peer
// that does not read loses progress first (names that `mayBeDropped`), and the connection when more than kMostWaiting
// bytes wait for it. A peer that does nothing but send is read kMostATurn bytes at a time, and the others have their
// turns in between. Who observes more than kMostNames names is let go.
class ControlServer {
public:
    static constexpr size_t kMostPeers = 128;
    static constexpr size_t kMostOfOneProcess = 32; // so that one that loses count leaves room for the others
    static constexpr size_t kMostWaiting = size_t{4} << 20;
    static constexpr size_t kDropsFrom = size_t{256} << 10;
    static constexpr size_t kMostATurn = size_t{64} << 10;
    static constexpr size_t kMostNames = 100;

    struct Callbacks { // on the server's thread
        std::function<void(const Notification&)> arrived;
        std::function<bool(const std::string& name)> observes;       // whether anybody acts on such a notification
        std::function<bool(const std::string& name)> mayBeDropped{}; // none: nothing may
    };
    // Listens when it returns. CXException when it cannot.
    ControlServer(std::string path, Callbacks callbacks);
    ~ControlServer(); // the socket's file goes, too
    ControlServer(const ControlServer&) = delete;
    ControlServer& operator=(const ControlServer&) = delete;

    const std::string& path() const { return _path; }
    // Any thread; never waits. True when a peer observes it.
    bool post(const Notification& notification);
    void removeFile() const; // before the process ends without running destructors; any thread

private:
    struct Peer {
        OwnedDescriptor socket;
        pid_t process = 0; // that connected
        ControlReader reader;
        std::set<std::string> observed;
        std::string waiting; // bytes that its socket did not take yet
        bool gone = false;
    };
    void serve();
    bool accept(); // false when no descriptor is left for another peer
    bool hasRoomFor(pid_t process) const REQUIRES(_mutex);
    void read(Peer& peer);
    void answer(Peer& peer, const ControlMessage& message);
    static void write(Peer& peer, const std::string& bytes);
    static void flush(Peer& peer);
    void wake() const;

    const std::string _path;
    const Callbacks _callbacks;
    OwnedDescriptor _listening, _woken;
    Mutex _mutex;
    std::map<int, Peer> _peers GUARDED_BY(_mutex); // by their descriptor
    bool _ended GUARDED_BY(_mutex) = false;
    std::thread _thread;
};

} // namespace rolvane
