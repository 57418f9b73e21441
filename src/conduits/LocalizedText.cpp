#include "conduits/LocalizedText.h"

#include <clocale>
#include <libintl.h>
#include <map>
#include <string_view>

namespace rolvane {
namespace {

const std::map<std::string_view, const char*>& builtInTexts() {
    static const std::map<std::string_view, const char*> texts = {
        {"SHARING_BAD_USERNAME_PASS_HEADER", "Your contacts cannot be shared"},
        {"SHARING_BAD_USERNAME_PASS",
         "The store of your contacts refused your user name or password. Nothing was changed. Correct the account with "
         "\"rolvane account set\"; sharing then starts again by itself."},
        {"SHARING_WITHDRAWN_HEADER", "The contacts of {user} have left"},
        {"SHARING_WITHDRAWN",
         "{user} no longer shares contacts with you. {count} contacts were removed from your list; a copy is kept in "
         "{file}, which \"rolvane import\" takes."},
        {"SHARING_WITHDRAWN_ONE",
         "{user} no longer shares contacts with you. One contact was removed from your list; a copy is kept in {file}, "
         "which \"rolvane import\" takes."},
        {"SHARING_WITHDRAWN_EMPTY", "{user} shares no contacts with you. The subscription has ended; there was nothing "
                                    "to remove."},
        {"SHARING_ENDED_HEADER", "Your contacts are not published any more"},
        {"SHARING_ENDED", "The store has nothing of your publication any more, or does not let you in. Your contacts "
                          "stay as they are on "
                          "this computer. \"rolvane publish\" publishes them again."},
        {"SHARING_ENDED_REPLACED",
         "On the store lies another publication of yours, made from another computer perhaps. Your contacts stay as "
         "they are on this computer, and nothing there was changed. \"rolvane publish\" publishes them from here."},
        {"SHARING_ENDED_ELSEWHERE", "They were taken off the store on another computer of yours, or are gone there. "
                                    "Your contacts stay as they are "
                                    "on this computer. \"rolvane publish\" publishes them again; where the other "
                                    "computer has published them anew, "
                                    "\"rolvane join\" keeps this one in step with it."},
        {"SHARING_ENDED_RIGHTS", "You have taken rights away from {users}, and the store does not know of it yet: they "
                                 "may still read what is left there. After \"rolvane publish\", \"rolvane unshare\" "
                                 "takes the rights away there."},
        {"AND", "and"},
        {"OK", "OK"},
    };
    return texts;
}

constexpr const char* kDomain = "CXStrings";

// The language of this thread, as the environment has it, for as long as this lives.
class PersonsLanguage {
public:
    PersonsLanguage() {
        _messages = ::newlocale(LC_MESSAGES_MASK, "", nullptr);
        if (_messages) _before = ::uselocale(_messages);
    }
    ~PersonsLanguage() {
        if (!_messages) return;
        ::uselocale(_before);
        ::freelocale(_messages);
    }
    PersonsLanguage(const PersonsLanguage&) = delete;
    PersonsLanguage& operator=(const PersonsLanguage&) = delete;

private:
    locale_t _messages = nullptr, _before = nullptr; // null where the system has no such language
};

} // namespace

void useCatalogsIn(const std::string& directory) {
    ::bindtextdomain(kDomain, directory.c_str());
    ::bind_textdomain_codeset(kDomain, "UTF-8");
}

std::string localizedText(const char* key) {
    const PersonsLanguage language;
    const char* translated = dgettext(kDomain, key);
    if (translated != key && std::string_view(translated) != key) return translated;
    const auto found = builtInTexts().find(key);
    return found == builtInTexts().end() ? key : found->second;
}

std::string localizedText(const char* key, std::initializer_list<std::pair<std::string_view, std::string>> values) {
    std::string text = localizedText(key);
    for (const auto& [name, value] : values) {
        const std::string mark = "{" + std::string(name) + "}";
        for (size_t at = text.find(mark); at != std::string::npos; at = text.find(mark, at + value.size()))
            text.replace(at, mark.size(), value);
    }
    return text;
}

} // namespace rolvane
