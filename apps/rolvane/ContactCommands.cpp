#include "Consent.h"
#include "Context.h"
#include "ImportReport.h"
#include "Lookup.h"
#include "PersonFields.h"
#include "Publication.h"
#include "RecordJson.h"
#include "SafeText.h"
#include "Shares.h"
#include "Shown.h"
#include "Subscriptions.h"
#include "Texts.h"
#include "ValueNames.h"

#include "contacts/database/History.h"
#include "contacts/database/OneTurn.h"
#include "contacts/vcard/TextCharset.h"
#include "contacts/vcard/VCardExport.h"
#include "contacts/vcard/VCardImport.h"
#include "foundation/PropertyList.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fmt/format.h>
#include <fstream>
#include <functional>
#include <iostream>
#include <map>
#include <set>
#include <utility>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

// import ---------------------------------------------------------------------------------------------------------

struct ImportOptions {
    std::vector<std::string> files;
    std::string charset;
    bool dryRun = false;
};

void importCards(Context& context, const ImportOptions& options) {
    if (!options.charset.empty() && !isKnownCharset(options.charset))
        throw CommandError(kUsage, tr("There is no character set \"{}\". `iconv --list` names those that "
                                      "there are.",
                                      options.charset));
    VCardImportReport report;
    size_t unreadable = 0; // files
    {
        ProgressBar bar(context, translated("Importing"));
        VCardImport import(context.database(), [&](const VCardProgress& progress) {
            if (progress.bytesTotal > 0)
                bar.update(static_cast<double>(progress.bytesDone) / static_cast<double>(progress.bytesTotal),
                           countedText(progress.cards, "contact", "contacts"));
        });
        import.setCharset(options.charset);
        import.setDryRun(options.dryRun);
        for (const std::string& file : options.files) try {
                if (file == "-")
                    import.addStream(std::cin, translated("standard input"));
                else
                    import.addFile(file);
            } catch (const CXException& error) {
                if (error.name() != kCXVCardException) throw; // the others would fare no better
                context.warn("rolvane: " + error.reason());
                ++unreadable;
            }
        report = import.finish();
    }
    reportImport(context, report, unreadable, options.dryRun);
    const std::vector<std::string> readers = Shares(context.database()).readers();
    if (options.dryRun && report.imported > 0 && !readers.empty() && Publication(context.database()).everything())
        context.say(tr("All your contacts are published: {} would become readable for {}.",
                       countedText(report.imported, "person", "people"), usersText(readers)));
}

// export ---------------------------------------------------------------------------------------------------------

struct ExportOptions {
    std::string group, output, version = "4";
    std::vector<std::string> names;
};

// A file that takes the place of a former one of that name only when it is whole.
class OutputFile {
public:
    explicit OutputFile(std::string path) : _path(std::move(path)) {
        std::error_code none;
        const auto status = std::filesystem::status(_path, none);
        // A pipe or a device is written to as it is.
        const bool replaced = !std::filesystem::exists(status) || std::filesystem::is_regular_file(status);
        _written = replaced ? _path + ".part" : _path;
        _stream.open(_written, std::ios::binary | std::ios::trunc);
        if (!_stream) {
            const std::string reason = std::strerror(errno);
            _written = _path;
            throw CommandError(kFailed, tr("{} cannot be written ({}).", _path, reason));
        }
    }
    ~OutputFile() {
        if (_written != _path) std::remove(_written.c_str());
    }
    OutputFile(const OutputFile&) = delete;
    OutputFile& operator=(const OutputFile&) = delete;
    std::ostream& stream() { return _stream; }
    void finish() {
        _stream.close();
        if (!_stream || (_written != _path && std::rename(_written.c_str(), _path.c_str()) != 0))
            throw CommandError(kFailed, tr("{} could not be written whole ({}). What was there before is as "
                                           "it was.",
                                           _path, std::strerror(errno)));
        _written = _path;
    }

private:
    std::string _path, _written;
    std::ofstream _stream;
};

size_t exportTo(Context& context, const ExportOptions& options, std::ostream& out) {
    CXRolvane& database = context.database();
    ProgressBar bar(context, translated("Exporting"));
    VCardExport writer(database, out, options.version == "3" ? VCardVersion::v3 : VCardVersion::v4,
                       [&](size_t done, size_t total) {
                           if (total > 1000) bar.update(static_cast<double>(done) / static_cast<double>(total));
                       });
    if (!options.group.empty()) return writer.exportGroup(findGroup(database, options.group));
    if (options.names.empty()) return writer.exportAll();
    std::vector<UniqueId> uids;
    for (const std::string& name : options.names) uids.push_back(findPerson(database, name)->uniqueId());
    return writer.exportRecords(uids);
}

void exportCards(Context& context, const ExportOptions& options) {
    size_t cards = 0;
    if (options.output.empty() || options.output == "-") {
        cards = exportTo(context, options, std::cout);
    } else {
        OutputFile file(options.output);
        cards = exportTo(context, options, file.stream());
        file.finish();
    }
    context.say(tr("{} written.", countedText(cards, "card", "cards")));
}

// list, search and show
// ----------------------------------------------------------------------------------------------------

struct ListOptions {
    std::string text, group;
    bool full = false;
    Whose whose;
};

std::vector<CXListing> chosenPeople(Context& context, const ListOptions& options) {
    CXRolvane& database = context.database();
    std::vector<CXListing> people = database.listPeople(locationOf(database, options.whose), options.text);
    if (options.group.empty()) return people;
    const auto members = findGroup(database, options.group)->memberUniqueIds();
    const std::set<UniqueId> wanted(members.begin(), members.end());
    std::erase_if(people, [&](const CXListing& person) { return !wanted.contains(person.uniqueId); });
    return people;
}

// Everybody's rows, one by one: a document of 100,000 people with photos need not stand in memory.
void forEachWhole(CXRolvane& database, const std::vector<CXListing>& people,
                  const std::function<void(const CXRow&, const Dictionary&)>& call) {
    std::vector<UniqueId> uids;
    uids.reserve(people.size());
    for (const CXListing& listed : people) uids.push_back(listed.uniqueId);
    database.forEachOf(uids, [&](const CXRow& row) { call(row, BinaryValue::decode(*row.encoded).dictionary()); });
}

void listJson(Context& context, const std::vector<CXListing>& people, bool full) {
    context.line("[");
    bool first = true;
    const auto put = [&](const std::string& json) { context.line((std::exchange(first, false) ? "  " : ", ") + json); };
    if (full) {
        std::map<UniqueId, std::string> names;
        for (const CXListing& group : context.database().listGroups(std::nullopt))
            names[group.uniqueId] = group.displayName;
        forEachWhole(context.database(), people, [&](const CXRow& row, const Dictionary& properties) {
            std::vector<std::string> groups;
            for (const UniqueId& parent : row.parentGroups) groups.push_back(names[parent]);
            put(jsonText(row, properties, groups));
        });
    } else {
        for (const CXListing& listed : people)
            put(Json({{"identifier", listed.uniqueId.str()},
                      {"name", listed.displayName},
                      {"location", listed.location.empty() ? Json() : Json(listed.location.str())},
                      {"owner", ownerJson(listed.location)}})
                    .dump(-1, ' ', false, Json::error_handler_t::replace));
    }
    context.line("]");
}

std::string firstText(const Dictionary& properties, const char* property) {
    const auto values = CXMultiValue::fromValue(properties[property]);
    return values && !values->empty() ? values->entries().front().value.string() : std::string();
}

// Name, then a number or else a mail address: what people look for in a list.
void listText(Context& context, const std::vector<CXListing>& people) {
    constexpr size_t kNameColumns = 32, kLeastNameColumns = 12;
    const size_t columns = context.dataColumns();
    const size_t nameColumns =
        columns == 0 ? kNameColumns : std::clamp<size_t>(columns / 2, kLeastNameColumns, kNameColumns);
    size_t next = 0;
    forEachWhole(context.database(), people, [&](const CXRow& row, const Dictionary& properties) {
        while (next < people.size() && people[next].uniqueId != row.uniqueId) next++; // deleted meanwhile
        std::string reach = firstText(properties, kCXPhoneProperty);
        if (reach.empty()) reach = firstText(properties, kCXEmailProperty);
        reach = shownLine(reach + (next < people.size() ? ownerMark(people[next]) : std::string()));
        std::string name = shownLine(cxDisplayName(properties));
        if (columns > 0 && !reach.empty()) name = cutTo(name, nameColumns);
        const size_t taken = columnsOf(name);
        if (!reach.empty()) name += std::string(taken < nameColumns ? nameColumns - taken : 0, ' ') + "  " + reach;
        context.line(columns > 0 ? cutTo(name, columns) : name);
    });
}

void tell(Context& context, const std::vector<CXListing>& people, bool full) {
    if (context.json) return listJson(context, people, full);
    if (!full) return listText(context, people);
    for (const CXListing& person : people)
        context.line(fmt::format("{}  {}{}", person.uniqueId.str(), shownLine(person.displayName), ownerMark(person)));
}

void list(Context& context, const ListOptions& options) {
    tell(context, chosenPeople(context, options), options.full);
}

void search(Context& context, const std::vector<std::string>& words, bool full) {
    std::string text;
    for (const std::string& word : words) text += (text.empty() ? "" : " ") + word;
    const CXSearchQuery query(text);
    if (query.empty()) throw CommandError(kUsage, translated("Name a word to search for."));
    const std::vector<CXListing> people = context.database().peopleFound(query);
    if (people.empty() && !context.json)
        throw CommandError(kNotFound, tr("Nobody has \"{}\" in name, organisation, mail, phone or note.", text));
    tell(context, people, full);
    if (people.empty()) context.exitCode = kNotFound;
}

void show(Context& context, const std::vector<std::string>& names) {
    Json all = Json::array();
    for (size_t i = 0; i < names.size(); ++i) {
        const CXPersonRef person = findPerson(context.database(), names[i]);
        if (context.json)
            all.push_back(toJson(*person));
        else
            context.line((i > 0 ? "\n" : "") + personText(*person));
    }
    if (context.json) context.print(all.size() == 1 ? all[0] : all);
}

// add, edit, delete ------------------------------------------------------------------------------------------------

// `done` has a place for the name.
void tell(Context& context, CXPerson& person, const std::string& done) {
    if (context.json)
        context.print({{"identifier", person.uniqueId().str()}, {"name", person.displayName()}});
    else
        context.line(person.uniqueId().str());
    context.say(done);
}

void add(Context& context, const PersonFields& fields, const std::vector<std::string>& groups) {
    CXRolvane& database = context.database();
    std::vector<CXGroupRef> joined;
    for (const std::string& group : groups) joined.push_back(findChangeableGroup(database, group));
    const CXPersonRef person = CXPerson::create();
    fields.applyTo(*person);
    if (person->cxUsedProperties().empty())
        throw CommandError(kUsage,
                           translated("A contact needs at least one of the options that `rolvane add --help` lists."));
    database.addRecord(person);
    for (const CXGroupRef& group : joined) group->addMember(person);
    database.save();
    tell(context, *person, tr("{} added.", person->displayName()));
}

void edit(Context& context, const std::string& name, const PersonFields& fields) {
    const CXPersonRef person = findPerson(context.database(), name);
    requireWritable(*person);
    {
        const OneTurn turn(context.database()); // a list is changed as it was read
        fields.applyTo(*person);
    }
    const bool changed = context.database().hasUnsavedChanges();
    context.database().save();
    tell(context, *person,
         changed ? tr("{} changed.", person->displayName()) : tr("{} stays as it was.", person->displayName()));
}

// "Delete 1 person (Ada Miller)? 2 users who read your contacts lose it, too."
std::string deletionOf(CXRolvane& database, const std::vector<CXPersonRef>& people) {
    std::set<UniqueId> own;
    std::set<std::string> publishers;
    for (const CXPersonRef& person : people)
        if (person->isSubscribed())
            publishers.insert(publisherOf(person->remoteLocation()));
        else
            own.insert(person->uniqueId());
    std::string question = tr("Delete {}{}?", countedText(people.size(), "person", "people"),
                              people.size() == 1 ? fmt::format(" ({})", people[0]->displayName()) : "");
    for (const std::string& publisher : publishers)
        question += tr(" {} loses what you delete of theirs, too.", publisher);
    const Shown shown = shownToReaders(database);
    const bool seen =
        std::any_of(own.begin(), own.end(), [&](const UniqueId& uid) { return shown.people.contains(uid); });
    if (const size_t readers = Shares(database).readers().size(); seen && readers > 0)
        question += readers == 1 ? translated(" 1 user who reads your contacts loses it, too.")
                                 : tr(" {} users who read your contacts lose it, too.", shownNumber(readers));
    return question;
}

void remove(Context& context, const std::vector<std::string>& names, bool yes, bool purge) {
    CXRolvane& database = context.database();
    std::vector<CXPersonRef> people;
    for (const std::string& name : names) {
        const CXPersonRef person = findPerson(database, name, true);
        requireWritable(*person);
        const auto same = [&](const CXPersonRef& other) { return other->uniqueId() == person->uniqueId(); };
        if (std::none_of(people.begin(), people.end(), same)) people.push_back(person);
    }
    requireConsent(context, yes, deletionOf(database, people), translated("Nothing was deleted."));
    std::vector<UniqueId> deleted;
    for (const CXPersonRef& person : people) {
        deleted.push_back(person->uniqueId());
        database.removeRecord(person);
    }
    database.save();
    if (purge)
        for (const UniqueId& uid : deleted) CXHistory(database).forget(uid);
    context.say(tr("{} deleted.", countedText(people.size(), "person", "people")) +
                (purge ? "" : translated(" `rolvane undo` brings back.")));
}

} // namespace

void importFiles(Context& context, const std::vector<std::string>& files) {
    importCards(context, {files, {}, false});
}

void addContactCommands(CLI::App& app, Context& context) {
    const auto imports = std::make_shared<ImportOptions>();
    addCommand(
        app, context, "import", "Take contacts and groups from files of other programs",
        [&](CLI::App& command) {
            command
                .add_option("files", imports->files,
                            "vCards (2.1, 3.0 or 4.0), CSV of Google, Outlook or Thunderbird, LDIF of Thunderbird; "
                            "- reads standard input")
                ->type_name(kFileValue)
                ->required();
            command.add_option("--charset", imports->charset,
                               "Character set of text that is not UTF-8 and names none, such as WINDOWS-1252; without "
                               "it, such text is examined");
            command.add_flag("--dry-run", imports->dryRun, "Tell what would happen, and change nothing");
        },
        [&context, imports] { importCards(context, *imports); });

    const auto exports = std::make_shared<ExportOptions>();
    addCommand(
        app, context, "export", "Write contacts and groups as vCards",
        [&](CLI::App& command) {
            command.add_option("names", exports->names, "People, by name or identifier; without any, everything")
                ->type_name(kPersonValue);
            command.add_option("-g,--group", exports->group, "The members of this group, and its subgroups")
                ->type_name(kGroupValue);
            command.add_option("-o,--output", exports->output, "File to write; without it, standard output")
                ->type_name(kFileValue);
            command.add_option("--vcard", exports->version, "vCard version, 3 or 4")
                ->check(CLI::IsMember({"3", "4"}))
                ->capture_default_str();
        },
        [&context, exports] { exportCards(context, *exports); });

    const auto lists = std::make_shared<ListOptions>();
    addCommand(
        app, context, "list", "List people",
        [&](CLI::App& command) {
            command.add_option("text", lists->text,
                               "Only those with this text in name, organisation, mail, phone or note");
            command.add_option("-g,--group", lists->group, "Only members of this group")->type_name(kGroupValue);
            declareWhose(command, lists->whose);
            command.add_flag("--full", lists->full, "With the identifiers; with --json, every property");
        },
        [&context, lists] { list(context, *lists); });

    const auto words = std::make_shared<std::vector<std::string>>();
    const auto whole = std::make_shared<bool>();
    addCommand(
        app, context, "search", "Find people by words of name, organisation, mail, phone or note",
        [&](CLI::App& command) {
            command
                .add_option("words", *words,
                            "Each of them is in the person; letter case, accents and the spelling of a phone number do "
                            "not matter")
                ->required();
            command.add_flag("--full", *whole, "With the identifiers; with --json, every property");
        },
        [&context, words, whole] { search(context, *words, *whole); });

    const auto shown = std::make_shared<std::vector<std::string>>();
    addCommand(
        app, context, "show", "Show people with all they have",
        [&](CLI::App& command) {
            command.add_option("names", *shown, "Names or identifiers")->required()->type_name(kPersonValue);
        },
        [&context, shown] { show(context, *shown); });

    const auto added = std::make_shared<PersonFields>();
    const auto groups = std::make_shared<std::vector<std::string>>();
    addCommand(
        app, context, "add", "Add a person; prints the identifier",
        [&](CLI::App& command) {
            added->declare(command, false);
            command.add_option("-g,--group", *groups, "Make the person a member of this group")
                ->type_name(kGroupValue)
                ->allow_extra_args(false);
        },
        [&context, added, groups] { add(context, *added, *groups); });

    const auto edited = std::make_shared<PersonFields>();
    const auto named = std::make_shared<std::string>();
    addCommand(
        app, context, "edit", "Change a person; an empty text takes a field away",
        [&](CLI::App& command) {
            command.add_option("name", *named, "Name or identifier")->required()->type_name(kPersonValue);
            edited->declare(command, true);
        },
        [&context, edited, named] { edit(context, *named, *edited); });

    const auto deleted = std::make_shared<std::vector<std::string>>();
    const auto yes = std::make_shared<bool>(false), purge = std::make_shared<bool>(false);
    addCommand(
        app, context, "delete", "Delete people; a part of a name is not enough",
        [&](CLI::App& command) {
            command.add_option("names", *deleted, "Names or identifiers")->required()->type_name(kPersonValue);
            declareConsent(command, *yes);
            command.add_flag("--purge", *purge, "Keep nothing of them in the log either: they cannot be brought back");
        },
        [&context, deleted, yes, purge] { remove(context, *deleted, *yes, *purge); });
}

} // namespace rolvane::cli
