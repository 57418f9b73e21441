#pragma once

#include <chrono>
#include <map>
#include <mutex>
#include <string>
#include <string_view>

namespace rolvane::davacl {

// Notes when each user signed in last, for whoever administers them: the modification date of the file that bears the
// user's name, in the directory that DavAclLastUse names, exact to a minute. Names that are no plain file names are
// passed over. A directory that cannot be written keeps nobody out. Any thread.
class LastUse {
public:
    void note(const std::string& directory, std::string_view user, std::chrono::steady_clock::time_point now);

private:
    std::mutex _mutex;
    std::map<std::string, std::chrono::steady_clock::time_point, std::less<>> _noted; // by path
};

} // namespace rolvane::davacl
