#include "contacts/database/ChangeWatcher.h"

#include "contacts/records/Constants.h"
#include "foundation/Log.h"

#include <atomic>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>

namespace rolvane {

namespace {

constexpr const char* kTouchSuffix = "-changed";
constexpr const char* kLogSuffix = "-wal";
constexpr double kLookInterval = 1;  // seconds
constexpr double kLogSettles = 0.25; // seconds between a write to the log and the commit that it may belong to

} // namespace

void ChangeWatcher::touch(const std::string& databasePath) {
    int fd = ::open((databasePath + kTouchSuffix).c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
    if (fd < 0) return;
    ::futimens(fd, nullptr);
    ::close(fd);
}

ChangeWatcher::ChangeWatcher(RunLoop& loop, DistributedNotifications* distributed, const std::string& databasePath,
                             std::function<void()> changed)
    : _loop(loop), _path(databasePath), _name(std::filesystem::path(databasePath).filename()),
      _directory(std::filesystem::path(databasePath).parent_path()), _changed(std::move(changed)) {
    if (distributed)
        _signal = distributed->observe(
            kCXDatabaseChangedDistributedNotification,
            [this](const Notification& n) {
                if (n.userInfo[kCXDatabasePathKey].string() == _path) callSoon();
            },
            true);
    if (watch()) return;
    static std::atomic<bool> said{false};
    if (!said.exchange(true))
        CXLog("The directory %@ cannot be watched (%@): the database is looked at every second instead. "
              "Raise fs.inotify.max_user_instances or fs.inotify.max_user_watches.",
              _directory, std::strerror(errno));
    _seen = marks();
    lookLater();
}

bool ChangeWatcher::watch() {
    _fd = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
    if (_fd < 0) return false;
    if (::inotify_add_watch(_fd, _directory.c_str(), IN_MODIFY | IN_ATTRIB | IN_CREATE | IN_MOVED_TO) < 0) {
        const int why = errno;
        ::close(std::exchange(_fd, -1));
        errno = why;
        return false;
    }
    _port = _loop.addPort(_fd, [this](uint32_t) { readEvents(); });
    return true;
}

ChangeWatcher::Marks ChangeWatcher::marks() const {
    const auto of = [](const std::string& path) {
        struct stat info {};
        if (::stat(path.c_str(), &info) != 0) return std::string("-");
        return std::to_string(info.st_ino) + " " + std::to_string(info.st_size) + " " +
               std::to_string(info.st_mtim.tv_sec) + "." + std::to_string(info.st_mtim.tv_nsec) + " ";
    };
    return {of(_path + kTouchSuffix) + of(_path), of(_path + kLogSuffix)};
}

// Other processes may have ended by now, so that there is a watch again.
void ChangeWatcher::lookLater() {
    _look = _loop.scheduleTimer(kLookInterval, [this] {
        const RunLoop::Handle fired = std::move(_look);
        const bool watches = watch();
        const Marks now = marks();
        if (now.touched != _seen.touched) callSoon();
        if (now.log != _seen.log) callLater();
        _seen = now;
        if (!watches) lookLater();
    });
}

ChangeWatcher::~ChangeWatcher() {
    _port.reset();
    if (_fd >= 0) ::close(_fd);
}

void ChangeWatcher::readEvents() {
    alignas(inotify_event) char buffer[4096];
    ssize_t size;
    while ((size = ::read(_fd, buffer, sizeof buffer)) > 0) {
        for (ssize_t at = 0; at < size;) {
            inotify_event event;
            std::memcpy(&event, buffer + at, sizeof event);
            std::string name = event.len ? std::string(buffer + at + sizeof event) : std::string();
            at += static_cast<ssize_t>(sizeof event + event.len);
            const bool replaced = name == _name && (event.mask & (IN_CREATE | IN_MOVED_TO));
            if (name == _name + kTouchSuffix || replaced || (event.mask & IN_Q_OVERFLOW)) callSoon();
            if (name == _name + kLogSuffix) callLater();
        }
    }
}

void ChangeWatcher::callSoon() {
    if (_soon) return;
    _soon = _loop.scheduleTimer(0, [this] {
        RunLoop::Handle fired = std::move(_soon);
        _changed();
    });
}

void ChangeWatcher::callLater() {
    if (_later) return;
    _later = _loop.scheduleTimer(kLogSettles, [this] {
        RunLoop::Handle fired = std::move(_later);
        _changed();
    });
}

} // namespace rolvane
