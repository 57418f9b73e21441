#include "StoreTestWorld.h"

#include <cstdlib>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <sys/wait.h>
#include <unistd.h>

namespace rolvane {

namespace {

std::string contentsOf(const std::string& path) {
    std::ifstream file(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(file), {});
}

void redirect(const std::string& path, const char* mode, int fd) {
    std::FILE* file = std::fopen(path.c_str(), mode);
    if (!file || dup2(fileno(file), fd) < 0) _exit(126);
}

} // namespace

StoreDirectory::StoreDirectory() {
    std::string pattern = (std::filesystem::temp_directory_path() / "rolvane-store-XXXXXX").string();
    if (!mkdtemp(pattern.data())) throw std::runtime_error("no temporary directory");
    _path = pattern;
}

StoreDirectory::~StoreDirectory() {
    std::error_code ignored;
    std::filesystem::remove_all(_path, ignored);
}

CommandResult runCommand(const std::vector<std::string>& command, const std::string& input) {
    const StoreDirectory files;
    std::ofstream(files.path("in"), std::ios::binary) << input;
    std::vector<char*> arguments;
    for (const auto& argument : command) arguments.push_back(const_cast<char*>(argument.c_str()));
    arguments.push_back(nullptr);
    const pid_t pid = fork();
    if (pid == 0) {
        redirect(files.path("in"), "r", 0);
        redirect(files.path("out"), "w", 1);
        redirect(files.path("err"), "w", 2);
        execvp(arguments[0], arguments.data());
        _exit(127);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    return {WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status), contentsOf(files.path("out")),
            contentsOf(files.path("err"))};
}

CurlClient::CurlClient(const PrivateStore& store, std::string user, std::string password, std::string scheme)
    : _base(store.baseURL()), _caFile(store.caFile()), _credentials(user.empty() ? "" : user + ":" + password),
      _scheme(std::move(scheme)) {}

HTTPAnswer CurlClient::request(const std::string& method, const std::string& path,
                               const std::vector<std::string>& headers, const std::optional<std::string>& body) const {
    const StoreDirectory files;
    std::vector<std::string> command = {
        "curl",       "-q",          "-sS", "--noproxy", "*",  "--path-as-is",        "--cacert", _caFile,
        "--max-time", "20",          "-X",  method,      "-D", files.path("headers"), "-o",       files.path("body"),
        "-w",         "%{http_code}"};
    command.insert(command.end(), extraArguments.begin(), extraArguments.end());
    if (!_credentials.empty()) command.insert(command.end(), {_scheme, "-u", _credentials});
    for (const auto& header : headers) command.insert(command.end(), {"-H", header});
    if (body) command.insert(command.end(), {"--data-binary", "@-"});
    if (method == "HEAD") command.push_back("-I");
    command.push_back(_base + path);
    const CommandResult result = runCommand(command, body.value_or(""));
    if (result.status != 0) return {0, "", result.errors};
    return {std::atoi(result.output.c_str()), contentsOf(files.path("headers")), contentsOf(files.path("body"))};
}

PrivateStoreOptions optionsIn(const StoreDirectory& directory, const std::string& name) {
    PrivateStoreOptions options;
    options.stateDirectory = directory.path(name);
    options.ownsProcess = true;
    return options;
}

} // namespace rolvane
