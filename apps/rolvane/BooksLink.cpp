#include "BooksLink.h"

#include "Context.h"

#include "contacts/records/PersonJoining.h"
#include "contacts/vcard/VCardScanner.h"
#include "contacts/vcard/VCardWriter.h"
#include "foundation/Date.h"
#include "foundation/Paths.h"
#include "foundation/PropertyList.h"
#include "foundation/QuietProgram.h"
#include "server/BooksDevices.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fmt/format.h>
#include <sstream>
#include <sys/file.h>
#include <unistd.h>

namespace rolvane::cli {

namespace {

constexpr int kNoProgram = 127; // what a shell says when there is none

std::string linksDirectory(const BooksOptions& books) {
    return BooksServer(books).stateDirectory() + "/links";
}

std::string now() {
    return Clock::system().now().toISO8601();
}

std::string quoted(const std::string& text) {
    return nlohmann::json(text).dump();
}

// The last lines of vdirsyncer's that name an error, without their mark.
std::string errorsIn(const std::string& log) {
    std::istringstream lines(log);
    std::string found, last;
    for (std::string line; std::getline(lines, line);) {
        if (line.empty()) continue;
        last = line;
        for (const char* mark : {"error: ", "critical: "})
            if (line.starts_with(mark)) found += (found.empty() ? "" : " ") + line.substr(std::strlen(mark));
    }
    constexpr size_t kLongest = 500;
    const std::string& text = found.empty() ? last : found;
    return text.size() > kLongest ? text.substr(0, kLongest) + "..." : text;
}

std::optional<VCardEntity> entityOf(const std::string& text, VCardVersion& version) {
    std::istringstream in(text);
    VCardScanner scanner(in, "card", [](const VCardError&) {});
    const auto card = scanner.next();
    if (!card) return std::nullopt;
    version = card->version == "4.0" ? VCardVersion::v4 : VCardVersion::v3;
    VCardError error;
    return vcardEntityFromCard(*card, error);
}

void unite(std::vector<std::string>& into, const std::vector<std::string>& more) {
    for (const std::string& each : more)
        if (std::find(into.begin(), into.end(), each) == into.end()) into.push_back(each);
}

BooksLink::Settings settingsFrom(const Dictionary& d) {
    return {.book = d["book"].string(),
            .name = d["name"].string(),
            .url = d["url"].string(),
            .user = d["user"].string(),
            .passwordCommand = d["passwordCommand"].string(),
            .caFile = d["caFile"].string()};
}

Dictionary dictionaryOf(const BooksLink::Settings& s) {
    Dictionary d;
    d.set("book", s.book);
    d.set("name", s.name);
    d.set("url", s.url);
    d.set("user", s.user);
    d.set("passwordCommand", s.passwordCommand);
    d.set("caFile", s.caFile);
    return d;
}

} // namespace

std::string mergedCards(const std::string& first, const std::string& second) {
    VCardVersion version = VCardVersion::v3, otherVersion = VCardVersion::v3;
    auto entity = entityOf(first, version);
    const auto other = entityOf(second, otherVersion);
    if (!entity || !other || entity->isGroup != other->isGroup) return {};
    JoinedProperties joined = joinedProperties(entity->properties, other->properties, UniqueId("same"));
    vcardReplaceKeptLines(joined.properties, kVCardJoinedUIDLine,
                          vcardKeptLines(entity->properties, kVCardJoinedUIDLine));
    entity->properties = joined.properties;
    unite(entity->categories, other->categories);
    unite(entity->members, other->members);
    unite(entity->subgroups, other->subgroups);
    return vcardText(*entity, version);
}

std::string linkConfiguration(const BooksLink::Settings& settings, const LinkPlaces& places) {
    const std::string remotePassword =
        settings.passwordCommand.empty()
            ? fmt::format("[\"command\", \"cat\", {}]", quoted(places.directory + "/remote-password"))
            : fmt::format("[\"shell\", {}]", quoted(settings.passwordCommand));
    std::string text = fmt::format("# Written by `rolvane books link` before each run: changes made here are lost.\n"
                                   "[general]\nstatus_path = {}\n\n"
                                   "[pair link]\na = \"here\"\nb = \"there\"\ncollections = null\n"
                                   "conflict_resolution = [\"command\", {}, \"books\", \"merge-cards\"]\n\n"
                                   "[storage here]\ntype = \"carddav\"\nurl = {}\nusername = {}\n"
                                   "password.fetch = [\"command\", \"cat\", {}]\n",
                                   quoted(places.directory + "/status/"), quoted(places.program), quoted(places.here),
                                   quoted(places.device), quoted(places.directory + "/password"));
    if (!places.caFile.empty()) text += fmt::format("verify = {}\n", quoted(places.caFile));
    text += fmt::format("\n[storage there]\ntype = \"carddav\"\nurl = {}\n", quoted(settings.url));
    if (!settings.user.empty())
        text += fmt::format("username = {}\npassword.fetch = {}\n", quoted(settings.user), remotePassword);
    if (!settings.caFile.empty()) text += fmt::format("verify = {}\n", quoted(settings.caFile));
    return text;
}

std::vector<BooksLink> BooksLink::all(const BooksOptions& books) {
    std::vector<BooksLink> links;
    std::error_code none;
    for (const auto& entry : std::filesystem::directory_iterator(linksDirectory(books), none)) {
        const std::string file = entry.path().string() + "/link.plist";
        if (access(file.c_str(), F_OK) != 0) continue;
        links.push_back(
            BooksLink(books, entry.path().string(), settingsFrom(PropertyList::fromFile(file).dictionary())));
    }
    std::sort(links.begin(), links.end(),
              [](const BooksLink& a, const BooksLink& b) { return a._settings.name < b._settings.name; });
    return links;
}

std::optional<BooksLink> BooksLink::of(const BooksOptions& books, const std::string& book) {
    for (const BooksLink& link : all(books))
        if (link._settings.book == book) return link;
    return std::nullopt;
}

BooksLink BooksLink::make(const BooksOptions& books, const Settings& settings, const std::string& password) {
    BooksLink link(books, linksDirectory(books) + "/" + settings.book, settings);
    CXPathUtils_MakeCompletePath(link._directory, 0700);
    writeFileDurably(link._directory + "/password", BooksDevices(books.stateDirectory).add(link.deviceName()));
    if (settings.passwordCommand.empty()) writeFileDurably(link._directory + "/remote-password", password);
    writeFileDurably(link._directory + "/link.plist", PropertyList::toXML(dictionaryOf(settings)));
    return link;
}

// Port and certificate may have changed since the link was made.
void BooksLink::writeConfiguration() const {
    const BooksServer server(_books);
    std::error_code error;
    writeFileDurably(configurationFile(),
                     linkConfiguration(_settings, {.here = server.url() + "books/home/" + _settings.book + "/",
                                                   .device = deviceName(),
                                                   .caFile = _books.tls ? server.caFile() : "",
                                                   .directory = _directory,
                                                   .program = std::filesystem::read_symlink("/proc/self/exe", error)}));
}

BooksLink::Outcome BooksLink::outcomeOf(int status) const {
    Outcome outcome{.date = now(), .good = status == 0, .message = {}, .failingSince = {}};
    if (outcome.good) return outcome;
    outcome.message = status == kNoProgram
                          ? "There is no vdirsyncer. Install the package vdirsyncer (apt-get install vdirsyncer)."
                          : errorsIn(readFile(logFile()));
    if (outcome.message.empty()) outcome.message = fmt::format("vdirsyncer ended with {}.", status);
    const auto last = lastRun();
    outcome.failingSince = last && !last->good ? last->failingSince : outcome.date;
    return outcome;
}

BooksLink::Outcome BooksLink::run() const {
    const FileHandle lock(open((_directory + "/lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
    while (lock && flock(lock.get(), LOCK_EX) != 0)
        if (errno != EINTR) break;
    writeConfiguration();
    // It has to look at both sides once before it can bring them in step.
    constexpr const char* kScript = "exec </dev/null >\"$2\" 2>&1; command -v vdirsyncer || exit 127; "
                                    "test -e \"$3\" || vdirsyncer -c \"$1\" discover link || exit 1; "
                                    "exec vdirsyncer -c \"$1\" sync link";
    const int status = runQuietly(
        {"/bin/sh", "-c", kScript, "rolvane", configurationFile(), logFile(), _directory + "/status/link.collections"});
    const Outcome outcome = outcomeOf(status);
    noteOutcome(outcome);
    return outcome;
}

void BooksLink::noteOutcome(const Outcome& outcome) const {
    Dictionary d;
    d.set("date", outcome.date);
    d.set("good", outcome.good);
    d.set("message", outcome.message);
    d.set("failingSince", outcome.failingSince);
    writeFileDurably(_directory + "/last.plist", PropertyList::toXML(d));
}

std::optional<BooksLink::Outcome> BooksLink::lastRun() const {
    const std::string file = _directory + "/last.plist";
    if (access(file.c_str(), F_OK) != 0) return std::nullopt;
    const Dictionary d = PropertyList::fromFile(file).dictionary();
    return Outcome{.date = d["date"].string(),
                   .good = d["good"].boolean(false),
                   .message = d["message"].string(),
                   .failingSince = d["failingSince"].string()};
}

void BooksLink::remove() const {
    BooksDevices(_books.stateDirectory).remove(deviceName());
    std::error_code ignored;
    std::filesystem::remove_all(_directory, ignored);
}

} // namespace rolvane::cli
