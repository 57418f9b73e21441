#include "BooksAutostart.h"

#include "foundation/Paths.h"

#include <filesystem>
#include <string>

namespace rolvane::cli {

namespace {

// A word of the Exec line, in quotation marks: what means something there is escaped, percent signs are doubled.
std::string quoted(const std::string& word) {
    std::string text = "\"";
    for (const char c : word) {
        // Once for the quotation marks, and a backslash once more for the value of a key.
        if (c == '"' || c == '`' || c == '$') text += "\\\\";
        if (c == '\\') text += "\\\\\\";
        if (c == '%') text += '%';
        text += c;
    }
    return text + "\"";
}

} // namespace

void setBooksAutostart(bool wanted) {
    const std::filesystem::path directory = std::filesystem::path(configDirectory()).parent_path() / "autostart";
    const std::filesystem::path file = directory / "rolvane-books.desktop";
    std::error_code ignored;
    if (!wanted) {
        std::filesystem::remove(file, ignored);
        return;
    }
    CXPathUtils_MakeCompletePath(directory, 0700);
    writeFileDurably(file, "[Desktop Entry]\nType=Application\nName=Rolvane address books\n"
                           "Comment=Serves your contacts to programs and devices (CardDAV)\nExec=" +
                               quoted(std::filesystem::read_symlink("/proc/self/exe")) +
                               " --quiet books on\nNoDisplay=true\n");
}

} // namespace rolvane::cli
