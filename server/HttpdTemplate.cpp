#include "server/HttpdTemplate.h"

#include "foundation/CXException.h"
#include "server/PrivateStore.h"

#include <algorithm>
#include <filesystem>
#include <unistd.h>

namespace rolvane {

namespace {

std::string programDirectory() {
    std::error_code error;
    return std::filesystem::read_symlink("/proc/self/exe", error).parent_path().string();
}

// The first that can be read; "" when none can.
std::string firstReadable(const std::vector<std::string>& paths) {
    const auto found =
        std::find_if(paths.begin(), paths.end(), [](const auto& p) { return access(p.c_str(), R_OK) == 0; });
    return found == paths.end() ? std::string() : *found;
}

} // namespace

std::string httpdTemplatePath(const std::string& name) {
    const std::string path = firstReadable({programDirectory() + "/../share/rolvane/" + name,
                                            ROLVANE_SERVER_SOURCE_DIR "/" + name, ROLVANE_INSTALLED_SHARE "/" + name});
    if (path.empty())
        throw CXException(kCXPrivateStoreException, "The configuration template " + name + " is missing from " +
                                                        ROLVANE_INSTALLED_SHARE + ". Install rolvane again.");
    return path;
}

std::string httpdModulePath(const std::string& name, const std::string& built, const std::string& httpdModules) {
    // A module that was built or installed together with the program comes before one that the system may have from
    // another version.
    return firstReadable({programDirectory() + "/../lib/apache2/modules/" + name, built,
                          ROLVANE_INSTALLED_MODULES "/" + name, httpdModules + "/" + name});
}

std::string filledIn(const std::string& text, const std::map<std::string, std::string>& names) {
    std::string out;
    for (size_t from = 0; from < text.size();) {
        const size_t at = text.find('@', from);
        const size_t end = at == std::string::npos ? at : text.find('@', at + 1);
        if (end == std::string::npos) return out + text.substr(from);
        const auto known = names.find(text.substr(at + 1, end - at - 1));
        out += text.substr(from, at - from);
        out += known == names.end() ? text.substr(at, end - at) : known->second;
        from = known == names.end() ? end : end + 1;
    }
    return out;
}

std::string joinedLines(const std::vector<std::string>& lines) {
    std::string text;
    for (const auto& line : lines) text += line + "\n";
    return text;
}

void refuseUnsafePath(const std::string& service, const std::string& path) {
    const bool unsafe = path.find_first_of("\"\\\n\r") != std::string::npos || path.find("${") != std::string::npos;
    if (unsafe || path.empty() || path[0] != '/')
        throw CXException(kCXPrivateStoreException, service + " cannot be kept in \"" + path +
                                                        "\": the path must be absolute and hold no quotation mark, "
                                                        "backslash, line break or \"${\". Choose another directory.");
}

void refuseUnsafeWord(const std::string& service, const std::string& kind, const std::string& word) {
    const bool safe = !word.empty() && std::all_of(word.begin(), word.end(), [](char c) {
        return (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == ':' || c == ' ' || c == '_';
    });
    if (!safe) throw CXException(kCXPrivateStoreException, service + "'s " + kind + " \"" + word + "\" is none.");
}

} // namespace rolvane
