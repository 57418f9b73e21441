#include "Backup.h"

#include "Subscriptions.h"
#include "Texts.h"

#include "contacts/database/CXRolvane.h"
#include "contacts/database/DamagedDatabase.h"
#include "contacts/database/DatabaseCopy.h"
#include "contacts/database/DatabaseErrors.h"
#include "contacts/database/RecordStore.h"
#include "foundation/Paths.h"
#include "foundation/PropertyList.h"
#include "store/account/Account.h"
#include "store/account/CertificateChain.h"

#include <algorithm>
#include <array>
#include <filesystem>
#include <fmt/format.h>
#include <unistd.h>

namespace rolvane::cli {

namespace {

namespace fs = std::filesystem;

constexpr int64_t kFormat = 1;
constexpr const char* kManifest = "backup.plist";
constexpr const char* kDatabase = "contacts.db";
constexpr const char* kPreferences = "preferences.db";
constexpr const char* kAccount = "account.plist";
constexpr const char* kAuthority = "authority.pem";
constexpr const char* kWithdrawn = "withdrawn/"; // and a number with the kind of file
constexpr std::array kLogs{"-wal", "-shm", "-journal"};

std::string databasePath() {
    return dataDirectory() + "/contacts.db";
}
std::string preferencesPath() {
    return stateDirectory() + "/preferences.db";
}
std::string withdrawnDirectory() {
    return dataDirectory() + "/withdrawn";
}

// A directory for copies in the making, that goes with this object. One that an earlier process has left goes first.
class Workplace {
public:
    explicit Workplace(const std::string& parent) : _path(parent + "/backup." + makeUUID()) {
        removeLeftOnes(parent);
        CXPathUtils_MakeCompletePath(_path, 0700);
    }
    ~Workplace() {
        std::error_code ignored;
        fs::remove_all(_path, ignored);
    }
    Workplace(const Workplace&) = delete;
    Workplace& operator=(const Workplace&) = delete;
    std::string operator/(const std::string& name) const { return _path + "/" + name; }

private:
    static void removeLeftOnes(const std::string& parent) {
        constexpr auto kOld = std::chrono::hours(24);
        std::error_code error;
        for (fs::directory_iterator each(parent, error), end; !error && each != end; each.increment(error)) {
            std::error_code ignored;
            if (each->path().filename().string().starts_with("backup.") &&
                each->last_write_time(ignored) < fs::file_time_type::clock::now() - kOld)
                fs::remove_all(each->path(), ignored);
        }
    }
    const std::string _path;
};

struct Counts {
    size_t people = 0, groups = 0, subscriptions = 0;
    bool any() const { return people + groups + subscriptions > 0; }
};

// Opens the database of that path, and brings an older form up to date.
Counts countsOf(const std::string& path) {
    CXRolvane::Options options;
    options.path = path;
    CXRolvane database(options);
    Counts counts;
    counts.people = database.countPeople(RemoteLocation(""));
    counts.groups = database.listGroups(RemoteLocation("")).size();
    counts.subscriptions = subscriptionsToPeople(database).size();
    return counts;
}

std::string computerName() {
    std::array<char, 256> name{};
    return ::gethostname(name.data(), name.size() - 1) == 0 ? name.data() : "";
}

// The certificates alone: a private key that stands beside them in the file goes nowhere.
std::string certificatesOf(const std::string& file) {
    std::string text;
    for (const ShownCertificate& each : certificatesIn(readFile(file))) text += each.pem;
    return text;
}

// The files of a backup in the making, with the list of them.
class Making {
public:
    Making(const std::string& path, Date now) : _archive(path, static_cast<int64_t>(now.secondsSince1970())) {}

    void text(const std::string& name, const std::string& text) { note(name, _archive.addText(name, text)); }
    void file(const std::string& name, const std::string& path, const std::string& called = {}) {
        note(name, _archive.addFile(name, path));
        if (!called.empty()) _files.dictionaryFor(name).set("Name", called);
    }
    // Behind all others: a file that was cut off has none.
    void manifest(Dictionary facts) {
        facts.set("Files", _files);
        _archive.addText(kManifest, PropertyList::toXML(facts));
        _archive.finish();
    }
    const std::string& temporaryPath() const { return _archive.temporaryPath(); }
    void publish() { _archive.publish(); }

private:
    void note(const std::string& name, const ArchivedFile& file) {
        _files.set(name, Dictionary{{"Size", static_cast<int64_t>(file.size)}, {"SHA256", file.sha256}});
    }
    ArchiveWriter _archive;
    Dictionary _files;
};

void addAccount(Making& making, BackupFacts& facts, std::vector<std::string>& left) {
    try {
        const auto account = CXDAVAccount::load();
        if (!account) return;
        making.text(kAccount, PropertyList::toXML(account->dictionary()));
        if (!account->caFile.empty()) making.text(kAuthority, certificatesOf(account->caFile));
        facts.user = account->user.str();
    } catch (const CXException& error) {
        left.push_back(translated("The account is not in the backup. ") + error.reason());
    }
}

void addWithdrawn(Making& making, BackupFacts& facts) {
    std::vector<fs::path> files;
    std::error_code error;
    for (fs::directory_iterator each(withdrawnDirectory(), error), end; !error && each != end; each.increment(error))
        if (each->is_regular_file() && (each->path().extension() == ".vcf" || each->path().extension() == ".plist"))
            files.push_back(each->path());
    std::sort(files.begin(), files.end());
    for (const fs::path& file : files)
        making.file(fmt::format("{}{}{}", kWithdrawn, ++facts.withdrawn, file.extension().string()), file,
                    file.filename());
}

bool isPlainName(const std::string& name) {
    return !name.empty() && name.front() != '.' && name.find('/') == std::string::npos &&
           name.find('\0') == std::string::npos && (name.ends_with(".vcf") || name.ends_with(".plist"));
}

void removeLogs(const std::string& path) {
    std::error_code ignored;
    for (const char* suffix : kLogs) fs::remove(path + suffix, ignored);
}

// The log of the former file must never be taken for one of the new file's. So the former one goes first, whole with
// its log, and a moment of no file is a moment in which nobody may use the database.
void putInPlace(const std::string& made, const std::string& path) {
    std::error_code error;
    fs::remove(path, error);
    removeLogs(path);
    fs::rename(made, path, error);
    if (error)
        throw CXException(kCXFileException,
                          tr("{} could not be put in its place: {}. Restore again.", path, error.message()));
}

} // namespace

BackupFacts writeBackup(const std::string& path, std::vector<std::string>& left) {
    BackupFacts facts;
    facts.date = Clock::system().now();
    facts.computer = computerName();
    facts.version = ROLVANE_VERSION;
    const Workplace workplace(cacheDirectory());
    Making making(path, facts.date);
    // The preferences first. They hold what is still to be sent, and older ones send it twice rather than never.
    if (fs::exists(preferencesPath())) {
        copyDatabase(preferencesPath(), workplace / kPreferences);
        making.file(kPreferences, workplace / kPreferences);
        facts.hasPreferences = true;
    }
    if (fs::exists(databasePath())) {
        requireKnownDatabase({}, Preferences::shared());
        copyDatabase(databasePath(), workplace / kDatabase);
        making.file(kDatabase, workplace / kDatabase);
        const Counts counts = countsOf(workplace / kDatabase);
        facts.people = counts.people;
        facts.groups = counts.groups;
        facts.hasDatabase = true;
    } else {
        requireKnownDatabase({}, Preferences::shared());
    }
    addAccount(making, facts, left);
    addWithdrawn(making, facts);
    making.manifest({{"Format", kFormat},
                     {"Version", facts.version},
                     {"Date", facts.date},
                     {"Computer", facts.computer},
                     {"ConfigDirectory", configDirectory()},
                     {"People", static_cast<int64_t>(facts.people)},
                     {"Groups", static_cast<int64_t>(facts.groups)}});
    const Backup readBack(making.temporaryPath());
    facts.bytes = readBack.facts().bytes;
    making.publish();
    return facts;
}

Backup::Backup(const std::string& path) : _archive(path), _path(path) {
    _facts.bytes = fs::file_size(path);
    readManifest();
    _facts.hasDatabase = _archive.has(kDatabase);
    _facts.hasPreferences = _archive.has(kPreferences);
    if (_archive.has(kAccount)) {
        const Value account = PropertyList::fromXML(_archive.text(kAccount));
        _facts.user = CXDAVAccount::fromDictionary(account.dictionary()).user.str();
    }
    checkDatabase();
}

void Backup::readManifest() {
    const auto refuse = [&](const std::string& why) { throw CXException(kCXFileException, _path + " " + why); };
    if (!_archive.has(kManifest)) refuse(translated("is no backup: it has no list of its files."));
    const Dictionary manifest = PropertyList::fromXML(_archive.text(kManifest)).dictionary();
    _facts.version = manifest["Version"].string();
    if (manifest["Format"].integer() > kFormat)
        refuse(tr("was made by a later version ({}). Install that version, or a later one, and restore again.",
                  _facts.version));
    if (manifest["Format"].integer() < 1) refuse(translated("is no backup: its list of files has no format."));
    if (const auto date = manifest["Date"].date()) _facts.date = *date;
    _facts.computer = manifest["Computer"].string();
    _configDirectory = manifest["ConfigDirectory"].string();
    const Dictionary files = manifest["Files"].dictionary();
    for (const auto& [name, member] : _archive.members()) {
        if (name == kManifest) continue;
        const Dictionary listed = files[name].dictionary();
        if (listed["SHA256"].string() != member.sha256)
            refuse(tr("is damaged: \"{}\" is not what was saved. Use another backup.", name));
        if (name.starts_with(kWithdrawn)) {
            if (!isPlainName(listed["Name"].string()))
                refuse(tr("holds a file called \"{}\".", listed["Name"].string()));
            _withdrawn.emplace_back(name, listed["Name"].string());
        } else if (name != kDatabase && name != kPreferences && name != kAccount && name != kAuthority) {
            refuse(tr("holds \"{}\", which no backup has.", name));
        }
    }
    for (const auto& [name, listed] : files)
        if (!_archive.has(name)) refuse(tr("is damaged: \"{}\" is missing. Use another backup.", name));
    _facts.withdrawn = _withdrawn.size();
}

// In a copy, as opening a file of an earlier version changes it.
void Backup::checkDatabase() {
    const Workplace workplace(cacheDirectory());
    const auto wrong = [&](const std::string& what) {
        throw CXException(kCXFileException, tr("{} cannot be used. {}", _path, what));
    };
    try {
        if (_facts.hasDatabase) {
            _archive.extract(kDatabase, workplace / kDatabase);
            const Counts counts = countsOf(workplace / kDatabase);
            _facts.people = counts.people;
            _facts.groups = counts.groups;
            Sqlite database(workplace / kDatabase, 0, throwDatabaseError);
            if (const std::string found = RecordStore(database).whatIsWrong(); !found.empty())
                wrong(tr("Its contact database is damaged: {}.", found));
        }
        if (_facts.hasPreferences) {
            _archive.extract(kPreferences, workplace / kPreferences);
            (void)Preferences(workplace / kPreferences).domains();
        }
    } catch (const CXException& error) {
        if (error.reason().starts_with(_path)) throw;
        wrong(error.reason());
    }
}

void Backup::restore() {
    const Workplace data(dataDirectory()), state(stateDirectory());
    if (_facts.hasDatabase) _archive.extract(kDatabase, data / kDatabase);
    if (_facts.hasPreferences) _archive.extract(kPreferences, state / kPreferences);
    restoreWithdrawn();
    // The account before the database: contacts without the account wait, and an account without contacts may be
    // taken for a publication that has ended.
    restoreAccount();
    if (_facts.hasPreferences) putInPlace(state / kPreferences, preferencesPath());
    if (!_facts.hasDatabase) return;
    removeLogs(databasePath() + ".books");
    std::error_code ignored;
    fs::remove(databasePath() + ".books", ignored); // what it remembers belongs to the former database
    putInPlace(data / kDatabase, databasePath());
}

void Backup::restoreWithdrawn() {
    if (_withdrawn.empty()) return;
    CXPathUtils_MakeCompletePath(withdrawnDirectory(), 0700);
    for (const auto& [member, name] : _withdrawn)
        if (const std::string path = withdrawnDirectory() + "/" + name; !fs::exists(path))
            writeFileDurably(path, _archive.text(member, 1U << 30));
}

void Backup::restoreAccount() {
    if (!_archive.has(kAccount)) return;
    auto account = CXDAVAccount::fromDictionary(PropertyList::fromXML(_archive.text(kAccount)).dictionary());
    if (!account.caFile.empty() && !fs::exists(account.caFile)) {
        if (!_archive.has(kAuthority))
            throw CXException(kCXFileException, tr("{} has an account without its authority.", _path));
        const std::string pem = _archive.text(kAuthority);
        const auto chain = certificatesIn(pem);
        std::string name = chain.empty() ? "restored" : chain.front().fingerprint.substr(0, 23);
        std::erase(name, ':');
        account.caFile = configDirectory() + "/authority-" + name + ".pem";
        writeFileDurably(account.caFile, pem);
    }
    // A password file beside the account is beside it here, too.
    if (account.passwordSource.kind == PasswordSource::Kind::file &&
        account.passwordSource.value == _configDirectory + "/password")
        account.passwordSource.value = configDirectory() + "/password";
    account.save();
}

std::string whatIsHere() {
    std::vector<std::string> parts;
    if (fs::exists(databasePath())) {
        try { // opening an empty file would make a database of it
            if (fs::file_size(databasePath()) == 0) throw CXException(kCXDatabaseException, "It is empty.");
            const Counts counts = countsOf(databasePath());
            if (counts.any()) {
                parts.push_back(countedText(counts.people, "person", "people"));
                parts.push_back(countedText(counts.groups, "group", "groups"));
            }
            if (counts.subscriptions > 0)
                parts.push_back(countedText(counts.subscriptions, "subscription", "subscriptions"));
        } catch (const CXException&) {
            parts.emplace_back(translated("a contact database that cannot be read"));
        }
    }
    try {
        if (const auto account = CXDAVAccount::load()) parts.push_back(tr("the account of {}", account->user.str()));
    } catch (const CXException&) {
        parts.emplace_back(translated("an account that cannot be read"));
    }
    std::string text;
    for (size_t i = 0; i < parts.size(); ++i)
        text += (i == 0 ? "" : i + 1 == parts.size() ? translated(" and ") : ", ") + parts[i];
    return text;
}

std::string keepWhatIsHere(Date now) {
    std::string name = now.toISO8601();
    std::replace(name.begin(), name.end(), ':', '-');
    const std::string directory = dataDirectory() + "/replaced";
    CXPathUtils_MakeCompletePath(directory, 0700);
    std::string place = directory + "/" + name + ".rolvane";
    for (int i = 2; fs::exists(place); ++i) place = fmt::format("{}/{}-{}.rolvane", directory, name, i);
    std::vector<std::string> left;
    try {
        writeBackup(place, left);
        if (left.empty()) return place;
    } catch (const CXException&) { // the files themselves then
        left.emplace_back();
    }
    const std::string files = place.substr(0, place.size() - std::string(".rolvane").size());
    CXPathUtils_MakeCompletePath(files, 0700);
    for (const std::string& path : {databasePath(), preferencesPath(), CXDAVAccount::defaultPath()})
        for (const char* suffix : {"", "-wal", "-shm", "-journal"})
            if (fs::exists(path + suffix))
                fs::copy_file(path + suffix, files + "/" + fs::path(path + suffix).filename().string());
    return files;
}

} // namespace rolvane::cli
