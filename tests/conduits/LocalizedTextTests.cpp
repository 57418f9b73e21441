#include "conduits/LocalizedText.h"

#include <clocale>
#include <cstdlib>
#include <filesystem>
#include <gtest/gtest.h>
#include <set>

extern "C" int _nl_msg_cat_cntr; // gettext's: to be changed with the language, as its manual says

namespace rolvane::test {
namespace {

constexpr const char* kKeys[] = {"SHARING_BAD_USERNAME_PASS_HEADER",
                                 "SHARING_BAD_USERNAME_PASS",
                                 "SHARING_WITHDRAWN_HEADER",
                                 "SHARING_WITHDRAWN",
                                 "SHARING_WITHDRAWN_ONE",
                                 "SHARING_WITHDRAWN_EMPTY",
                                 "SHARING_ENDED_HEADER",
                                 "SHARING_ENDED",
                                 "SHARING_ENDED_REPLACED",
                                 "SHARING_ENDED_ELSEWHERE",
                                 "SHARING_ENDED_RIGHTS",
                                 "AND",
                                 "OK"};

// Places and commands, which stay as they stand in every language.
std::set<std::string> fixedIn(const std::string& text) {
    std::set<std::string> all;
    for (size_t at = text.find('{'); at != std::string::npos; at = text.find('{', at + 1))
        all.insert(text.substr(at, text.find('}', at) - at));
    for (const char* command :
         {"rolvane account set", "rolvane import", "rolvane publish", "rolvane join", "rolvane unshare"})
        if (text.find(command) != std::string::npos) all.insert(command);
    return all;
}

class LocalizedTexts : public testing::Test {
protected:
    ~LocalizedTexts() override {
        ::unsetenv("LANGUAGE");
        ::unsetenv("LC_ALL");
    }
    static void speak(const char* language) {
        ::setenv("LC_ALL", "C.UTF-8", 1);
        ::setenv("LANGUAGE", language, 1);
        ++_nl_msg_cat_cntr;
        useCatalogsIn(std::filesystem::read_symlink("/proc/self/exe").parent_path().parent_path() / "po");
    }
};

TEST_F(LocalizedTexts, AreThePersonsAndTheProcessKeepsItsOwnLanguage) {
    EXPECT_EQ(localizedText("AND"), "and");
    speak("de");
    EXPECT_EQ(localizedText("AND"), "und");
    speak("fr");
    EXPECT_EQ(localizedText("AND"), "et");
    EXPECT_EQ(localizedText("SHARING_WITHDRAWN_HEADER", {{"user", "bob"}}), "Les contacts de bob sont partis");
    EXPECT_STREQ(std::setlocale(LC_MESSAGES, nullptr), "C");
}

TEST_F(LocalizedTexts, SayTheSameInEveryLanguage) {
    for (const char* key : kKeys) {
        speak("en");
        const std::string english = localizedText(key);
        EXPECT_TRUE(english != key || english == "OK");
        for (const char* language : {"de", "fr"}) {
            speak(language);
            const std::string text = localizedText(key);
            EXPECT_TRUE(text != english || text == "OK") << key << " in " << language;
            EXPECT_EQ(fixedIn(text), fixedIn(english)) << key << " in " << language;
        }
    }
}

} // namespace
} // namespace rolvane::test
