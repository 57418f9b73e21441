#pragma once

#include <string>
#include <sys/types.h>

namespace rolvane {

// The XDG base directories with "rolvane" appended, made (0700) on first use. Read from the environment at every call.
std::string dataDirectory();    // $XDG_DATA_HOME/rolvane, else ~/.local/share/rolvane
std::string stateDirectory();   // $XDG_STATE_HOME/rolvane
std::string cacheDirectory();   // $XDG_CACHE_HOME/rolvane
std::string configDirectory();  // $XDG_CONFIG_HOME/rolvane
std::string runtimeDirectory(); // $XDG_RUNTIME_DIR/rolvane, else stateDirectory()/run
std::string homeDirectory();    // $HOME, else the password database's
std::string loginUserName();    // of the process's user

// Makes the directory and all missing parents with the mode, whatever the umask. CXException on failure.
void CXPathUtils_MakeCompletePath(const std::string& path, mode_t mode);
// Writes a file whole: temporary beside it, fsync, rename, fsync of the directory. CXException on failure.
void writeFileDurably(const std::string& path, const std::string& contents, mode_t mode = 0600);
// The same without waiting for the disk: who reads it sees a whole file, but a crash of the machine may take it back.
void writeFileWhole(const std::string& path, const std::string& contents, mode_t mode = 0600);
std::string readFile(const std::string& path, size_t maxBytes = 64u << 20); // CXException names path and reason

// A random UUID (version 4) in upper case with hyphens.
std::string makeUUID();

} // namespace rolvane
