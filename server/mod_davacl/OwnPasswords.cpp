#include "server/mod_davacl/OwnPasswords.h"

#include "server/mod_davacl/AccessLists.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <openssl/evp.h>
#include <sys/file.h>
#include <unistd.h>

namespace rolvane::davacl {
namespace {

constexpr size_t kLargestFile = 1024;

struct File {
    int fd = -1;
    explicit File(int opened) : fd(opened) {}
    ~File() {
        if (fd >= 0) close(fd);
    }
    File(const File&) = delete;
    File& operator=(const File&) = delete;
};

// "" when there is no SHA-256 to be had, which fits no file.
std::string digestOf(const std::string& text) {
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int size = 0;
    if (EVP_Digest(text.data(), text.size(), digest, &size, EVP_sha256(), nullptr) != 1) return {};
    std::string hex;
    for (unsigned int i = 0; i < size; ++i) {
        hex += "0123456789abcdef"[digest[i] >> 4];
        hex += "0123456789abcdef"[digest[i] & 15];
    }
    return hex;
}

std::string contents(const std::string& path) {
    const File file(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
    char text[kLargestFile];
    const ssize_t count = file.fd < 0 ? -1 : read(file.fd, text, sizeof text);
    return count <= 0 ? std::string() : std::string(text, static_cast<size_t>(count));
}

bool isWritten(int file, const std::string& text) {
    return write(file, text.data(), text.size()) == static_cast<ssize_t>(text.size()) && fsync(file) == 0;
}

} // namespace

std::string OwnPasswords::pathFor(std::string_view user) const {
    // A dot in front would hide the file, and "." and ".." are no names.
    std::string name = percentEncoded(user, false);
    if (name.starts_with('.')) name = "%2E" + name.substr(1);
    return _directory + "/" + name + ".password";
}

std::string OwnPasswords::inForce(std::string_view user, const std::string& given) const {
    const std::string text = contents(pathFor(user));
    const size_t first = text.find('\n');
    const size_t second = first == std::string::npos ? first : text.find('\n', first + 1);
    if (second == std::string::npos || second == first + 1) return given;
    const std::string digest = digestOf(given);
    if (digest.empty() || text.substr(0, first) != digest) return given;
    return text.substr(first + 1, second - first - 1);
}

OwnPasswords::Written OwnPasswords::choose(std::string_view user, const std::string& given, const std::string& former,
                                           const std::string& chosen) const {
    const std::string target = pathFor(user), digest = digestOf(given);
    const File turn(open((_directory + "/.lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600));
    if (turn.fd < 0 || digest.empty()) return Written::failed;
    while (flock(turn.fd, LOCK_EX) != 0)
        if (errno != EINTR) return Written::failed;
    if (inForce(user, given) != former) return Written::otherMeanwhile;
    std::string fresh = target + ".XXXXXX";
    const File file(mkostemp(fresh.data(), O_CLOEXEC)); // mode 0600
    if (file.fd < 0) return Written::failed;
    const File directory(open(_directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (isWritten(file.fd, digest + "\n" + chosen + "\n") && rename(fresh.c_str(), target.c_str()) == 0 &&
        directory.fd >= 0 && fsync(directory.fd) == 0)
        return Written::done;
    const int why = errno;
    unlink(fresh.c_str());
    errno = why;
    return Written::failed;
}

} // namespace rolvane::davacl
