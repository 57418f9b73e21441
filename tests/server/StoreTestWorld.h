#pragma once

#include "server/PrivateStore.h"

#include <filesystem>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

struct CommandResult {
    int status = -1; // exit status, 128 + number after a signal
    std::string output;
    std::string errors;
};

// Runs a program with the text on its standard input and waits for it.
CommandResult runCommand(const std::vector<std::string>& command, const std::string& input = "");

// What curl, an independent client, gets from a store. It trusts the store's own authority and nothing else.
struct HTTPAnswer {
    int status = 0; // 0 when there was no answer; then body is curl's complaint
    std::string headers;
    std::string body;
};

class CurlClient {
public:
    CurlClient(const PrivateStore& store, std::string user, std::string password, std::string scheme = "--basic");
    // The path is below the base, "/alice/x" for instance, sent as it stands.
    HTTPAnswer request(const std::string& method, const std::string& path, const std::vector<std::string>& headers = {},
                       const std::optional<std::string>& body = {}) const;
    std::string base() const { return _base; }
    // HTTP/1.1 unless a test is about HTTP/2: there curl may lose a refusal that comes before the body has been sent.
    std::vector<std::string> extraArguments = {"--http1.1"};

private:
    std::string _base, _caFile, _credentials, _scheme;
};

// A directory of its own that goes away with everything in it.
class StoreDirectory {
public:
    StoreDirectory();
    ~StoreDirectory();
    StoreDirectory(const StoreDirectory&) = delete;
    std::string path(const std::string& name = "") const { return _path + (name.empty() ? "" : "/" + name); }

private:
    std::string _path;
};

// Options for a store below the directory that ends with its object.
PrivateStoreOptions optionsIn(const StoreDirectory& directory, const std::string& name = "store");

} // namespace rolvane
