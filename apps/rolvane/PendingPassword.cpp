#include "PendingPassword.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"

#include <unistd.h>

namespace rolvane::cli {

namespace {

// First line the password, second line whose it is.
std::string path() {
    return configDirectory() + "/password.next";
}

std::string nameOf(const CXDAVAccount& account) {
    return account.user.str() + " " + account.endpoint;
}

} // namespace

PendingPassword::PendingPassword(const CXDAVAccount& account) : _account(nameOf(account)) {}

PendingPassword::~PendingPassword() {
    if (_stays) return;
    try {
        remove();
    } catch (const CXException&) {
        return; // there is no such directory, so there is no file
    }
}

std::optional<std::string> PendingPassword::leftFor(const CXDAVAccount& account) {
    if (access(path().c_str(), F_OK) != 0) return std::nullopt;
    const std::string text = readFile(path());
    const size_t end = text.find('\n');
    if (end == std::string::npos || text.substr(end + 1) != nameOf(account) + "\n") return std::nullopt;
    return text.substr(0, end);
}

void PendingPassword::write(const std::string& password) {
    writeFileDurably(path(), password + "\n" + _account + "\n", 0600);
}

PasswordSource PendingPassword::source() const {
    return {PasswordSource::Kind::file, path()};
}

void PendingPassword::remove() {
    unlink(path().c_str());
}

} // namespace rolvane::cli
