#include "support/TempHome.h"

#include <cstdlib>
#include <filesystem>
#include <stdexcept>

#include <unistd.h>

namespace rolvane::test {

namespace {

// Leaves room for a file name below the 108 bytes of a socket's address.
constexpr size_t kLongestBase = 60;

std::optional<std::string> variable(const std::string& name) {
    const char* value = std::getenv(name.c_str());
    return value ? std::optional<std::string>(value) : std::nullopt;
}

void put(const std::string& name, const std::optional<std::string>& value) {
    if (value)
        ::setenv(name.c_str(), value->c_str(), 1);
    else
        ::unsetenv(name.c_str());
}

} // namespace

TempDirectory::TempDirectory() {
    std::string base = variable("TMPDIR").value_or("/tmp");
    if (base.empty() || base.size() > kLongestBase) base = "/tmp";
    _path = base + "/rolvane-XXXXXX";
    if (!::mkdtemp(_path.data())) throw std::runtime_error("no temporary directory below " + base);
}

TempDirectory::~TempDirectory() {
    std::error_code ignored;
    std::filesystem::permissions(_path, std::filesystem::perms::owner_all, ignored);
    std::filesystem::remove_all(_path, ignored);
}

TempHome::TempHome() {
    setVariable("HOME", path());
    for (auto [name, below] : {std::pair{"XDG_DATA_HOME", "data"},
                               {"XDG_STATE_HOME", "state"},
                               {"XDG_CACHE_HOME", "cache"},
                               {"XDG_CONFIG_HOME", "config"},
                               {"XDG_RUNTIME_DIR", "runtime"}}) {
        setVariable(name, path() + "/" + below);
        std::filesystem::create_directory(path() + "/" + below);
        std::filesystem::permissions(path() + "/" + below, std::filesystem::perms::owner_all);
    }
    // English, whatever the developer speaks.
    for (const char* name : {"LC_ALL", "LC_MESSAGES", "LC_TIME", "LC_NUMERIC", "LANGUAGE"})
        setVariable(name, std::nullopt);
    setVariable("LANG", "C.UTF-8");
    setVariable("DBUS_SESSION_BUS_ADDRESS", std::nullopt);
    setVariable("ROLVANE_LOG", "stderr");
    setVariable("ROLVANE_NEWS", "never"); // no pass comes unasked but in tests of that
}

TempHome::~TempHome() {
    for (const auto& [name, value] : _former) put(name, value);
}

void TempHome::setVariable(const std::string& name, std::optional<std::string> value) {
    _former.try_emplace(name, variable(name));
    put(name, value);
}

std::vector<std::string> TempHome::environment() const {
    std::vector<std::string> all;
    for (char** entry = ::environ; *entry; ++entry) all.emplace_back(*entry);
    return all;
}

} // namespace rolvane::test
