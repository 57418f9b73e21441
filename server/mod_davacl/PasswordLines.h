#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <sys/stat.h>

namespace rolvane::davacl {

using PasswordHashes = std::map<std::string, std::string, std::less<>>; // by user

// "user:hash" a line, with more fields behind another colon, blank lines and lines that begin with "#", as
// AuthUserFile names. The first line of a user counts.
PasswordHashes passwordHashes(std::string_view text);

// The hash that is computed for a name that stands in no line, so that a refusal tells by its time neither who has an
// account nor who has none: one of the file's, chosen by the number that the caller gives the name, as the file may
// hold hashes of different costs. Nobody's for an empty file.
std::string hashInstead(const PasswordHashes& hashes, uint64_t number);

// What a password file says at this moment. The file is read again when its number, size or one of its times is another
// one; and always while it is younger than two seconds, because file systems tell the time in steps. Any thread.
class PasswordLines {
public:
    enum class Answer { unreadable, unknown, known };
    struct Found {
        Answer answer = Answer::unreadable;
        std::string hash;                                  // of who is known
        std::shared_ptr<const PasswordHashes> others = {}; // all, where the user is not known
    };
    Found find(const std::string& path, std::string_view user);

private:
    struct File {
        struct stat state {};
        bool settled = false; // no change can have the times that were seen
        std::shared_ptr<const PasswordHashes> hashes;
    };
    std::shared_ptr<const PasswordHashes> read(const std::string& path);

    std::mutex _mutex;
    std::map<std::string, File> _files; // by path
};

} // namespace rolvane::davacl
