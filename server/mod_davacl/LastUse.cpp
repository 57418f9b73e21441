#include "server/mod_davacl/LastUse.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane::davacl {

void LastUse::note(const std::string& directory, std::string_view user, std::chrono::steady_clock::time_point now) {
    if (user.empty() || user.front() == '.' || user.find('/') != std::string_view::npos) return;
    const std::string path = directory + "/" + std::string(user);
    {
        const std::lock_guard lock(_mutex);
        const auto [entry, isNew] = _noted.try_emplace(path, now);
        if (!isNew && now - entry->second < std::chrono::minutes(1)) return;
        entry->second = now;
    }
    const int file = open(path.c_str(), O_WRONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0600);
    if (file < 0) return;
    futimens(file, nullptr);
    close(file);
}

} // namespace rolvane::davacl
