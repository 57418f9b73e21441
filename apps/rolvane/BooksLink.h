#pragma once

#include "server/BooksServer.h"

#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <vector>

namespace rolvane::cli {

// An address book on another CardDAV server that vdirsyncer keeps in step with one of this user's books. Each link has
// a directory below <state>/links, named after the book: its settings (link.plist), the configuration that vdirsyncer
// reads, what vdirsyncer knows of both sides, its output (log), passwords (mode 0600) and the outcome of the last run.
// It signs in here as a device of its own, "link-<book>". One object belongs to one thread; several processes may run
// the same link, one at a time. Operations throw CommandError.
class BooksLink {
public:
    struct Settings {
        std::string book; // the last segment of the book's path here: "contacts", "group-<UUID>"
        std::string name; // what people call it
        std::string url;  // the other address book's own
        std::string user, passwordCommand;
        std::string caFile; // PEM; "" = the system's authorities
    };
    // How the last run ended.
    struct Outcome {
        std::string date; // ISO 8601
        bool good = false;
        std::string message;      // what went wrong
        std::string failingSince; // ISO 8601; "" when good
    };

    static std::vector<BooksLink> all(const BooksOptions& books); // ascending by the books' names
    static std::optional<BooksLink> of(const BooksOptions& books, const std::string& book);
    // Writes the settings. `password` is kept in a file when there is no command that gives it.
    static BooksLink make(const BooksOptions& books, const Settings& settings, const std::string& password);

    const Settings& settings() const { return _settings; }
    // Brings both sides in step. The outcome is written down, too.
    Outcome run() const;
    std::optional<Outcome> lastRun() const;
    void remove() const; // the link and its device; both books stay as they are

    std::string configurationFile() const { return _directory + "/vdirsyncer.conf"; }
    std::string logFile() const { return _directory + "/log"; }

private:
    BooksLink(const BooksOptions& books, std::string directory, Settings settings)
        : _books(books), _directory(std::move(directory)), _settings(std::move(settings)) {}
    std::string deviceName() const { return "link-" + _settings.book; }
    void writeConfiguration() const;
    void noteOutcome(const Outcome& outcome) const;
    Outcome outcomeOf(int status) const;

    BooksOptions _books;
    std::string _directory;
    Settings _settings;
};

// vdirsyncer's configuration for a link: pure. `here` is the book's URL on this machine, `program` is rolvane, which
// merges a card that both sides have changed.
struct LinkPlaces {
    std::string here, device, caFile, directory, program;
};
std::string linkConfiguration(const BooksLink::Settings& settings, const LinkPlaces& places);

// One card of two that are the same contact's: what either has is in it, and what has room for one value only has the
// first's, with the second's in the note. Empty when one of them is no card.
std::string mergedCards(const std::string& first, const std::string& second);

} // namespace rolvane::cli
