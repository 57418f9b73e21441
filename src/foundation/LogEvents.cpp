#include "foundation/LogEvents.h"

#include "foundation/Log.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <cstdlib>
#include <unordered_map>

namespace rolvane {

namespace {

// The catalog, packaging/journal/rolvane.catalog, has a text for each of the identifiers.
constexpr LogKind kEnded{"ended", "f6fadfa7e5c14b629362da5cc13da58a", 4};
constexpr LogKind kAlreadyRunning{"already-running", "2c63888f28f04481be6ddce7a7ace732", 6};
constexpr LogKind kPassFailed{"pass-failed", "8a119b9e16bc47328f7b7676d015b0dc", 4};
constexpr LogKind kChangeFailed{"change-failed", "bc67ba94637d4efaa09e467ada679f81", 4};
constexpr LogKind kStrangeContent{"strange-content", "fab36728a78b4b7e8787c0de2f960063", 4};
constexpr LogKind kTreeDamaged{"tree-damaged", "a712755f6cac44d599d5269512e74f7b", 4};
constexpr LogKind kSharingEnded{"sharing-ended", "ac8efe121c5949f1ba2dde83458bfed0", 5};
constexpr LogKind kRightsNotSet{"rights-not-set", "5796a670482c490e8d9782bfcdc83011", 4};
constexpr LogKind kLock{"lock", "0b80a25553a14945a93258ef7777682c", 5};
constexpr LogKind kDatabase{"database", "45ac16b9c20d4c218f8a7abff2e91ac7", 3};
constexpr LogKind kGoneElsewhere{"gone-elsewhere", "dd2ee150d2844277b89c1af40ce8fcc9", 6};
constexpr LogKind kMemoryNotKept{"memory-not-kept", "3c3ae353fb14428e90b401a6c1cc0aff", 5};
constexpr LogKind kNotifications{"notifications", "b9c8b9ffe46e46279419c7723226db94", 5};
constexpr LogKind kWatches{"watches", "bbeeb6361d334c6d96f0da847a2a3b87", 5};
constexpr LogKind kTold{"told", "68e58909ccb24416925a56c9a30f4300", 5};
constexpr LogKind kConfiguration{"configuration", "ff53a46f5ead403a84c4b877678537a3", 4};
constexpr LogKind kStore{"store", "e179f773a6e043c09514b7dde2ad0478", 4};
constexpr LogKind kComputers{"computers", "e93e466011e14cb0a891d292da65fbcc", 6};
constexpr LogKind kProgress{"progress", "0c28cec1b94742afa4b936976b4b76b0", 7};

constexpr std::array kKinds{&kEnded,         &kAlreadyRunning, &kPassFailed,    &kChangeFailed, &kStrangeContent,
                            &kTreeDamaged,   &kSharingEnded,   &kRightsNotSet,  &kLock,         &kDatabase,
                            &kGoneElsewhere, &kMemoryNotKept,  &kNotifications, &kWatches,      &kTold,
                            &kConfiguration, &kStore,          &kComputers,     &kProgress};

// A line of the log, its kind, and for each placeholder whether its argument may be shown to everybody ('-'), has to be
// cleared of names first ('t', see withoutNames), or is a name or a content itself ('n'). Lines of a failed pass or
// change are shown whole: nobody could find the failure without them.
struct Line {
    std::string_view format;
    const LogKind* kind;
    std::string_view arguments;
};

constexpr Line kLines[] = {
    {"%@", &kStore, "t"},
    {"%@ cannot become a subgroup of %@, which another program has put below it; left out.", &kGoneElsewhere, "--"},
    {"%@ contradicts what is there already, and is left out until it does not", &kChangeFailed, "n"},
    {"%@ has been deleted by somebody else, and is not written any more", &kGoneElsewhere, "t"},
    {"%@ was removed by another program; the changes made to it here are dropped.", &kGoneElsewhere, "-"},
    {"%d strange names in the list %@ are left out, the first of them: %@", &kStrangeContent, "-tn"},
    {"%s %s", &kTold, "nn"},
    {"A lock could not be renewed: %@", &kLock, "t"},
    {"A notification %@ is larger than %@ bytes and is not delivered. Others are not logged.", &kNotifications, "--"},
    {"A notification cannot be read: %@", &kNotifications, "t"},
    {"A pass has failed, and is made again later: %@", &kPassFailed, "t"},
    {"A peer of the control socket is let go: %@", &kNotifications, "t"},
    {"A tree could not be listed before the pass: %@", &kStore, "t"},
    {"An all-contacts group cannot be removed; %@ stays.", &kDatabase, "-"},
    {"An entry in %@ is too large to be read and left out: %@", &kStrangeContent, "tn"},
    {"An entry with a strange name in %@ is left out: %@", &kStrangeContent, "tn"},
    {"An entry with a strange name in the listing of %@ is left out.", &kStrangeContent, "t"},
    {"Change record: %@", &kChangeFailed, "-"},
    {"Changes of the network are not noticed: %@", &kWatches, "t"},
    {"Changes that wait in the database are left for the next start: %@", &kPassFailed, "t"},
    {"Commands reach this daemon by the session bus only: %@", &kNotifications, "t"},
    {"Could not get group info at: %@, error: %d", &kStore, "--"},
    {"Could not retrieve info for files in subscription: %@", &kStore, "-"},
    {"ERR: %s", &kStore, "-"},
    {"Exception saving ACL: %@", &kRightsNotSet, "-"},
    {"Exception with applying change record: %@", &kChangeFailed, "-"},
    {"Exception with reading change record: %@", &kChangeFailed, "-"},
    {"Lock tokens are not written down: %@", &kLock, "t"},
    {"More than %@ notifications wait for their observers: the oldest are dropped.", &kNotifications, "-"},
    {"Notes of new records are kept until the next pass: %@", &kMemoryNotKept, "t"},
    {"Notification %@ cannot be sent: %@", &kNotifications, "-t"},
    {"Notification %@ cannot be sent: %@.", &kNotifications, "-t"},
    {"Only %d of %d workers could be started: %s", &kPassFailed, "--t"},
    {"Progress of a change record could not be reported: %@", &kNotifications, "t"},
    {"Quitting due to an unhandled exception: %@", &kEnded, "-"},
    {"RolvaneManager is already running (process %d) and serves this user; this one ends.", &kAlreadyRunning, "-"},
    {"SyncEngine out of order workloop caught (CX) %@: %@", &kChangeFailed, "--"},
    {"SyncEngine out of order workloop caught (Vaultra) %@: %@", &kChangeFailed, "--"},
    {"The access list of %@ could not be set: %@", &kRightsNotSet, "tt"},
    {"The configuration is not used: %@", &kConfiguration, "t"},
    {"The contact database %@ was damaged. Its indexes have been rebuilt, and the whole file is in order again.",
     &kDatabase, "t"},
    {"The contacts of %@ are not shared with you any more. They cannot be kept, so they stay for now: %@",
     &kSharingEnded, "nt"},
    {"The contact database is damaged: %@", &kDatabase, "t"},
    {"The counters could not be written: %@", &kMemoryNotKept, "t"},
    {"Another computer keeps this publication in step, too.", &kComputers, ""},
    {"The tree of this account has been taken in.", &kComputers, ""},
    {"The tree of this account has no list of its contacts, and is not taken in before it has one again.",
     &kTreeDamaged, ""},
    {"The damage of the contact database could not be noted: %@", &kDatabase, "t"},
    {"The directory %@ cannot be watched (%@): the database is looked at every second instead. Raise "
     "fs.inotify.max_user_instances or fs.inotify.max_user_watches.",
     &kWatches, "t-"},
    {"The group has been deleted by somebody else, and is not changed any more: %@", &kGoneElsewhere, "n"},
    {"The lock on %s is left to expire: %@", &kLock, "tt"},
    {"The memory of versions could not be saved: %@", &kMemoryNotKept, "t"},
    {"What is remembered of the store could not be saved: %@", &kMemoryNotKept, "t"},
    {"What is remembered of the store could not be kept: %@", &kMemoryNotKept, "t"},
    {"The outcome of the pass could not be stored: %@", &kPassFailed, "t"},
    {"The publication has ended: %@.", &kSharingEnded, "-"},
    {"The published tree could not be looked after: %@", &kTreeDamaged, "t"},
    {"The store has lost the files of %@ contacts, which are written again.", &kTreeDamaged, "-"},
    {"The store knows nobody called \"%@\": the access list of %@ goes without.", &kRightsNotSet, "nt"},
    {"The subscription to the owner's own data cannot be removed; it stays.", &kDatabase, ""},
    {"The tree of %@ %@. %@", &kTreeDamaged, "n--"},
    {"Versions are remembered in memory only: %@", &kMemoryNotKept, "t"},
    {"What lies at %@ is no dictionary and is left out. %@", &kStrangeContent, "tt"},
    {"What other programs have saved waits: %@", &kDatabase, "t"},
    {"What the daemon says on its control socket cannot be read: %@", &kNotifications, "t"},
    {"\"%@\" is a name of the published tree's own, and no contact or group can be kept under it. The change stays in "
     "this database: %@",
     &kChangeFailed, "nn"},
    {"applyChangeRecords close: Caught %@: %@", &kPassFailed, "--"},
    {"applyChangeRecords: Caught %@: %@", &kPassFailed, "--"},
    {"bringSourcesUpToDate: Caught %@: %@", &kPassFailed, "--"},
};

const Line* lineOf(std::string_view format) {
    static const std::unordered_map<std::string_view, const Line*> all = [] {
        std::unordered_map<std::string_view, const Line*> lines;
        for (const Line& line : kLines) lines.emplace(line.format, &line);
        return lines;
    }();
    const auto found = all.find(format);
    return found == all.end() ? nullptr : found->second;
}

constexpr const char* kHidden = "…";

bool isDigit(char c) {
    return c >= '0' && c <= '9';
}

bool isNumber(std::string_view word) {
    return !word.empty() && std::all_of(word.begin(), word.end(), [](char c) {
        return isDigit(c) || std::string_view("+-()/.").find(c) != std::string_view::npos;
    });
}

std::string origin(std::string_view address) {
    const size_t host = address.find("://") + 3;
    std::string_view authority = address.substr(host, address.find_first_of("/?#", host) - host);
    if (const size_t user = authority.rfind('@'); user != std::string_view::npos) authority.remove_prefix(user + 1);
    return std::string(address.substr(0, host)) + std::string(authority) + "/" + kHidden;
}

std::string path(std::string_view whole) {
    const char* home = std::getenv("HOME");
    const std::string_view own = home ? home : "";
    if (own.size() > 1 && whole.starts_with(own) && (whole.size() == own.size() || whole[own.size()] == '/'))
        return "~" + std::string(whole.substr(own.size()));
    return std::string("/") + kHidden;
}

// A word between blanks, without the punctuation around it.
std::string wordWithoutNames(std::string_view word, bool& inNumber) {
    constexpr long kShortNumber = 5; // an answer's status, a port, a count
    const long digits = std::count_if(word.begin(), word.end(), isDigit);
    inNumber = isNumber(word) && (digits > kShortNumber || inNumber || (word[0] == '+' && digits > 0));
    if (inNumber) return kHidden;
    if (word.find("://") != std::string_view::npos) return origin(word);
    if (word.starts_with('/') && word.size() > 1) return path(word);
    if (const size_t at = word.find('@'); at != std::string_view::npos && at > 0 && at + 1 < word.size())
        return kHidden;
    return std::string(word);
}

// As many as the library's placeholders of formats.
size_t placeholders(std::string_view format) {
    size_t count = 0;
    for (size_t i = 0; i + 1 < format.size(); ++i) {
        if (format[i] != '%') continue;
        count += format[i + 1] == '%' ? 0 : 1;
        ++i;
    }
    return count;
}

std::string shownToAll(char mark, const std::string& text) {
    if (mark == '-') return text;
    return mark == 't' ? withoutNames(text) : kHidden;
}

} // namespace

LogEvent logEvent(std::string_view format, const std::vector<detail::LogArgument>& arguments) {
    const Line* known = lineOf(format);
    std::vector<detail::LogArgument> shown;
    for (size_t i = 0; i < arguments.size(); ++i)
        shown.push_back(
            {shownToAll(known && i < known->arguments.size() ? known->arguments[i] : 'n', arguments[i].text)});
    return {detail::formatLog(format, arguments), detail::formatLog(format, shown), std::string(format),
            known ? known->kind : &kStore};
}

LogEvent progressEvent(std::string line) {
    return {line, line, {}, &kProgress};
}

std::span<const LogKind* const> logKinds() {
    return kKinds;
}

bool isKnownFormat(std::string_view format) {
    const Line* line = lineOf(format);
    return line && line->arguments.size() == placeholders(format);
}

std::string withoutNames(std::string_view text) {
    constexpr std::string_view kBlanks = " \t\n", kBefore = "(<[{'", kBehind = ".,;:!?)>]}'";
    std::string out;
    bool inNumber = false;
    while (!text.empty()) {
        if (text[0] == '"') { // what has no end is hidden to the end
            out += std::string("\"") + kHidden;
            const size_t end = text.find('"', 1);
            if (end == std::string_view::npos) break;
            out += '"';
            text.remove_prefix(end + 1);
        } else if (kBlanks.find(text[0]) != std::string_view::npos || kBefore.find(text[0]) != std::string_view::npos) {
            out += text[0];
            text.remove_prefix(1);
        } else {
            std::string_view word = text.substr(0, std::min(text.find_first_of(kBlanks), text.find('"')));
            text.remove_prefix(word.size());
            const size_t last = word.find_last_not_of(kBehind);
            const size_t length = last == std::string_view::npos ? 0 : last + 1;
            if (length > 0) out += wordWithoutNames(word.substr(0, length), inNumber);
            out += word.substr(length);
        }
    }
    return out;
}

} // namespace rolvane
