// Files in the manner of ten programs: import, export, import loses nothing that is not said, and two validators that
// know nothing of this program find every exported card valid.

#include "TestDatabase.h"
#include "VCardGenerators.h"

#include "contacts/vcard/VCardExport.h"
#include "contacts/vcard/VCardImport.h"
#include "contacts/vcard/VCardText.h"
#include "foundation/PropertyList.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <map>
#include <set>
#include <sstream>

namespace rolvane {
namespace {

using test::TestDatabase;
using vcardtest::withoutIdentifiers;

std::vector<std::string> files() {
    std::vector<std::string> all;
    for (const auto& entry : std::filesystem::directory_iterator(ROLVANE_SOURCE_DIR "/tests/contacts/cards"))
        all.push_back(entry.path());
    std::sort(all.begin(), all.end());
    return all;
}

std::string nameOf(const std::string& path) {
    return std::filesystem::path(path).filename();
}

std::string exported(CXRolvane& database, VCardVersion version) {
    std::ostringstream out;
    VCardExport(database, out, version).exportAll();
    return out.str();
}

VCardImportReport importText(CXRolvane& database, const std::string& text) {
    VCardImport import(database);
    std::istringstream in(text);
    import.addStream(in, "text.vcf", text.size());
    return import.finish();
}

Value wholeOf(CXRolvane& database) {
    Dictionary all;
    database.forEachPersonModifiedSince(Date::distantPast(), kCXPersonTable, [&](const CXRow& row) {
        all.set(row.uniqueId.str(), withoutIdentifiers(BinaryValue::decode(*row.encoded).dictionary()));
    });
    for (const auto& listing : database.listGroups(RemoteLocation(""))) {
        auto group = std::dynamic_pointer_cast<CXGroup>(database.recordForUniqueId(listing.uniqueId));
        Array members;
        for (const auto& uid : test::texts(group->memberUniqueIds())) members.append(uid);
        all.set(listing.uniqueId.str(), Dictionary{{"members", members}, {"all", group->dictionaryRepresentation()}});
    }
    return all;
}

// A text as it can be looked for: without letter case, folds, escapes, and the signs that dates are written with.
std::string plain(std::string text) {
    for (const char* fold : {"\r\n ", "\n "})
        for (size_t at; (at = text.find(fold)) != std::string::npos;) text.erase(at, std::string_view(fold).size());
    text = vcardUnescape(vcardUnescape(text));
    std::erase_if(text, [](char c) { return c == '-' || c == '\\' || c == '"'; });
    return vcardLower(text);
}

// Words of the source, taken from its physical text by rules of the test's own.
std::set<std::string> wordsOf(const VCardLine& line) {
    std::set<std::string> words;
    std::string text = plain(line.value);
    if (line.name == "BDAY" && text.starts_with("1604"))
        text.erase(0, 4); // the filling of a year, which 4.0 leaves out
    for (char& c : text)
        if (std::string_view(";,\n\r\t :").find(c) != std::string_view::npos) c = ' ';
    std::istringstream in(text);
    for (std::string word; in >> word;) words.insert(word);
    for (const auto& type : line.types())
        if (type != "pref") words.insert(plain(type));
    return words;
}

// What goes another way into the other form, or says nothing of a person. Each is looked at by a test of its own.
bool isSaidOtherwise(const VCardLine& line) {
    for (const char* name : {"PRODID", "REV", "X-ROLVANE-UNREAD"}) // an unread line is compared whole
        if (line.name == name) return true;
    if (line.name == "KIND" && line.value == "individual") return true; // so is a card without it
    return line.name == "X-ABLABEL"; // labels are words of ours: LabelsOfTelephonesAreRead
}

std::string contentsOf(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), {}};
}

// Cards of programs that know no UID carry the words of their file into both versions.
void expectWordsIn(const std::string& path, const std::string& exportedText, const VCardImportReport& report) {
    ImportSource source = ImportSource::ofFile(path);
    VCardScanner scanner(source.text(), path, [](const VCardError& e) { ADD_FAILURE() << e.description(); });
    if (!report.foreign.empty()) scanner.setFallbackCharset(report.foreign[0].charset);
    const std::string text = plain(exportedText);
    size_t looked = 0;
    while (auto card = scanner.next())
        for (const auto& line : card->lines) {
            if (isSaidOtherwise(line)) continue;
            if (line.firstValueOf("ENCODING") != "" || line.value.starts_with("data:")) { // bytes
                std::string bytes = plain(line.value.substr(line.value.find(',') + 1));
                std::erase(bytes, ' '); // of folds
                const bool damaged = report.noticeCount > 0;
                EXPECT_TRUE(damaged || text.find(bytes) != std::string::npos) << nameOf(path) << " " << line.name;
                continue;
            }
            for (const auto& word : wordsOf(line)) {
                looked++;
                EXPECT_NE(text.find(word), std::string::npos) << nameOf(path) << " " << line.name << ": " << word;
            }
        }
    EXPECT_GT(looked, 3u) << path;
}

// Files that have something to be said of them, and what.
const std::map<std::string, size_t> kNotices{{"android-3.vcf", 1}, {"erp-5.vcf", 1}, {"erp-6.vcf", 1}};

TEST(VCardCorpus, NothingIsLostUnsaidBetweenImportExportAndImport) {
    ASSERT_GE(files().size(), 60u);
    for (const std::string& path : files()) {
        TestDatabase db;
        const auto report = VCardImport::importFile(*db, path);
        EXPECT_EQ(report.errorCount, 0u) << path;
        EXPECT_GE(report.imported + report.groups, 1u) << path;
        EXPECT_EQ(report.linesLost, 0u) << path;
        const auto wanted = kNotices.find(nameOf(path));
        EXPECT_EQ(report.noticeCount, wanted == kNotices.end() ? 0u : wanted->second) << path;
        const Value before = wholeOf(*db);
        const int64_t position = db->journalPosition();
        const auto twice = VCardImport::importFile(*db, path);
        EXPECT_EQ(twice.imported + twice.updated, 0u) << path;
        EXPECT_EQ(db->journalPosition(), position) << path << " changes something the second time";
        for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
            const std::string text = exported(*db, version);
            TestDatabase copy;
            const auto again = importText(*copy, text);
            EXPECT_EQ(again.errorCount + again.noticeCount, 0u) << path;
            EXPECT_EQ(wholeOf(*copy), before) << path << "\n" << text;
            if (path.ends_with(".vcf")) expectWordsIn(path, text, report);
        }
    }
}

// Of a table every cell that says something, of LDIF every value.
TEST(VCardCorpus, EveryCellOfATableIsSomewhereInTheCards) {
    for (const char* name : {"google-7.csv", "outlook-7.csv", "thunderbird-5.csv"}) {
        const std::string path = std::string(ROLVANE_SOURCE_DIR "/tests/contacts/cards/") + name;
        TestDatabase db;
        VCardImport::importFile(*db, path);
        const std::string text = plain(exported(*db, VCardVersion::v4));
        auto rows = contentsOf(path);
        size_t looked = 0;
        rows.erase(0, rows.find('\n')); // the header
        for (char& c : rows)
            if (std::string_view(",\r\n\":*").find(c) != std::string_view::npos) c = ' ';
        std::istringstream in(rows);
        const std::set<std::string> saysNothing{"SMTP",   "Unspecified",     "Normal",     "False",
                                                "0/0/00", "(bo@forge.test)", "myContacts", "12/31/1970",
                                                "Delve",  "Mobile"};
        for (std::string word; in >> word;) {
            if (saysNothing.contains(word) || word.size() < 3) continue;
            for (const auto& part : vcardSplit(word, ';')) {
                looked++;
                EXPECT_NE(text.find(plain(std::string(part))), std::string::npos) << name << ": " << part;
            }
        }
        EXPECT_GT(looked, 25u) << name;
    }
}

TEST(VCardCorpus, TablesAndLdifGiveThePeopleThatTheyHold) {
    const std::string directory = ROLVANE_SOURCE_DIR "/tests/contacts/cards/";
    TestDatabase db;
    VCardImport import(*db);
    for (const char* name : {"google-7.csv", "outlook-7.csv", "thunderbird-5.csv", "thunderbird-6.ldif"})
        import.addFile(directory + name);
    const auto report = import.finish();
    EXPECT_EQ(report.imported, 5u);
    EXPECT_EQ(report.intoTheNote.size(), 4u);
    EXPECT_EQ(report.missingMembers, 1u);
    const auto all = [&](const char* name, const char* property) {
        std::string out;
        for (const auto& listing : db->listPeople(RemoteLocation(""), name)) {
            auto person = std::dynamic_pointer_cast<CXPerson>(db->recordForUniqueId(listing.uniqueId));
            if (const auto values = person->multiValueForProperty(property))
                for (const auto& e : values->entries())
                    out += e.label + "=" +
                           (e.value.isDate() ? e.value.date()->toISO8601().substr(0, 10) : e.value.string()) + " ";
            const Value single = person->valueForProperty(property);
            if (single.isDate()) out += single.date()->toISO8601().substr(0, 10);
            if (single.isString()) out += single.string();
        }
        return out;
    };
    EXPECT_EQ(all("Ximena", kCXEmailProperty), "Home=xi@mail.test Home=xi2@mail.test Work=xi@quarry.test ");
    EXPECT_EQ(all("Ximena", kCXOtherDatesProperty), "Anniversary=2004-05-06 ");
    EXPECT_EQ(all("Ximena", kCXBirthdayProperty), "1979-08-09");
    EXPECT_EQ(all("Ilić", kCXPhoneProperty), "WorkFax=555-0701 Work=555-0702 Home=555-0703 Mobile=555-0704 ");
    EXPECT_EQ(all("Ilić", kCXBirthdayProperty), "1970-12-31");
    EXPECT_EQ(all("Ilić", kCXNoteProperty), "hammer\nand tongs\nHobby: curling");
    EXPECT_EQ(all("Odalys", kCXBirthdayProperty), "1981-04-05");
    EXPECT_EQ(all("Tjark", kCXBirthdayTextProperty), "--0607");
    EXPECT_EQ(all("Maeve", kCXNoteProperty), "räted\nwell\nmozillacustom1: a custom word");
}

TEST(VCardCorpus, TwoValidatorsOfOthersFindEveryExportedCardValid) {
    TestDatabase db;
    VCardImport import(*db);
    for (const std::string& path : files()) import.addFile(path);
    import.addFile(ROLVANE_SOURCE_DIR "/share/demo/people.vcf");
    import.finish();
    for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
        const std::string path = db.directory / (version == VCardVersion::v3 ? "3.vcf" : "4.vcf");
        std::ofstream(path, std::ios::binary) << exported(*db, version);
        for (const std::string& validator :
             {std::string("php " ROLVANE_SOURCE_DIR "/tests/contacts/validate.php"),
              std::string("/usr/bin/python3 " ROLVANE_SOURCE_DIR "/tests/contacts/validate.py")}) {
            FILE* pipe = ::popen((validator + " " + path + " 2>&1").c_str(), "r");
            ASSERT_NE(pipe, nullptr);
            std::string said;
            for (int c; (c = std::fgetc(pipe)) != EOF;) said += static_cast<char>(c);
            EXPECT_EQ(::pclose(pipe), 0) << validator << "\n" << said;
        }
    }
}

} // namespace
} // namespace rolvane
