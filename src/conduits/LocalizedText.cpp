#include "conduits/LocalizedText.h"

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
        {"OK", "OK"},
    };
    return texts;
}

} // namespace

std::string localizedText(const char* key) {
    const char* translated = dgettext("CXStrings", key);
    if (translated != key && std::string_view(translated) != key) return translated;
    const auto found = builtInTexts().find(key);
    return found == builtInTexts().end() ? key : found->second;
}

} // namespace rolvane
