#include "server/StoreBackup.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "server/StoreProcess.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <filesystem>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

namespace rolvane {

namespace {

namespace fs = std::filesystem;

constexpr const char* kPrefix = "rolvane-store-";
constexpr const char* kSuffix = ".tar.gz";
// The lists go first: a right that is withdrawn meanwhile is then older than the files, and no file is newer than it.
constexpr std::array kOfState{
    "store.plist", "lists", "conf/passwords", "conf/digests", "conf/groups", "conf/quotas", "own", "tls", "md"};
constexpr int kChangedMeanwhile = 1; // tar's exit code when a file went or grew while it was read

[[noreturn]] void fail(const std::string& reason) {
    throw CXException(kCXPrivateStoreException, reason);
}

// Runs tar, which every Debian has, and gives its exit code. Its own words go to standard error.
int tar(std::vector<std::string> arguments, int output = -1) {
    arguments.insert(arguments.begin(), "tar");
    std::vector<char*> words;
    for (auto& argument : arguments) words.push_back(argument.data());
    words.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    if (output >= 0) posix_spawn_file_actions_adddup2(&actions, output, STDOUT_FILENO);
    pid_t pid = 0;
    const int error = posix_spawnp(&pid, "tar", &actions, nullptr, words.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (error != 0) fail(std::string("The program tar cannot be run: ") + std::strerror(error) + ".");
    int status = 0;
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128;
}

std::string moment(const char* form) {
    const std::time_t now = std::time(nullptr);
    std::tm parts{};
    gmtime_r(&now, &parts);
    std::array<char, 32> text{};
    return {text.data(), std::strftime(text.data(), text.size(), form, &parts)};
}

std::vector<std::string> membersOf(const PrivateStoreOptions& options) {
    std::vector<std::string> all{"--directory=" + options.stateDirectory};
    for (const char* member : kOfState)
        if (fs::exists(options.stateDirectory + "/" + member)) all.emplace_back(member);
    all.push_back("--directory=" + options.documentRoot);
    all.emplace_back("dav");
    return all;
}

void syncFile(const std::string& path) {
    const FileHandle file(open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!file || fsync(file.get()) != 0)
        fail("The backup " + path + " does not reach the disk: " + std::strerror(errno));
}

bool isBackup(const fs::path& path) {
    const std::string name = path.filename();
    return name.starts_with(kPrefix) && name.ends_with(kSuffix);
}

} // namespace

StoreBackup::StoreBackup(const PrivateStoreOptions& options)
    : _options([&] {
          const PrivateStore store(options);
          PrivateStoreOptions all = options;
          all.stateDirectory = store.stateDirectory();
          all.documentRoot = store.documentRoot();
          return all;
      }()) {
    if (!fs::exists(_options.stateDirectory + "/conf"))
        fail("There is no store in " + _options.stateDirectory + ". Name its directory, or start it once.");
}

void StoreBackup::write(const std::string& file) const {
    std::vector<std::string> arguments{"--create",         "--gzip",           "--exclude=*.lock",
                                       "--exclude=*.gate", "--exclude=*.used", "--exclude=.davfs.tmp*"};
    const auto writeTo = [&](const std::string& path, int output) {
        arguments.insert(arguments.begin() + 2, "--file=" + path);
        for (const std::string& member : membersOf(_options)) arguments.push_back(member);
        const int code = tar(arguments, output);
        if (code != 0 && code != kChangedMeanwhile) fail("The store was not written to " + file + ": tar failed.");
    };
    if (file == "-") return writeTo("-", -1);
    std::string temporary = file + ".XXXXXX";
    const FileHandle made(mkostemp(temporary.data(), O_CLOEXEC)); // mode 0600
    if (!made) fail("The file " + file + " cannot be written: " + std::strerror(errno) + ".");
    try {
        writeTo("-", made.get());
        const FileHandle nowhere(open("/dev/null", O_WRONLY | O_CLOEXEC));
        if (tar({"--list", "--gzip", "--file=" + temporary}, nowhere.get()) != 0)
            fail("The backup " + file + " could not be read back. The disk may be full or failing.");
        syncFile(temporary);
        if (rename(temporary.c_str(), file.c_str()) != 0)
            fail("The file " + file + " cannot be written: " + std::strerror(errno) + ".");
    } catch (const CXException&) {
        unlink(temporary.c_str());
        throw;
    }
}

std::string StoreBackup::writeInto(const std::string& directory, int keep) const {
    std::string path = directory + "/" + kPrefix + moment("%Y%m%d-%H%M%S");
    if (fs::exists(path + kSuffix)) path += "-" + makeUUID().substr(0, 4); // two in one second
    path += kSuffix;
    write(path);
    std::vector<fs::path> all;
    for (const auto& entry : fs::directory_iterator(directory))
        if (isBackup(entry.path())) all.push_back(entry.path());
    std::sort(all.begin(), all.end(), std::greater<>()); // their names are their dates
    for (size_t i = static_cast<size_t>(keep); keep > 0 && i < all.size(); ++i) fs::remove(all[i]);
    return path;
}

std::string StoreBackup::restore(const std::string& file) const {
    if (StoreIdentity::choose().change)
        fail("A store that root runs is restored by hand: unpack the archive with tar, and give the files to httpd's "
             "user. Nothing was changed.");
    if (PrivateStore(_options).status().running)
        fail("The store runs. Stop it, and restore it then. Nothing was changed.");
    const std::string& state = _options.stateDirectory;
    std::string fresh = state + "/restored-XXXXXX";
    if (!mkdtemp(fresh.data())) fail("There is no room in " + state + ": " + std::strerror(errno) + ".");
    if (tar({"--extract", "--gzip", "--file=" + file, "--directory=" + fresh, "--no-same-owner"}) != 0 ||
        !fs::exists(fresh + "/conf") || !fs::exists(fresh + "/dav")) {
        fs::remove_all(fresh);
        fail("The file " + file + " holds no whole backup of a store. Nothing was changed.");
    }
    const std::string former = state + "/replaced-" + moment("%Y%m%d-%H%M%S") + "-" + makeUUID().substr(0, 4);
    const auto exchange = [&](const std::string& here, const std::string& name) {
        if (fs::exists(here)) {
            CXPathUtils_MakeCompletePath(fs::path(former + "/" + name).parent_path(), 0700);
            fs::rename(here, former + "/" + name);
        }
        if (fs::exists(fresh + "/" + name)) fs::rename(fresh + "/" + name, here);
    };
    try {
        CXPathUtils_MakeCompletePath(former, 0700);
        CXPathUtils_MakeCompletePath(state + "/conf", 0700);
        CXPathUtils_MakeCompletePath(_options.documentRoot, 0700);
        for (const char* member : kOfState) exchange(state + "/" + member, member);
        exchange(_options.documentRoot + "/dav", "dav");
    } catch (const fs::filesystem_error& error) {
        fail(std::string("The backup was restored in parts: ") + error.what() + ". What was there is in " + former +
             ", and what was not restored in " + fresh + ".");
    }
    fs::remove_all(fresh);
    return former;
}

} // namespace rolvane
