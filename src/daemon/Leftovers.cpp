#include "daemon/Leftovers.h"

#include "foundation/CXException.h"
#include "foundation/ControlSocket.h"
#include "foundation/Log.h"
#include "foundation/Paths.h"
#include "foundation/TemporaryFiles.h"
#include "foundation/TestSwitch.h"

#include <cerrno>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

namespace rolvane {

namespace {

// A datagram socket whose process has gone refuses every connection. One that was made within the last minute may be
// about to be bound.
bool isLeftSocket(const std::string& path) {
    constexpr time_t kOld = 60;
    struct stat info {};
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path || ::lstat(path.c_str(), &info) != 0 || !S_ISSOCK(info.st_mode) ||
        info.st_mtime >= ::time(nullptr) - kOld)
        return false;
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    const OwnedDescriptor probe(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    return probe && ::connect(probe.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 &&
           errno == ECONNREFUSED;
}

void removeLeftSockets(const std::string& directory) {
    std::error_code error;
    for (std::filesystem::directory_iterator each(directory, error), end; !error && each != end; each.increment(error))
        if (each->path().filename().string().starts_with("notify-") && isLeftSocket(each->path().string()))
            ::unlink(each->path().c_str());
}

} // namespace

void removeLeftovers() {
    if (isLeftOut("leftovers")) return;
    try {
        const std::string state = stateDirectory(), data = dataDirectory();
        for (const std::string& directory : {state, state + "/locks", state + "/locks-runs", data, data + "/withdrawn",
                                             configDirectory(), cacheDirectory()})
            removeLeftTemporaryFiles(directory);
        removeLeftSockets(runtimeDirectory());
    } catch (const CXException& e) {
        CXDLog("What killed processes have left stays: %@", e.reason());
    }
}

} // namespace rolvane
