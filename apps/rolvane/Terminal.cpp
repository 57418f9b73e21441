#include "Terminal.h"

#include <iostream>
#include <sys/ioctl.h>
#include <termios.h>
#include <unistd.h>

namespace rolvane::cli {

std::string readSecret(const std::string& prompt) {
    std::string secret;
    if (::isatty(STDIN_FILENO) != 1) {
        std::getline(std::cin, secret);
        return secret;
    }
    termios shown{};
    ::tcgetattr(STDIN_FILENO, &shown);
    termios hidden = shown;
    hidden.c_lflag &= ~static_cast<tcflag_t>(ECHO);
    // In this order: what is typed behind the prompt is neither shown nor dropped.
    ::tcsetattr(STDIN_FILENO, TCSAFLUSH, &hidden);
    std::cerr << prompt << std::flush;
    std::getline(std::cin, secret);
    ::tcsetattr(STDIN_FILENO, TCSAFLUSH, &shown);
    std::cerr << "\n";
    return secret;
}

size_t terminalColumns(int descriptor) {
    winsize size{};
    if (::isatty(descriptor) != 1 || ::ioctl(descriptor, TIOCGWINSZ, &size) != 0) return 0;
    return size.ws_col;
}

std::optional<std::string> readLine(const std::string& prompt) {
    if (::isatty(STDIN_FILENO) == 1) std::cerr << prompt << std::flush;
    std::string line;
    if (!std::getline(std::cin, line)) return std::nullopt;
    return line;
}

} // namespace rolvane::cli
