#include "store/files/CXFileManager.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/PropertyList.h"
#include "store/dav/CXDAVManager.h"
#include "store/files/LocalFiles.h"

#include <cerrno>
#include <strings.h>

namespace rolvane {

namespace {

bool isRemote(const Url& url) {
    const std::string scheme = url.scheme();
    return strcasecmp(scheme.c_str(), "http") == 0 || strcasecmp(scheme.c_str(), "https") == 0;
}

// Only a plain absence or refusal is told as one: readers take 404 and 403 for the end of a subscription.
int codeForErrno(int error) {
    if (error == 0) return 200;
    if (error == ENOENT || error == ENOTDIR) return 404;
    if (error == EACCES || error == EPERM) return 403;
    return 500;
}

// The local path of a file URL, "" when it names none.
std::string localPath(const Url& url) {
    try {
        return url.filePath();
    } catch (const CXException&) {
        return {};
    }
}

// A group's folder keeps its state file inside, as on a store.
std::string fileAt(const LocalFiles& files, const Url& url) {
    const std::string path = localPath(url);
    return files.isDirectory(path) ? path + "/" + CXDAVManager::kStateName : path;
}

Mutex handlerMutex;
std::function<void()> passwordHandler GUARDED_BY(handlerMutex);

} // namespace

CXFileManager::CXFileManager() : _local(std::make_shared<LocalFiles>()) {}
CXFileManager::CXFileManager(std::string root) : _local(std::make_shared<LocalFiles>(std::move(root))) {}
CXFileManager::~CXFileManager() = default;

std::optional<Dictionary> CXFileManager::dictionaryAtURL(const Url& url, int* errorCode, bool securely) {
    if (isRemote(url)) return CXDAVManager::defaultManager().dictionaryAtURL(url, errorCode, securely);
    const std::string path = fileAt(*_local, url);
    std::string contents;
    const int code = codeForErrno(_local->read(path, contents));
    if (errorCode) *errorCode = code;
    if (code != 200) return std::nullopt;
    try {
        const Value value = PropertyList::fromXML(contents);
        if (const Dictionary* d = value.dictionaryIf()) return *d;
    } catch (const CXException& e) {
        CXDLog("No dictionary at %@: %@", path, e.reason());
    }
    return std::nullopt;
}

bool CXFileManager::write(const std::string& text, const Url& url, bool securely) {
    if (isRemote(url)) return CXDAVManager::defaultManager().write(text, url, securely);
    return _local->write(fileAt(*_local, url), text) == 0;
}

bool CXFileManager::removeDirectoryAndContentsAtURL(const Url& url) {
    if (isRemote(url)) return CXDAVManager::defaultManager().removeDirectoryAndContentsAtURL(url);
    const int error = _local->removeTree(localPath(url));
    return error == 0 || error == ENOENT;
}

void CXFileManager::expectReads(const std::vector<Url>& /*urls*/, bool /*securely*/) {}
void CXFileManager::expectSomeReads(const std::vector<Url>& /*urls*/, bool /*securely*/) {}

std::optional<FileListing> CXFileManager::infoForFilesInContainerByParts(const Url& url, const ListingPart& /*part*/) {
    return infoForFilesInContainer(url);
}

std::optional<FileListing> CXFileManager::infoForFilesInContainer(const Url& url) {
    if (isRemote(url)) return CXDAVManager::defaultManager().infoForFilesInContainer(url);
    FileListing out;
    if (_local->list(localPath(url), out) != 0) return std::nullopt;
    std::erase_if(out, [](const auto& entry) { return entry.second.displayName == CXDAVManager::kStateName; });
    return out;
}

void CXFileManager::setFailedPasswordHandler(std::function<void()> handler) {
    Lock guard(handlerMutex);
    passwordHandler = std::move(handler);
}

void CXFileManager::failedToGetPassword() {
    std::function<void()> handler;
    {
        Lock guard(handlerMutex);
        handler = passwordHandler;
    }
    if (handler) handler();
}

} // namespace rolvane
