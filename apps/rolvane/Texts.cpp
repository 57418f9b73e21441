#include "Texts.h"

#include <array>
#include <clocale>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <langinfo.h>
#include <libintl.h>

namespace rolvane::cli {

namespace {

constexpr const char* kDomain = "rolvane";

struct Language {
    bool chosen = false;
    bool writesDates = false; // the system knows how; else year, month, day
    std::string separator;    // between thousands
};

Language& language() {
    static Language one;
    return one;
}

// Beside the installed program, or where the build has made them.
std::string catalogs() {
    std::error_code error;
    const auto program = std::filesystem::read_symlink("/proc/self/exe", error);
    const auto installed = program.parent_path().parent_path() / "share/locale";
    return std::filesystem::exists(installed / "de/LC_MESSAGES/rolvane.mo", error) ? installed.string()
                                                                                   : ROLVANE_BUILT_CATALOGS;
}

std::string wish(const char* category) {
    for (const char* variable : {"LC_ALL", category, "LANG"})
        if (const char* value = std::getenv(variable); value && *value) return value;
    return "C";
}

bool isPlain(const char* name) {
    return !name || std::string_view(name) == "C" || std::string_view(name) == "POSIX" ||
           std::string_view(name).starts_with("C.");
}

// A language that the system has not made its own files for is spoken all the same: the catalogs are ours.
void chooseTexts() {
    if (std::setlocale(LC_MESSAGES, "")) return;
    const std::string wanted = wish("LC_MESSAGES");
    if (isPlain(wanted.c_str()) || !std::setlocale(LC_MESSAGES, "C.UTF-8")) return;
    ::setenv("LANGUAGE", wanted.substr(0, wanted.find_first_of(".@")).c_str(), 0);
}

void chooseNumbers() {
    const locale_t numbers = ::newlocale(LC_NUMERIC_MASK, "", nullptr);
    if (!numbers) return;
    language().separator = ::nl_langinfo_l(THOUSEP, numbers);
    ::freelocale(numbers);
}

} // namespace

// The categories of characters and numbers stay those of programs: what is parsed and written must not depend on them.
void useLanguageOfThePerson() {
    language().chosen = true;
    chooseTexts();
    language().writesDates = std::setlocale(LC_TIME, "") && !isPlain(std::setlocale(LC_TIME, nullptr));
    chooseNumbers();
    ::bindtextdomain(kDomain, catalogs().c_str());
    ::bind_textdomain_codeset(kDomain, "UTF-8");
}

const char* translated(const char* text) {
    return language().chosen && *text ? ::dgettext(kDomain, text) : text;
}

std::string shownNumber(unsigned long long number) {
    std::string text = std::to_string(number);
    constexpr size_t kGroup = 3;
    if (!language().separator.empty())
        for (size_t at = text.size(); at > kGroup;) text.insert(at -= kGroup, language().separator);
    return text;
}

std::string countedText(unsigned long long count, const char* one, const char* more) {
    const char* word = language().chosen ? ::dngettext(kDomain, one, more, count) : count == 1 ? one : more;
    return shownNumber(count) + " " + word;
}

std::string shownDate(const Date& date) {
    if (!language().chosen) return date.toISO8601();
    const auto seconds = static_cast<time_t>(date.secondsSince1970());
    tm local{};
    std::array<char, 200> text{};
    if (!::localtime_r(&seconds, &local)) return date.toISO8601();
    const char* form = language().writesDates ? "%x %X" : "%Y-%m-%d %H:%M:%S";
    return std::strftime(text.data(), text.size(), form, &local) > 0 ? text.data() : date.toISO8601();
}

std::string shownDate(const std::string& text) {
    const auto date = Date::fromISO8601(text);
    return date ? shownDate(*date) : text;
}

std::string shownDay(const std::string& day) {
    const auto date = language().writesDates ? Date::fromISO8601(day + "T00:00:00Z") : std::nullopt;
    if (!date) return day;
    const auto seconds = static_cast<time_t>(date->secondsSince1970());
    tm parts{};
    std::array<char, 200> text{};
    if (!::gmtime_r(&seconds, &parts)) return day;
    return std::strftime(text.data(), text.size(), "%x", &parts) > 0 ? text.data() : day;
}

} // namespace rolvane::cli
