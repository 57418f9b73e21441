#include "store/CXFileManager.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Paths.h"
#include "foundation/PropertyList.h"
#include "store/CXDAVManager.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <mutex>
#include <strings.h>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane {

namespace {

bool isRemote(const Url& url) {
    const std::string scheme = url.scheme();
    return strcasecmp(scheme.c_str(), "http") == 0 || strcasecmp(scheme.c_str(), "https") == 0;
}

int codeForErrno(int error) {
    if (error == ENOENT || error == ENOTDIR) return 404;
    if (error == EACCES || error == EPERM) return 403;
    return 500;
}

// A group's folder keeps its state file inside, as on a store.
std::string fileAt(const Url& url) {
    const std::string path = url.path();
    struct stat st;
    if (stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) return path + "/" + CXDAVManager::kStateName;
    return path;
}

std::mutex handlerMutex;
std::function<void()> passwordHandler;

} // namespace

std::optional<Dictionary> CXFileManager::dictionaryAtURL(const Url& url, int* errorCode, bool securely) {
    if (isRemote(url)) return CXDAVManager::defaultManager().dictionaryAtURL(url, errorCode, securely);
    int unused = 0;
    int& code = errorCode ? *errorCode : unused;
    const std::string path = fileAt(url);
    const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
    if (fd < 0) {
        code = codeForErrno(errno);
        return std::nullopt;
    }
    close(fd);
    code = 200;
    try {
        const Value value = PropertyList::fromXML(readFile(path));
        if (const Dictionary* d = value.dictionaryIf()) return *d;
    } catch (const CXException& e) {
        CXDLog("No dictionary at %@: %@", path, e.reason());
    }
    return std::nullopt;
}

bool CXFileManager::write(const std::string& text, const Url& url, bool securely) {
    if (isRemote(url)) return CXDAVManager::defaultManager().write(text, url, securely);
    const int fd = open(fileAt(url).c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666);
    if (fd < 0) return false;
    size_t at = 0;
    while (at < text.size()) {
        const ssize_t n = ::write(fd, text.data() + at, text.size() - at);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        at += static_cast<size_t>(n);
    }
    return close(fd) == 0 && at == text.size();
}

bool CXFileManager::removeDirectoryAndContentsAtURL(const Url& url) {
    if (isRemote(url)) return CXDAVManager::defaultManager().removeDirectoryAndContentsAtURL(url);
    std::error_code error;
    std::filesystem::remove_all(url.path(), error);
    return !error;
}

std::optional<FileListing> CXFileManager::infoForFilesInContainer(const Url& url) {
    if (isRemote(url)) return CXDAVManager::defaultManager().infoForFilesInContainer(url);
    std::error_code error;
    FileListing out;
    for (const auto& entry : std::filesystem::directory_iterator(url.path(), error)) {
        struct stat st;
        if (lstat(entry.path().c_str(), &st) != 0) continue;
        FileInfo info;
        info.displayName = entry.path().filename().string();
        if (info.displayName == CXDAVManager::kStateName) continue;
        info.isCollection = S_ISDIR(st.st_mode);
        info.size = static_cast<uint64_t>(st.st_size);
        info.modificationdate =
            Date(static_cast<double>(st.st_mtim.tv_sec) + static_cast<double>(st.st_mtim.tv_nsec) / 1e9);
        out[entry.path().string()] = std::move(info);
    }
    return error ? std::nullopt : std::optional(std::move(out));
}

void CXFileManager::setFailedPasswordHandler(std::function<void()> handler) {
    std::lock_guard guard(handlerMutex);
    passwordHandler = std::move(handler);
}

void CXFileManager::failedToGetPassword() {
    std::function<void()> handler;
    {
        std::lock_guard guard(handlerMutex);
        handler = passwordHandler;
    }
    if (handler) handler();
}

} // namespace rolvane
