#include "foundation/Mutex.h"
#include "foundation/Paths.h"
#include "store/locks/CXWebDAVLock.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane {

namespace {

// A lock file: its presence is the lock, its text "<nonce>\n<expiry, seconds since 1970>\n" says whose and until when.
// It appears whole, by link, so that of two takers one wins; an expired one is moved aside first, and whoever moved
// something else than what it had judged puts it back.
class FileLock : public CXWebDAVLock {
public:
    FileLock(const Url& url, Clock& clock) : _url(url), _path(url.path()), _clock(clock), _nonce(makeUUID()) {}

    bool tryLock() override {
        Lock guard(_mutex);
        if (_held) return true;
        if (!appear() && !(clearExpired() && appear())) return false;
        return _held = true;
    }

    void unlock() override {
        Lock guard(_mutex);
        if (_held && owner() == _nonce) ::unlink(_path.c_str());
        _held = false;
    }

    bool renew() override {
        Lock guard(_mutex);
        if (!_held) return false;
        const std::string fresh = _path + "." + _nonce;
        const Date until = _clock.now().addingSeconds(lockTimeout());
        if (owner() != _nonce || !writeText(fresh, until)) return _held = false;
        if (::rename(fresh.c_str(), _path.c_str()) != 0) {
            ::unlink(fresh.c_str());
            return _held = false;
        }
        _expires = until;
        return true;
    }

    bool locked() const override {
        Lock guard(_mutex);
        return _held;
    }

    Date expires() const override {
        Lock guard(_mutex);
        return _held ? _expires : _clock.now().addingSeconds(lockTimeout());
    }

    const Url& url() const override { return _url; }

private:
    bool appear() REQUIRES(_mutex) {
        const std::string fresh = _path + "." + _nonce;
        const Date until = _clock.now().addingSeconds(lockTimeout());
        if (!writeText(fresh, until)) return false;
        const bool linked = ::link(fresh.c_str(), _path.c_str()) == 0;
        ::unlink(fresh.c_str());
        if (linked) _expires = until;
        return linked;
    }

    bool writeText(const std::string& path, Date until) const {
        char text[128];
        const int n = snprintf(text, sizeof text, "%s\n%.3f\n", _nonce.c_str(), until.secondsSince1970());
        const int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, 0644);
        if (fd < 0) return false;
        const bool written = ::write(fd, text, static_cast<size_t>(n)) == n;
        if (close(fd) == 0 && written) return true;
        ::unlink(path.c_str());
        return false;
    }

    // The lock file's text, or "" when there is none.
    static std::string textOf(const std::string& path) {
        const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOFOLLOW);
        if (fd < 0) return {};
        char buffer[256];
        const ssize_t n = read(fd, buffer, sizeof buffer);
        close(fd);
        return n > 0 ? std::string(buffer, static_cast<size_t>(n)) : std::string();
    }

    std::string owner() const {
        const std::string text = textOf(_path);
        return text.substr(0, text.find('\n'));
    }

    bool clearExpired() {
        const std::string text = textOf(_path);
        const size_t line = text.find('\n');
        double until = line == std::string::npos ? 0 : atof(text.c_str() + line + 1);
        if (until <= 0) { // somebody else's file: it counts as a lock from its own date on
            struct stat st;
            if (lstat(_path.c_str(), &st) != 0) return errno == ENOENT;
            until = static_cast<double>(st.st_mtim.tv_sec) + lockTimeout();
        }
        if (until > _clock.now().secondsSince1970()) return false;
        const std::string aside = _path + "." + _nonce + ".old";
        if (::rename(_path.c_str(), aside.c_str()) != 0) return errno == ENOENT;
        const bool same = textOf(aside) == text;
        if (!same && ::link(aside.c_str(), _path.c_str()) != 0) { /* a third taker was faster; it holds the lock */
        }
        ::unlink(aside.c_str());
        return same;
    }

    const Url _url;
    const std::string _path;
    Clock& _clock;
    const std::string _nonce;
    mutable Mutex _mutex;
    bool _held GUARDED_BY(_mutex) = false;
    Date _expires GUARDED_BY(_mutex);
};

} // namespace

std::shared_ptr<CXWebDAVLock> makeFileLock(const Url& fileUrl, Clock& clock) {
    return std::make_shared<FileLock>(fileUrl, clock);
}

} // namespace rolvane
