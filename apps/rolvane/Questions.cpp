#include "Questions.h"

#include "SafeText.h"
#include "Terminal.h"
#include "Texts.h"

#include <algorithm>
#include <charconv>
#include <fmt/format.h>
#include <unistd.h>

namespace rolvane::cli {

namespace {

std::string trimmed(const std::string& text) {
    const size_t first = text.find_first_not_of(" \t\r");
    return first == std::string::npos ? std::string() : text.substr(first, text.find_last_not_of(" \t\r") + 1 - first);
}

} // namespace

Questions::Questions(Context& context, bool mayAsk)
    : _context(context), _mayAsk(mayAsk && ::isatty(STDIN_FILENO) == 1 && context.talkIsTerminal()) {}

std::string Questions::answer(const std::string& prompt) {
    const auto line = readLine(shownLine(prompt));
    if (!line) throw CommandError(kFailed, translated("The answers ended here. Nothing was saved."));
    return trimmed(*line);
}

std::string Questions::text(const std::string& question, const std::string& fallback) {
    if (!_mayAsk) return fallback;
    const std::string given = answer(fallback.empty() ? question + ": " : fmt::format("{} [{}]: ", question, fallback));
    return given.empty() ? fallback : given;
}

bool Questions::yes(const std::string& question, bool fallback) {
    while (_mayAsk) {
        std::string given = answer(fmt::format("{} [{}] ", question, fallback ? translated("Y/n") : translated("y/N")));
        std::transform(given.begin(), given.end(), given.begin(), [](unsigned char c) { return std::tolower(c); });
        if (given.empty()) return fallback;
        for (const std::string word : {"yes", translated("yes")})
            if (word.starts_with(given)) return true;
        for (const std::string word : {"no", translated("no")})
            if (word.starts_with(given)) return false;
        _context.warn(translated("Answer y or n."));
    }
    return fallback;
}

size_t Questions::choice(const std::string& question, const std::vector<std::string>& offered, size_t fallback) {
    if (!_mayAsk) return fallback;
    _context.warn(question);
    for (size_t i = 0; i < offered.size(); ++i) _context.warn(fmt::format("  {}  {}", i + 1, offered[i]));
    for (;;) {
        const std::string given = answer(tr("Number [{}]: ", fallback + 1));
        if (given.empty()) return fallback;
        size_t number = 0;
        const auto [end, error] = std::from_chars(given.data(), given.data() + given.size(), number);
        if (error == std::errc() && end == given.data() + given.size() && number >= 1 && number <= offered.size())
            return number - 1;
        _context.warn(tr("Answer with a number from 1 to {}.", offered.size()));
    }
}

std::string Questions::secret(const std::string& question) {
    const std::string given = readSecret(shownLine(question + ": "));
    if (given.empty()) throw CommandError(kUsage, translated("The password is empty. Nothing was saved."));
    return given;
}

} // namespace rolvane::cli
