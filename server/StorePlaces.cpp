#include "server/StorePlaces.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "server/PrivateStore.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <filesystem>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

namespace rolvane {

namespace {

constexpr int kDirectory = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
constexpr const char* kRootsOwn[] = {"conf", "tls"};
constexpr const char* kServersOwn[] = {"run", "logs", "locks", "lists", "own"};

[[noreturn]] void fail(const std::string& reason) {
    throw CXException(kCXPrivateStoreException, reason);
}

[[noreturn]] void cannot(const std::string& what, const std::string& path, int error) {
    if (error == ELOOP || error == ENOTDIR)
        fail("The store's place " + path +
             " is a link or a file where a directory must be. Somebody may have put it there: look where it leads, "
             "remove it, and start the store again.");
    fail("The store's place " + path + " cannot be " + what + ": " + std::strerror(error) + ".");
}

struct stat statusOf(const FileHandle& file, const std::string& path) {
    struct stat info {};
    if (fstat(file.get(), &info) != 0) cannot("looked at", path, errno);
    return info;
}

// A step on root's way: whoever else may rename things here could lead root elsewhere.
void refuseForeignStep(const FileHandle& directory, const std::string& path) {
    const struct stat info = statusOf(directory, path);
    const bool writable = (info.st_mode & (S_IWGRP | S_IWOTH)) != 0 && (info.st_mode & S_ISVTX) == 0;
    if (info.st_uid != 0 || writable)
        fail("Root's store must not lie below " + path +
             ", which somebody else may change. Choose a directory that only root can change (--directory, --root), or "
             "start the store as the user whom that directory belongs to.");
}

// Another user who may rename things in the directory of the documents could put a link in the place of the trees
// later.
void refuseForeignDocuments(const FileHandle& documents, const std::string& path, const StoreIdentity& server) {
    const struct stat info = statusOf(documents, path);
    if (info.st_uid != 0 && info.st_uid != server.uid)
        fail("The directory of the documents, " + path +
             ", belongs to another user. Start the store as that user, or choose another directory with --root.");
    const bool byGroup = (info.st_mode & S_IWGRP) != 0 && info.st_gid != 0 && info.st_gid != server.gid;
    if ((byGroup || (info.st_mode & S_IWOTH) != 0) && (info.st_mode & S_ISVTX) == 0)
        fail("The directory of the documents, " + path +
             ", is one that somebody else may change. Take the right to write there away (chmod go-w), or choose "
             "another directory with --root.");
}

FileHandle openedIn(const FileHandle& parent, const std::string& name, const std::string& path) {
    FileHandle directory(openat(parent.get(), name.c_str(), kDirectory));
    if (!directory) cannot("opened", path, errno);
    return directory;
}

FileHandle madeIn(const FileHandle& parent, const std::string& name, const std::string& path) {
    if (mkdirat(parent.get(), name.c_str(), 0700) != 0 && errno != EEXIST) cannot("made", path, errno);
    return openedIn(parent, name, path);
}

void giveTo(const FileHandle& place, uid_t uid, gid_t gid, mode_t mode, const std::string& path) {
    const struct stat info = statusOf(place, path);
    // The mode comes second, since a change of the owner takes the set-group bit away.
    if ((info.st_uid != uid || info.st_gid != gid) && fchown(place.get(), uid, gid) != 0)
        cannot("given to its user", path, errno);
    if (fchmod(place.get(), mode) != 0) cannot("given its mode", path, errno);
}

// The directory of an absolute path without links. Every step to it belongs to root alone; the last one may belong to
// somebody else.
FileHandle madeAlong(const std::string& path) {
    FileHandle here(open("/", kDirectory));
    std::string walked;
    for (const auto& step : std::filesystem::path(path).relative_path()) {
        if (step.empty()) continue;
        refuseForeignStep(here, walked.empty() ? "/" : walked);
        walked += "/" + step.string();
        here = madeIn(here, step.string(), walked);
    }
    return here;
}

std::vector<std::string> namesIn(const FileHandle& directory, const std::string& path) {
    const int copy = openat(directory.get(), ".", kDirectory);
    DIR* stream = copy < 0 ? nullptr : fdopendir(copy);
    if (!stream) {
        if (copy >= 0) close(copy);
        cannot("listed", path, errno);
    }
    std::vector<std::string> names;
    while (const dirent* entry = readdir(stream))
        if (const std::string name = entry->d_name; name != "." && name != "..") names.push_back(name);
    closedir(stream);
    return names;
}

// The files of a directory that httpd's user owned before. That user may have made links there.
void takeBackFiles(const FileHandle& directory, const std::string& path, gid_t group) {
    for (const std::string& name : namesIn(directory, path)) {
        const std::string there = path + "/" + name;
        const FileHandle file(openat(directory.get(), name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
        if (!file) cannot("opened", there, errno);
        const struct stat info = statusOf(file, there);
        if (!S_ISREG(info.st_mode) || info.st_nlink != 1)
            fail("The store's file " + there +
                 " has a second name or is no file. Somebody may have put it there: remove it, and start the store "
                 "again.");
        giveTo(file, 0, group, info.st_mode & S_IROTH ? 0644 : 0640, there);
    }
}

// A directory that serves something else keeps its owner and its mode.
void refuseOtherDirectory(const FileHandle& directory, const std::string& path) {
    const std::vector<std::string> names = namesIn(directory, path);
    const auto isOfAStore = [](const std::string& name) { return name == "conf" || name == "launcher.lock"; };
    if (!names.empty() && std::none_of(names.begin(), names.end(), isOfAStore))
        fail("The directory " + path + " holds other things and no store. Choose an empty or a new one.");
}

} // namespace

StorePlaces::StorePlaces(std::string state, std::string documentRoot, const StoreIdentity& identity)
    : _state(std::move(state)), _documents(std::move(documentRoot)), _identity(identity) {}

void StorePlaces::make() const {
    if (_identity.change) return makeAsRoot();
    for (const char* name : kRootsOwn) CXPathUtils_MakeCompletePath(_state + "/" + name, 0700);
    for (const char* name : kServersOwn) CXPathUtils_MakeCompletePath(_state + "/" + name, 0700);
    CXPathUtils_MakeCompletePath(_documents + "/dav", 0700);
}

void StorePlaces::makeAsRoot() const {
    const FileHandle state = madeAlong(_state);
    const struct stat info = statusOf(state, _state);
    if (info.st_uid != 0 && info.st_uid != _identity.uid)
        fail("The store in " + _state +
             " belongs to another user. Start it as that user, or give root one of its own "
             "with --directory.");
    refuseOtherDirectory(state, _state);
    giveTo(state, 0, 0, 0711, _state);
    for (const char* name : kRootsOwn) {
        const std::string path = _state + "/" + name;
        const FileHandle directory = madeIn(state, name, path);
        const bool wasServers = statusOf(directory, path).st_uid != 0;
        giveTo(directory, 0, _identity.gid, 02750, path);
        if (wasServers) takeBackFiles(directory, path, _identity.gid);
    }
    for (const char* name : kServersOwn)
        giveTo(madeIn(state, name, _state + "/" + name), _identity.uid, _identity.gid, 0700, _state + "/" + name);
    const FileHandle documents = madeAlong(_documents);
    if (_documents != _state + "/root") refuseForeignDocuments(documents, _documents, _identity);
    if (_documents == _state + "/root") giveTo(documents, 0, 0, 0711, _documents);
    giveTo(madeIn(documents, "dav", _documents + "/dav"), _identity.uid, _identity.gid, 0700, _documents + "/dav");
}

void StorePlaces::makeForUser(const std::string& user) const {
    const std::string path = _documents + "/dav/" + user;
    if (!_identity.change) return CXPathUtils_MakeCompletePath(path, 0700);
    const FileHandle dav = openedIn(madeAlong(_documents), "dav", _documents + "/dav");
    const int error = _identity.run([&] { return mkdirat(dav.get(), user.c_str(), 0700) == 0 ? 0 : errno; });
    if (error != 0 && error != EEXIST) cannot("made", path, error);
}

std::string textOfServersFile(const std::string& path, size_t most) {
    const FileHandle file(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    struct stat info {};
    if (!file || fstat(file.get(), &info) != 0 || !S_ISREG(info.st_mode) || info.st_nlink != 1) return {};
    const auto size = static_cast<size_t>(info.st_size);
    std::string text(std::min(size, most), '\0');
    const auto from = static_cast<off_t>(size - text.size());
    size_t read = 0;
    while (read < text.size()) {
        const ssize_t count =
            pread(file.get(), text.data() + read, text.size() - read, from + static_cast<off_t>(read));
        if (count < 0 && errno == EINTR) continue;
        if (count <= 0) break;
        read += static_cast<size_t>(count);
    }
    text.resize(read);
    return text;
}

} // namespace rolvane
