#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

namespace rolvane::test {

// A new directory below $TMPDIR or /tmp, removed with everything in it at the end. Short: sockets fit below it.
class TempDirectory {
public:
    TempDirectory();
    ~TempDirectory();
    TempDirectory(const TempDirectory&) = delete;
    TempDirectory& operator=(const TempDirectory&) = delete;
    const std::string& path() const { return _path; }
    std::string operator/(const std::string& name) const { return _path + "/" + name; }

private:
    std::string _path;
};

// A home of its own for the process: HOME and the XDG directories lie in a new directory, and no session bus is known.
// Everything is put back at the end. Made and destroyed while no other thread reads the environment.
class TempHome {
public:
    TempHome();
    ~TempHome();
    TempHome(const TempHome&) = delete;
    TempHome& operator=(const TempHome&) = delete;

    const std::string& path() const { return _directory.path(); }
    std::string operator/(const std::string& name) const { return _directory / name; }
    // Sets a variable for the life of this object; none unsets it.
    void setVariable(const std::string& name, std::optional<std::string> value);
    // The environment of this process as it is now, "NAME=value" each, for child processes.
    std::vector<std::string> environment() const;

private:
    TempDirectory _directory;
    std::map<std::string, std::optional<std::string>> _former;
};

} // namespace rolvane::test
