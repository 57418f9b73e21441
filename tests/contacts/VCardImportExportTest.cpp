#include "TestDatabase.h"
#include "VCardFiles.h"
#include "VCardGenerators.h"

#include "contacts/vcard/VCardExport.h"
#include "contacts/vcard/VCardFields.h"
#include "contacts/vcard/VCardImport.h"
#include "foundation/PropertyList.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>

namespace rolvane {
namespace {

using test::TestDatabase;
using vcardtest::card;
using vcardtest::exportAll;
using vcardtest::importText;
using vcardtest::withoutIdentifiers;

const std::string kDemo = ROLVANE_SOURCE_DIR "/share/demo/";

std::string uuid(int n) {
    char text[40];
    std::snprintf(text, sizeof text, "00000000-0000-4000-8000-%012d", n);
    return text;
}

std::string person(int n, const std::string& lines = "") {
    return card("UID:urn:uuid:" + uuid(n) + "\r\nFN:P" + std::to_string(n) + "\r\n" + lines);
}

CXPersonRef personAt(CXRolvane& database, const std::string& id) {
    return std::dynamic_pointer_cast<CXPerson>(database.recordForUniqueId(UniqueId(id + ":CXPerson")));
}

CXGroupRef groupNamed(CXRolvane& database, const std::string& name) {
    for (const auto& listing : database.listGroups(RemoteLocation("")))
        if (listing.displayName == name)
            return std::dynamic_pointer_cast<CXGroup>(database.recordForUniqueId(listing.uniqueId));
    return nullptr;
}

std::string errorsOf(const VCardImportReport& report) {
    std::string all;
    for (const auto& e : report.errors) all += e.description() + "\n";
    return all;
}

// Everything a person can see of a database, as one value: what must be equal after export and import. Choices are
// named by what they choose, because identifiers of entries belong to one database.
Value wholeOf(CXRolvane& database) {
    Dictionary people, groups;
    database.forEachPersonModifiedSince(Date::distantPast(), kCXPersonTable, [&](const CXRow& row) {
        people.set(row.uniqueId.str(), withoutIdentifiers(BinaryValue::decode(*row.encoded).dictionary()));
    });
    for (const auto& listing : database.listGroups(RemoteLocation(""))) {
        auto group = std::dynamic_pointer_cast<CXGroup>(database.recordForUniqueId(listing.uniqueId));
        Dictionary all = group->dictionaryRepresentation(), choices;
        Array members, subgroups;
        for (const auto& m : group->memberUniqueIds()) members.append(m);
        for (const auto& s : group->subgroupUniqueIds()) subgroups.append(s);
        for (const auto& [uid, chosen] : group->distributionChoices())
            for (const auto& [property, identifier] : chosen) {
                auto multi = personAt(database, std::string(cxUUIDPart(uid)))->multiValueForProperty(property);
                choices.set(uid.str() + " " + property, Array{multi->labelForIdentifier(identifier).value_or("?"),
                                                              multi->valueForIdentifier(identifier)});
            }
        all.set("members", members);
        all.set("subgroups", subgroups);
        all.set("choices", choices);
        groups.set(listing.uniqueId.str(), all);
    }
    return Dictionary{{"people", people}, {"groups", groups}};
}

// Where two such values differ first, for people to read.
std::string firstDifference(const Value& a, const Value& b) {
    for (const char* kind : {"people", "groups"}) {
        Dictionary da = a.dictionary()[kind].dictionary(), db = b.dictionary()[kind].dictionary();
        for (const auto& [key, value] : da)
            if (!(db[key] == value)) return key + "\n" + value.description() + "\n" + db[key].description();
        if (da.count() != db.count()) return std::string(kind) + " differ in number";
    }
    return "";
}

TEST(VCardImport, PeopleGoInWithTheirIdentifiers) {
    TestDatabase db;
    auto report = importText(*db, person(1, "TEL;TYPE=home:1\r\n") + card("FN:No UID\r\n"));
    EXPECT_EQ(report.imported, 2u);
    EXPECT_EQ(report.errorCount, 0u) << errorsOf(report);
    EXPECT_FALSE(db->hasUnsavedChanges());
    ASSERT_TRUE(personAt(*db, uuid(1)));
    EXPECT_EQ(personAt(*db, uuid(1))->multiValueForProperty(kCXPhoneProperty)->valueAtIndex(0).string(), "1");
    EXPECT_EQ(db->countPeople(RemoteLocation("")), 2u);
}

TEST(VCardImport, AnImportIsOneSave) {
    TestDatabase db;
    importText(*db, person(1) + person(2) +
                        card("X-ROLVANE-KIND:group\r\nFN:G\r\nX-ROLVANE-MEMBER:urn:uuid:" + uuid(1) + "\r\n"));
    auto entries = db->journalEntries(0);
    ASSERT_FALSE(entries.empty());
    for (const auto& e : entries) EXPECT_EQ(e.date, entries.front().date);
}

TEST(VCardImport, ImportingAgainUpdatesThroughTheMergerAndLosesNothing) {
    TestDatabase db;
    importText(*db, person(1, "TEL;TYPE=home:1\r\nNOTE:old\r\nTITLE:kept\r\n"));
    std::string identifier = personAt(*db, uuid(1))->multiValueForProperty(kCXPhoneProperty)->identifierAtIndex(0);
    auto report = importText(*db, person(1, "TEL;TYPE=work:2\r\nTEL;TYPE=home:1\r\nNOTE:new\r\n"));
    EXPECT_EQ(report.updated, 1u);
    EXPECT_EQ(report.imported, 0u);
    auto p = personAt(*db, uuid(1));
    auto phones = p->multiValueForProperty(kCXPhoneProperty);
    ASSERT_EQ(phones->count(), 2u);
    EXPECT_EQ(phones->identifierAtIndex(0), identifier);
    EXPECT_EQ(phones->valueAtIndex(1).string(), "2");
    EXPECT_EQ(p->valueForProperty(kCXNoteProperty).string(), "new");
    EXPECT_EQ(p->valueForProperty(kCXJobTitleProperty).string(), "kept");
}

TEST(VCardImport, ImportingTheSameFileTwiceChangesNothing) {
    TestDatabase db;
    std::string text = person(1, "TEL;TYPE=home:1\r\nCATEGORIES:A\r\n") + person(2, "X-FOO:1\r\n");
    importText(*db, text);
    int64_t position = db->journalPosition();
    auto report = importText(*db, text);
    EXPECT_EQ(report.unchanged, 2u);
    EXPECT_EQ(db->journalPosition(), position);
}

TEST(VCardImport, AUIDThatIsNoUUIDIsFoundAgainAndCarried) {
    TestDatabase db;
    std::string text = card("UID:pas-id-17\r\nFN:Jo\r\n");
    EXPECT_EQ(importText(*db, text).imported, 1u);
    EXPECT_EQ(importText(*db, text).unchanged, 1u);
    EXPECT_EQ(db->countPeople(RemoteLocation("")), 1u);
    EXPECT_NE(exportAll(*db, VCardVersion::v4).find("UID:pas-id-17\r\n"), std::string::npos);
    EXPECT_EQ(exportAll(*db, VCardVersion::v4).find("urn:uuid"), std::string::npos);
}

TEST(VCardImport, GroupsMayStandBeforeTheirMembersAndInAnotherFile) {
    TestDatabase db;
    VCardImport import(*db);
    std::istringstream first(card("KIND:group\r\nUID:urn:uuid:" + uuid(9) +
                                      "\r\nFN:Choir\r\nMEMBER:urn:uuid:" + uuid(1) + "\r\nMEMBER:urn:uuid:" + uuid(2) +
                                      "\r\nMEMBER:urn:uuid:" + uuid(3) + "\r\n",
                                  "4.0"));
    std::istringstream second(person(2) + person(1));
    import.addStream(first, "groups.vcf");
    import.addStream(second, "people.vcf");
    auto report = import.finish();
    EXPECT_EQ(report.groups, 1u);
    EXPECT_EQ(report.missingMembers, 1u);
    auto members = groupNamed(*db, "Choir")->memberUniqueIds();
    EXPECT_EQ(test::texts(members), (std::vector<std::string>{uuid(1) + ":CXPerson", uuid(2) + ":CXPerson"}));
}

TEST(VCardImport, MembersAreFoundWhateverTheLetterCaseOfTheirUUID) {
    TestDatabase db;
    std::string id = "ABCDEF00-0000-4000-8000-000000000001", lower = "abcdef00-0000-4000-8000-000000000001";
    importText(*db, card("UID:urn:uuid:" + id + "\r\nFN:x\r\n") +
                        card("X-ROLVANE-KIND:group\r\nFN:G\r\nX-ROLVANE-MEMBER:urn:uuid:" + lower + "\r\n"));
    EXPECT_EQ(groupNamed(*db, "G")->memberCount(), 1u);
    EXPECT_EQ(importText(*db, card("UID:" + lower + "\r\nFN:x\r\n")).imported, 0u);
}

TEST(VCardImport, CategoriesAreMembershipAndAnEscapedCommaIsPartOfTheName) {
    TestDatabase db;
    importText(*db, person(1, "CATEGORIES:Family,Choir\\, old\r\n") + person(2, "CATEGORIES:Family\r\n"));
    ASSERT_TRUE(groupNamed(*db, "Family") && groupNamed(*db, "Choir, old"));
    EXPECT_EQ(groupNamed(*db, "Family")->memberCount(), 2u);
    EXPECT_EQ(groupNamed(*db, "Choir, old")->memberCount(), 1u);
    EXPECT_EQ(db->listGroups(RemoteLocation("")).size(), 2u);
    EXPECT_FALSE(personAt(*db, uuid(1))->valueForProperty(kCXCategoriesProperty));
}

TEST(VCardImport, ACategoryOfAGroupCardIsThatGroup) {
    TestDatabase db;
    importText(*db, person(1, "CATEGORIES:Choir\r\n") +
                        card("X-ROLVANE-KIND:group\r\nUID:urn:uuid:" + uuid(9) + "\r\nFN:Choir\r\n"));
    EXPECT_EQ(db->listGroups(RemoteLocation("")).size(), 1u);
    EXPECT_EQ(groupNamed(*db, "Choir")->memberCount(), 1u);
}

TEST(VCardImport, ACategoryIsSatisfiedByAnyGroupOfThatName) {
    TestDatabase db;
    auto one = db.addGroup("Twin"), two = db.addGroup("Twin");
    auto p = db.addPerson("x");
    two->addMember(p);
    db->save();
    importText(*db, exportAll(*db, VCardVersion::v4));
    EXPECT_EQ(one->memberCount(), 0u);
    EXPECT_EQ(two->memberCount(), 1u);
}

TEST(VCardImport, SubgroupsAndDistributionChoicesComeIn) {
    TestDatabase db;
    std::string inner = "urn:uuid:" + uuid(8), outer = "urn:uuid:" + uuid(9);
    auto report = importText(
        *db, card("X-ROLVANE-KIND:group\r\nUID:" + outer + "\r\nFN:Outer\r\nX-ROLVANE-SUBGROUP:" + inner +
                  "\r\nX-ROLVANE-MEMBER:urn:uuid:" + uuid(1) + "\r\nX-ROLVANE-CHOICE;X-MEMBER=\"urn:uuid:" + uuid(1) +
                  "\";X-PROPERTY=Email;X-LABEL=Work:w@b.test\r\n") +
                 card("X-ROLVANE-KIND:group\r\nUID:" + inner + "\r\nFN:Inner\r\n") +
                 person(1, "EMAIL;TYPE=home:w@b.test\r\nEMAIL;TYPE=work:w@b.test\r\n"));
    EXPECT_EQ(report.errorCount, 0u) << errorsOf(report);
    auto group = groupNamed(*db, "Outer");
    EXPECT_EQ(test::texts(group->subgroupUniqueIds()), (std::vector<std::string>{uuid(8) + ":CXGroup"}));
    auto p = personAt(*db, uuid(1));
    auto chosen = group->distributionIdentifierForProperty(kCXEmailProperty, p);
    ASSERT_TRUE(chosen);
    EXPECT_EQ(p->multiValueForProperty(kCXEmailProperty)->labelForIdentifier(*chosen), "Work");
}

TEST(VCardImport, AMemberThatIsAGroupIsASubgroup) {
    TestDatabase db;
    importText(
        *db,
        card("KIND:group\r\nUID:urn:uuid:" + uuid(9) + "\r\nFN:Outer\r\nMEMBER:urn:uuid:" + uuid(8) + "\r\n", "4.0") +
            card("KIND:group\r\nUID:urn:uuid:" + uuid(8) + "\r\nFN:Inner\r\n", "4.0"));
    EXPECT_EQ(groupNamed(*db, "Outer")->subgroupUniqueIds().size(), 1u);
}

TEST(VCardImport, ProgressTellsBytesAndCardsAndEndsAtTheTotal) {
    TestDatabase db;
    std::string text;
    for (int i = 0; i < 3000; i++) text += person(i, "NOTE:some words to make the card longer than it would be\r\n");
    std::vector<VCardProgress> seen;
    VCardImport import(*db, [&](const VCardProgress& p) { seen.push_back(p); });
    std::istringstream in(text);
    import.addStream(in, "text.vcf", text.size());
    ASSERT_GT(seen.size(), 3u);
    for (size_t i = 1; i < seen.size(); i++) EXPECT_GE(seen[i].bytesDone, seen[i - 1].bytesDone);
    EXPECT_EQ(seen.back().bytesDone, text.size());
    EXPECT_EQ(seen.back().bytesTotal, text.size());
    EXPECT_EQ(seen.back().cards, 3000u);
}

TEST(VCardImport, AFileThatCannotBeReadIsOneClearException) {
    TestDatabase db;
    for (const std::string& path : {db.directory / "missing.vcf", std::string(ROLVANE_SOURCE_DIR)}) {
        try {
            VCardImport::importFile(*db, path);
            ADD_FAILURE() << "nothing was thrown for " << path;
        } catch (const CXException& e) {
            EXPECT_EQ(e.name(), kCXVCardException);
            EXPECT_NE(e.reason().find(path), std::string::npos);
        }
    }
}

TEST(VCardImport, AnEndlessLineCostsThatLineOnly) {
    TestDatabase db;
    auto report =
        importText(*db, person(1) + card("FN:endless\r\nNOTE:" + std::string(65 << 20, 'x') + "\r\n") + person(2));
    EXPECT_EQ(report.imported, 3u);
    EXPECT_EQ(report.errorCount, 0u);
    EXPECT_EQ(report.linesLost, 1u);
    ASSERT_EQ(report.notices.size(), 1u);
    EXPECT_EQ(report.notices[0].description(),
              "text.vcf:9: the line is longer than 64 MB; it was left out of the card of endless");
}

TEST(VCardImport, APhotoOfThirtyMegabytesIsReadAgain) {
    TestDatabase db;
    auto p = db.addPerson("Ann");
    p->setValue(Value(Bytes(30 << 20, 7)), kCXPhotoProperty);
    db->save();
    TestDatabase copy;
    auto report = importText(*copy, exportAll(*db, VCardVersion::v4));
    EXPECT_EQ(report.imported, 1u);
    EXPECT_EQ(report.noticeCount + report.errorCount, 0u);
    auto again = std::dynamic_pointer_cast<CXPerson>(copy->recordForUniqueId(p->uniqueId()));
    ASSERT_TRUE(again);
    EXPECT_EQ(again->valueForProperty(kCXPhotoProperty).data().size(), size_t(30 << 20));
}

struct Broken {
    const char* file;
    size_t imported;
    std::vector<std::pair<size_t, std::string>> errors;  // line, and a part of the reason
    std::vector<std::pair<size_t, std::string>> notices; // the same for cards that went in all the same
};

void expectNamed(const std::vector<VCardError>& named, const std::vector<std::pair<size_t, std::string>>& wanted,
                 const std::string& path) {
    std::string all;
    for (const auto& e : named) all += e.description() + "\n";
    ASSERT_EQ(named.size(), wanted.size()) << all;
    for (size_t i = 0; i < named.size(); i++) {
        EXPECT_EQ(named[i].file, path);
        EXPECT_EQ(named[i].line, wanted[i].first) << all;
        EXPECT_NE(named[i].reason.find(wanted[i].second), std::string::npos) << all;
    }
}

class VCardBrokenFile : public ::testing::TestWithParam<Broken> {};

TEST_P(VCardBrokenFile, NamesEachBadCardAndTakesTheGoodOnes) {
    TestDatabase db;
    std::string path = kDemo + "broken/" + GetParam().file;
    auto report = VCardImport::importFile(*db, path);
    EXPECT_EQ(report.imported, GetParam().imported);
    EXPECT_EQ(db->countPeople(RemoteLocation("")), GetParam().imported);
    expectNamed(report.errors, GetParam().errors, path);
    expectNamed(report.notices, GetParam().notices, path);
}

INSTANTIATE_TEST_SUITE_P(
    Samples, VCardBrokenFile,
    ::testing::Values(
        Broken{"truncated.vcf", 1, {{7, "the file ends inside it"}}, {}}, Broken{"latin-1.vcf", 3, {}, {}},
        Broken{"nested-begin.vcf", 3, {{7, "another one begins inside"}, {16, "belongs to no card"}}, {}},
        Broken{"missing-end.vcf", 1, {{1, "another one begins inside"}, {10, "the file ends"}}, {}},
        Broken{"bad-base64.vcf", 3, {}, {{10, "base64 is damaged"}}}, Broken{"no-colon.vcf", 3, {}, {{10, "no colon"}}},
        Broken{"open-quote.vcf", 2, {}, {{4, "closing quotation mark"}}},
        Broken{"nul-byte.vcf", 2, {}, {{3, "control character"}}}, Broken{"unknown-version.vcf", 1, {{2, "9.9"}}, {}},
        Broken{"no-cards.vcf", 0, {{1, "belongs to no card"}}, {}}, Broken{"empty-card.vcf", 1, {{1, "empty"}}, {}},
        Broken{"nameless-group.vcf", 1, {{1, "no name"}}, {}}, Broken{"damaged-value.vcf", 2, {}, {{4, "Phone"}}},
        Broken{"cyclic-groups.vcf", 1, {{8, "subgroup"}}, {}}, Broken{"utf-16.vcf", 1, {}, {}}),
    [](const auto& param) {
        std::string name = param.param.file;
        for (char& c : name)
            if (!std::isalnum(static_cast<unsigned char>(c))) c = '_';
        return name;
    });

TEST(VCardExport, AGroupGoesWithItsMembersAndSubgroupsAndNothingElse) {
    TestDatabase db;
    auto outer = db.addGroup("Outer"), inner = db.addGroup("Inner"), other = db.addGroup("Other");
    auto a = db.addPerson("A"), b = db.addPerson("B"), c = db.addPerson("C");
    outer->addMember(a);
    outer->addSubgroup(inner);
    inner->addMember(b);
    inner->addMember(a);
    other->addMember(c);
    db->save();
    std::ostringstream out;
    EXPECT_EQ(VCardExport(*db, out, VCardVersion::v3).exportGroup(outer), 4u);
    TestDatabase copy;
    auto report = importText(*copy, out.str());
    EXPECT_EQ(report.imported, 2u);
    EXPECT_EQ(report.errorCount + report.missingMembers, 0u) << errorsOf(report);
    EXPECT_EQ(groupNamed(*copy, "Outer")->subgroupUniqueIds().size(), 1u);
    EXPECT_EQ(groupNamed(*copy, "Inner")->memberCount(), 2u);
    EXPECT_FALSE(groupNamed(*copy, "Other"));
}

TEST(VCardExport, ChosenRecordsAreWrittenOnceAndMissingOnesPassedOver) {
    TestDatabase db;
    auto a = db.addPerson("A"), b = db.addPerson("B");
    db->save();
    std::ostringstream out;
    EXPECT_EQ(
        VCardExport(*db, out, VCardVersion::v4).exportRecords({b->uniqueId(), UniqueId("x:CXPerson"), b->uniqueId()}),
        1u);
    EXPECT_NE(out.str().find("FN:B\r\n"), std::string::npos);
    EXPECT_EQ(out.str().find("FN:A\r\n"), std::string::npos);
}

TEST(VCardExport, PeopleOfOthersAreNotTheOwnersToExport) {
    TestDatabase db;
    db.addPerson("Mine");
    db.addSubscribedPerson("Theirs", "http://example.org/them/Contacts");
    db->save();
    std::string text = exportAll(*db, VCardVersion::v4);
    EXPECT_NE(text.find("Mine"), std::string::npos);
    EXPECT_EQ(text.find("Theirs"), std::string::npos);
}

TEST(VCardExport, AFullDiskIsAnException) {
    TestDatabase db;
    db.addPerson("A");
    db->save();
    std::ofstream full("/dev/full");
    ASSERT_TRUE(full.is_open());
    EXPECT_THROW(VCardExport(*db, full, VCardVersion::v4).exportAll(), CXException);
}

TEST(VCardExport, TheTextHoldsNothingButCardsOfTheVersion) {
    TestDatabase db;
    db.addPerson("A");
    db.addGroup("G");
    db->save();
    EXPECT_NE(exportAll(*db, VCardVersion::v4).find("VERSION:4.0\r\nUID:"), std::string::npos);
    EXPECT_NE(exportAll(*db, VCardVersion::v4).find("KIND:group\r\n"), std::string::npos);
    EXPECT_EQ(exportAll(*db, VCardVersion::v3).find("VERSION:4.0"), std::string::npos);
    EXPECT_NE(exportAll(*db, VCardVersion::v3).find("X-ADDRESSBOOKSERVER-KIND:group\r\n"), std::string::npos);
}

TEST(VCardDemo, TheDemonstrationsFileGoesInWithoutAnError) {
    TestDatabase db;
    auto report = VCardImport::importFile(*db, kDemo + "people.vcf");
    EXPECT_EQ(report.errorCount, 0u) << errorsOf(report);
    EXPECT_EQ(report.imported, 318u);
    EXPECT_EQ(report.updated, 0u);
    EXPECT_EQ(report.groups, 6u);
    EXPECT_EQ(report.missingMembers, 0u);
    std::map<std::string, size_t> sizes;
    size_t choices = 0;
    for (const auto& listing : db->listGroups(RemoteLocation(""))) {
        auto group = groupNamed(*db, listing.displayName);
        sizes[listing.displayName] = group->memberCount();
        for (const auto& [uid, chosen] : group->distributionChoices()) choices += chosen.size();
    }
    EXPECT_EQ(sizes, (std::map<std::string, size_t>{{"Family", 18},
                                                    {"Friends", 42},
                                                    {"Climbing, Wednesdays", 15},
                                                    {"Chœur du Marché", 33},
                                                    {"Lindenhof Studio", 27},
                                                    {"Newsletter", 24}}));
    EXPECT_EQ(choices, 26u);
    EXPECT_EQ(groupNamed(*db, "Friends")->subgroupUniqueIds().front(),
              groupNamed(*db, "Climbing, Wednesdays")->uniqueId());
    EXPECT_EQ(groupNamed(*db, "Chœur du Marché")->valueForProperty(kCXNoteProperty).string(),
              "Rehearsals: Thursday 19:30\nHall B");
    EXPECT_EQ(VCardImport::importFile(*db, kDemo + "people.vcf").unchanged, 318u);
}

TEST(VCardDemo, ASampleOfTheDemonstrationsPeopleIsRightFieldByField) {
    TestDatabase db;
    VCardImport::importFile(*db, kDemo + "people.vcf");
    auto values = [&](const std::string& id, const char* property) {
        std::string out;
        auto multi = personAt(*db, id)->multiValueForProperty(property);
        for (size_t i = 0; multi && i < multi->count(); i++)
            out += multi->labelAtIndex(i) + "=" + multi->valueAtIndex(i).string() + " ";
        return out;
    };
    auto text = [&](const std::string& id, const char* property) {
        return personAt(*db, id)->valueForProperty(property).string();
    };
    const std::string ada = "450575F3-F345-4A49-9A86-430AF82B08EA"; // of vCard 3.0
    EXPECT_EQ(text(ada, kCXFirstNameProperty), "Ada");
    EXPECT_EQ(text(ada, kCXLastNameProperty), "Thornbury");
    EXPECT_EQ(text(ada, kCXFormattedNameProperty), "");
    EXPECT_EQ(text(ada, kCXOrganizationProperty), "Nordlys Værft");
    EXPECT_EQ(text(ada, kCXDepartmentProperty), "Sveising");
    EXPECT_EQ(values(ada, kCXEmailProperty),
              "Work=en0.a@example.org Work=en0.b@example.org Work=en0.c@mail.test Work=en0.d@example.net ");
    auto addresses = *personAt(*db, ada)->multiValueForProperty(kCXAddressProperty);
    ASSERT_EQ(addresses.count(), 2u);
    EXPECT_EQ(addresses.valueAtIndex(1).dictionary()[kCXAddressStreetKey].string(), "Mill Lane 40\nRear entrance");
    EXPECT_EQ(addresses.valueAtIndex(1).dictionary()[kCXAddressCityKey].string(), "小川町北");
    EXPECT_EQ(personAt(*db, ada)->valueForProperty(kCXBirthdayProperty).date()->toISO8601(), "2001-06-09T00:00:00Z");

    const std::string orla = "8DB4BEB8-02B3-4348-A215-6870D7757EF5"; // of vCard 4.0
    EXPECT_EQ(text(orla, kCXOrganizationProperty), "Kestrel & Moss, Ltd.");
    EXPECT_EQ(text(orla, kCXJobTitleProperty), "Προγραμματίστρια");
    EXPECT_EQ(values(orla, kCXEmailProperty), "別荘=en1.a@example.com ");
    EXPECT_EQ(values(orla, kCXPhoneProperty), "Mobile=+46-70-174-06-69 ");
    EXPECT_EQ(values(orla, kCXRelatedNamesProperty), "Child=Ødis ");
    auto dates = *personAt(*db, orla)->multiValueForProperty(kCXOtherDatesProperty);
    EXPECT_EQ(dates.labelAtIndex(0), kCXAnniversaryLabel);
    EXPECT_EQ(dates.valueAtIndex(0).date()->toISO8601(), "1991-08-21T00:00:00Z");

    const std::string harbour = "8AC6C7E0-47C7-48CE-81BC-A407FA7A9C0C"; // a company
    EXPECT_TRUE(personAt(*db, harbour)->valueForProperty(kCXIsCompanyProperty).boolean());
    EXPECT_EQ(text(harbour, kCXOrganizationProperty), "ООО «Тихая гавань»");
    EXPECT_EQ(values(harbour, kCXPhoneProperty), "WorkFax=+1 202 555 0152 Work=+61 2 5550 0553 ");

    const std::string sakura = "3C868099-F77D-4403-96F3-A25C8D5BEE8A";
    EXPECT_EQ(text(sakura, kCXFormattedNameProperty), "森崎さくら");
    EXPECT_EQ(text(sakura, kCXLastNamePhoneticProperty), "わたぬき");
    EXPECT_EQ(values(sakura, kCXEmailProperty),
              "Other=ja111.a@mail.test Other=ja111.b@mail.test =ja111.c@example.org ");
}

TEST(VCardDemo, TheDemonstrationsPeopleAreVaried) {
    TestDatabase db;
    VCardImport::importFile(*db, kDemo + "people.vcf");
    size_t photos = 0, phones = 0, mails = 0, notes = 0, organisations = 0, companies = 0, custom = 0;
    db->forEachPersonModifiedSince(Date::distantPast(), kCXPersonTable, [&](const CXRow& row) {
        Dictionary p = BinaryValue::decode(*row.encoded).dictionary();
        photos += p.contains(kCXPhotoProperty);
        notes += p[kCXNoteProperty].string().find('\n') != std::string::npos;
        organisations += p.contains(kCXOrganizationProperty);
        companies += p[kCXIsCompanyProperty].boolean();
        auto phone = CXMultiValue::fromValue(p[kCXPhoneProperty]);
        phones += phone ? phone->count() : 0;
        for (size_t i = 0; phone && i < phone->count(); i++)
            custom += phone->labelAtIndex(i) == "Дача" || phone->labelAtIndex(i) == "Berghütte";
        auto mail = CXMultiValue::fromValue(p[kCXEmailProperty]);
        mails += mail ? mail->count() : 0;
    });
    EXPECT_EQ(photos, 25u);
    EXPECT_EQ(phones, 664u);
    EXPECT_EQ(mails, 639u);
    EXPECT_GT(notes, 60u);
    EXPECT_GT(organisations, 120u);
    EXPECT_EQ(companies, 6u);
    EXPECT_GT(custom, 3u);
}

TEST(VCardDemo, ExportAndImportGiveEqualDataInBothVersions) {
    TestDatabase db;
    VCardImport::importFile(*db, kDemo + "people.vcf");
    Value before = wholeOf(*db);
    for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
        TestDatabase copy;
        auto report = importText(*copy, exportAll(*db, version));
        EXPECT_EQ(report.errorCount, 0u) << errorsOf(report);
        EXPECT_EQ(report.missingMembers, 0u);
        EXPECT_EQ(firstDifference(before, wholeOf(*copy)), "");
        // And over what is there already nothing changes.
        int64_t position = db->journalPosition();
        EXPECT_EQ(importText(*db, exportAll(*db, version)).unchanged, 318u);
        EXPECT_EQ(db->journalPosition(), position);
    }
}

TEST(VCardRoundTrip, HostileTextsSurviveTheDatabaseAndBothVersions) {
    TestDatabase db;
    auto group = db.addGroup("G");
    auto anyone = rc::gen::exec([] { return vcardtest::anyPerson(); });
    for (uint64_t seed = 0; seed < 60; seed++) {
        auto p = CXPerson::create();
        p->resetWithDictionary(anyone(rc::Random(seed), static_cast<int>(seed)).value(), true, true);
        db->addRecord(p);
        group->addMember(p);
    }
    db->save();
    Value before = wholeOf(*db);
    for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
        TestDatabase copy;
        auto report = importText(*copy, exportAll(*db, version));
        EXPECT_EQ(report.errorCount, 0u) << errorsOf(report);
        EXPECT_EQ(firstDifference(before, wholeOf(*copy)), "");
    }
}

TEST(VCardRoundTrip, OddAndDamagedCardsSurviveTheDatabaseAndBothVersions) {
    TestDatabase db;
    size_t cards = 0;
    for (const char* directory : {"/fuzz/corpus/vcard", "/fuzz/regressions/vcard"})
        for (const auto& entry : std::filesystem::directory_iterator(std::string(ROLVANE_SOURCE_DIR) + directory)) {
            auto report = VCardImport::importFile(*db, entry.path());
            cards += report.imported + report.updated + report.unchanged + report.groups;
        }
    EXPECT_GT(cards, 40u);
    Value before = wholeOf(*db);
    for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
        TestDatabase copy;
        auto report = importText(*copy, exportAll(*db, version));
        EXPECT_EQ(report.errorCount, 0u) << errorsOf(report);
        EXPECT_EQ(firstDifference(before, wholeOf(*copy)), "");
    }
}

} // namespace
} // namespace rolvane
