#include "Terminal.h"

#include <iostream>
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
    std::cerr << prompt << std::flush;
    ::tcsetattr(STDIN_FILENO, TCSAFLUSH, &hidden);
    std::getline(std::cin, secret);
    ::tcsetattr(STDIN_FILENO, TCSAFLUSH, &shown);
    std::cerr << "\n";
    return secret;
}

} // namespace rolvane::cli
