// Cards as other programs write them: what they say is read, and nothing of it gets lost between import and export.

#include "TestDatabase.h"
#include "VCardFiles.h"
#include "VCardGenerators.h"

#include "contacts/vcard/TextCharset.h"
#include "contacts/vcard/VCardExport.h"
#include "contacts/vcard/VCardImport.h"
#include "contacts/vcard/VCardText.h"

#include <gtest/gtest.h>

#include <sstream>

namespace rolvane {
namespace {

using test::TestDatabase;
using vcardtest::card;
using vcardtest::exportAll;
using vcardtest::importText;
using vcardtest::readOneCard;
using vcardtest::readText;
using vcardtest::withoutIdentifiers;

bool contains(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
}

std::string labelled(const VCardEntity& e, const char* property) {
    std::string out;
    const auto values = CXMultiValue::fromValue(e.properties[property]);
    for (size_t i = 0; values && i < values->count(); i++)
        out += (i ? " " : "") + values->labelAtIndex(i) + "=" +
               (values->valueAtIndex(i).isDate() ? values->valueAtIndex(i).date()->toISO8601().substr(0, 10)
                                                 : values->valueAtIndex(i).string());
    return out;
}

void expectComesBack(const VCardEntity& e) {
    for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
        const auto again = readText(vcardText(e, version));
        ASSERT_EQ(again.entities.size(), 1u);
        EXPECT_EQ(withoutIdentifiers(again.entities[0].properties), withoutIdentifiers(e.properties))
            << vcardText(e, version);
        EXPECT_FALSE(contains(vcardText(e, version), "X-ROLVANE-VALUE")) << vcardText(e, version);
    }
}

std::vector<std::string> names(CXRolvane& database) {
    std::vector<std::string> all;
    for (const auto& listing : database.listPeople(RemoteLocation(""))) all.push_back(listing.displayName);
    return all;
}

CXPersonRef onlyPerson(CXRolvane& database) {
    const auto all = database.listPeople(RemoteLocation(""));
    return all.size() == 1 ? std::dynamic_pointer_cast<CXPerson>(database.recordForUniqueId(all[0].uniqueId)) : nullptr;
}

// --- labels and dates ------------------------------------------------------------------------------------------------

TEST(VCardForeign, LabelsOfTelephonesAreRead) {
    auto e = readOneCard("FN:x\r\nitem1.TEL:1\r\nitem1.X-ABLabel:_$!<HomeFAX>!$_\r\nitem2.TEL:2\r\n"
                         "item2.X-ABLabel:Hut\r\nitem3.TEL;type=CELL:3\r\nitem3.X-ABLabel:\r\n"
                         "item4.X-ABDATE;type=pref:2010-05-12\r\nitem4.X-ABLabel:_$!<Anniversary>!$_\r\n"
                         "item5.X-ABRELATEDNAMES:Ann\r\nitem5.X-ABLabel:_$!<Mother>!$_\r\n",
                         "3.0");
    EXPECT_EQ(labelled(e, kCXPhoneProperty), "HomeFax=1 Hut=2 Mobile=3");
    EXPECT_EQ(labelled(e, kCXOtherDatesProperty), "Anniversary=2010-05-12");
    EXPECT_EQ(labelled(e, kCXRelatedNamesProperty), "Mother=Ann");
    expectComesBack(e);
}

TEST(VCardForeign, OurLabelsAndDatesAreWrittenAsOthersReadThem) {
    CXMutableMultiValue phones, dates, related;
    phones.addValue("1", "Hut");
    phones.addValue("2", kCXHomeFaxLabel);
    dates.addValue(Date(482112000), "First met");
    dates.addValue(Date(482112000), kCXAnniversaryLabel);
    related.addValue("Ann", "Spouse");
    VCardEntity e;
    e.properties = {{kCXPhoneProperty, phones.toValue()},
                    {kCXOtherDatesProperty, dates.toValue()},
                    {kCXRelatedNamesProperty, related.toValue()}};
    const std::string three = vcardText(e, VCardVersion::v3), four = vcardText(e, VCardVersion::v4);
    for (const std::string& text : {three, four}) {
        EXPECT_TRUE(contains(text, "item1.TEL:1\r\nitem1.X-ABLabel:Hut\r\n")) << text;
        EXPECT_TRUE(contains(text, "TEL;TYPE=home,fax:2\r\n")) << text;
        EXPECT_TRUE(contains(text, ".X-ABDATE:1985-04-12\r\n")) << text;
        EXPECT_TRUE(contains(text, ".X-ABLabel:First met\r\n")) << text;
        EXPECT_FALSE(contains(text, "X-ROLVANE")) << text;
    }
    EXPECT_TRUE(contains(three, "X-ABLabel:_$!<Anniversary>!$_\r\n")) << three;
    EXPECT_TRUE(contains(four, "ANNIVERSARY:19850412\r\n")) << four;
    EXPECT_TRUE(contains(three, "X-ABRELATEDNAMES;TYPE=spouse:Ann\r\n")) << three;
    EXPECT_TRUE(contains(four, "RELATED;VALUE=text;TYPE=spouse:Ann\r\n")) << four;
    expectComesBack(e);
}

TEST(VCardForeign, FormsOfEarlierVersionsOfOursAreStillRead) {
    auto e = readOneCard("FN:x\r\nitem1.TEL:1\r\nitem1.X-ROLVANE-LABEL:Hut\r\nitem2.X-ROLVANE-DATE:19850412\r\n"
                         "item2.X-ROLVANE-LABEL:First met\r\nX-ANNIVERSARY:19850412\r\n"
                         "X-ROLVANE-RELATED;VALUE=text;TYPE=spouse:Ann\r\n",
                         "3.0");
    EXPECT_EQ(labelled(e, kCXPhoneProperty), "Hut=1");
    EXPECT_EQ(labelled(e, kCXOtherDatesProperty), "First met=1985-04-12 Anniversary=1985-04-12");
    EXPECT_EQ(labelled(e, kCXRelatedNamesProperty), "Spouse=Ann");
}

TEST(VCardForeign, ALabelThatAnEarlierVersionTookAsItStoodIsNoSecondNumber) {
    TestDatabase db;
    auto p = db.addPerson("x", "00000000-0000-4000-8000-000000000001:CXPerson");
    CXMutableMultiValue phones;
    phones.addValue("1", "_$!<HomeFAX>!$_");
    p->setValue(phones.toValue(), kCXPhoneProperty);
    db->save();
    importText(*db, card("UID:00000000-0000-4000-8000-000000000001\r\nN:;x;;;\r\nFN:x\r\nitem1.TEL:1\r\n"
                         "item1.X-ABLabel:_$!<HomeFAX>!$_\r\n"));
    const auto after = *p->multiValueForProperty(kCXPhoneProperty);
    ASSERT_EQ(after.count(), 1u);
    EXPECT_EQ(after.labelAtIndex(0), kCXHomeFaxLabel);
}

// --- what was lost without a word ------------------------------------------------------------------------------------

TEST(VCardForeign, ListsInANameComeBack) {
    auto e = readOneCard("FN:x\r\nN:Lee;Ann,Mary;Jo;Dr.,Prof.;MD,PhD\r\n", "3.0");
    EXPECT_EQ(e.properties[kCXFirstNameProperty].string(), "Ann Mary");
    for (auto version : {VCardVersion::v3, VCardVersion::v4})
        EXPECT_TRUE(contains(vcardText(e, version), "\r\nN:Lee;Ann,Mary;Jo;Dr.,Prof.;MD,PhD\r\n"));
    expectComesBack(e);
    e.properties.set(kCXFirstNameProperty, "Anna");
    EXPECT_TRUE(contains(vcardText(e, VCardVersion::v4), "\r\nN:Lee;Anna;Jo;")) << "it is another name now";
}

TEST(VCardForeign, TypesThatSayLittleComeBack) {
    auto e =
        readOneCard("FN:x\r\nTEL;TYPE=CELL,VOICE:1\r\nTEL;TYPE=voice:2\r\nEMAIL;TYPE=INTERNET:a@b.test\r\n", "3.0");
    for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
        const std::string text = vcardText(e, version);
        EXPECT_TRUE(contains(text, "TEL;TYPE=cell,voice:1\r\n")) << text;
        EXPECT_TRUE(contains(text, "TEL;TYPE=voice:2\r\n")) << text;
        EXPECT_TRUE(contains(text, "EMAIL;TYPE=internet:a@b.test\r\n")) << text;
    }
    expectComesBack(e);
}

TEST(VCardForeign, CategoriesKeepTheirOrderThroughTheDatabase) {
    TestDatabase db;
    const std::string text = card("UID:1\r\nFN:Ann\r\nCATEGORIES:Work,Alumni,Music\r\n") +
                             card("UID:2\r\nFN:Bob\r\nCATEGORIES:Alumni,Work\r\n");
    importText(*db, text);
    const int64_t position = db->journalPosition();
    for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
        const std::string out = exportAll(*db, version);
        EXPECT_TRUE(contains(out, "CATEGORIES:Work,Alumni,Music\r\n")) << out;
        EXPECT_TRUE(contains(out, "CATEGORIES:Alumni,Work\r\n")) << out;
        EXPECT_FALSE(contains(out, "ORDER")) << out;
        EXPECT_EQ(importText(*db, out).unchanged, 2u);
    }
    importText(*db, text);
    EXPECT_EQ(db->journalPosition(), position) << "nothing changes the second time";
}

TEST(VCardForeign, MembersWithoutACardAreKeptAndJoinWhenTheirCardsCome) {
    TestDatabase db;
    const std::string group =
        card("KIND:group\r\nUID:g\r\nFN:Choir\r\nMEMBER:urn:uuid:00000000-0000-4000-8000-00000000000a\r\n"
             "MEMBER:someone@example.org\r\n",
             "4.0");
    auto report = importText(*db, group);
    EXPECT_EQ(report.missingMembers, 2u);
    const int64_t position = db->journalPosition();
    EXPECT_EQ(importText(*db, group).missingMembers, 2u);
    EXPECT_EQ(db->journalPosition(), position);
    const std::string four = exportAll(*db, VCardVersion::v4), three = exportAll(*db, VCardVersion::v3);
    for (const char* uid : {"urn:uuid:00000000-0000-4000-8000-00000000000a", "someone@example.org"}) {
        EXPECT_TRUE(contains(four, std::string("MEMBER:") + uid)) << four;
        EXPECT_TRUE(contains(three, std::string("X-ADDRESSBOOKSERVER-MEMBER:") + uid)) << three;
    }
    importText(*db, card("UID:someone@example.org\r\nFN:Someone\r\n"));
    for (const auto& listing : db->listGroups(RemoteLocation(""))) {
        auto choir = std::dynamic_pointer_cast<CXGroup>(db->recordForUniqueId(listing.uniqueId));
        EXPECT_EQ(choir->memberCount(), 1u);
        EXPECT_EQ(vcardKeptLines(choir->dictionaryRepresentation(), kVCardMissingMemberLine).size(), 1u);
    }
}

// --- valid for others ------------------------------------------------------------------------------------------------

TEST(VCardForeign, KeptLinesAreWrittenAsEachVersionHasThem) {
    auto e = readOneCard("FN:x\r\nPHOTO;PNG;BASE64:iVBORw0KGgo=\r\n\r\nPHOTO;TYPE=JPEG;ENCODING=BASE64:/9j/\r\n\r\n"
                         "LOGO;GIF;ENCODING=BASE64:R0lGOA==\r\n\r\nSOUND;WAVE;BASE64:UklGRg==\r\n\r\n"
                         "KEY;PGP;ENCODING=BASE64:AAEC\r\n\r\nLOGO;VALUE=URL:http://a.test/l.gif\r\n"
                         "LABEL;WORK:1 Road\r\nX-IRMC-N;PREF:yomi\r\nSOUND;X-IRMC-N:yomi\r\n",
                         "2.1");
    const std::string three = vcardText(e, VCardVersion::v3), four = vcardText(e, VCardVersion::v4);
    for (const char* line :
         {"PHOTO:data:image/jpeg;base64,/9j/\r\n", "LOGO:data:image/gif;base64,R0lGOA==\r\n",
          "SOUND:data:audio/wav;base64,UklGRg==\r\n", "KEY:data:application/pgp-keys;base64,AAEC\r\n",
          "LOGO;VALUE=uri:http://a.test/l.gif\r\n", "X-ROLVANE-KEPT:LABEL\\;TYPE=WORK:1 Road\r\n",
          "X-IRMC-N;PREF=1:yomi\r\n", "X-ROLVANE-KEPT:SOUND\\;TYPE=X-IRMC-N:yomi\r\n"})
        EXPECT_TRUE(contains(four, line)) << line << "\n" << four;
    EXPECT_FALSE(contains(four, "ENCODING")) << four;
    for (const char* line : {"PHOTO;ENCODING=b;TYPE=JPEG:/9j/\r\n", "LOGO;ENCODING=b;TYPE=GIF:R0lGOA==\r\n",
                             "SOUND;ENCODING=b;TYPE=WAVE:UklGRg==\r\n", "KEY;ENCODING=b;TYPE=PGP:AAEC\r\n",
                             "LOGO;VALUE=uri:http://a.test/l.gif\r\n", "LABEL;TYPE=WORK:1 Road\r\n"})
        EXPECT_TRUE(contains(three, line)) << line << "\n" << three;
    expectComesBack(e);
}

TEST(VCardForeign, APlaceIsAPairInOneVersionAndAURIInTheOther) {
    for (const auto& [version, written] : {std::pair{"3.0", "GEO:12.5;-42.25"}, {"4.0", "GEO:geo:12.5,-42.25"}}) {
        auto e = readOneCard("FN:x\r\n" + std::string(written) + "\r\n", version);
        EXPECT_TRUE(contains(vcardText(e, VCardVersion::v3), "\r\nGEO:12.5;-42.25\r\n")) << written;
        EXPECT_TRUE(contains(vcardText(e, VCardVersion::v4), "\r\nGEO:geo:12.5,-42.25\r\n")) << written;
    }
    for (const char* more : {"geo:12.5,-42.25,7", "geo:12.5,-42.25;u=3", "nowhere;else"}) {
        auto e = readOneCard("FN:x\r\nGEO:" + std::string(more) + "\r\n", "4.0");
        EXPECT_TRUE(contains(vcardText(e, VCardVersion::v4), "\r\nGEO:" + std::string(more) + "\r\n")) << more;
    }
    const auto high = readOneCard("FN:x\r\nGEO:geo:12.5,-42.25,7\r\n", "4.0");
    EXPECT_FALSE(contains(vcardText(high, VCardVersion::v3), "\r\nGEO:")) << "3.0 has no altitude";
}

TEST(VCardForeign, ABirthdayWithoutItsYearIsADayOfTheYear) {
    for (const char* line : {"BDAY:--0517", "BDAY;VALUE=date:--05-17"}) {
        auto e = readOneCard(std::string("FN:x\r\n") + line + "\r\n", "3.0");
        EXPECT_EQ(e.properties[kCXBirthdayTextProperty].string(), "--0517");
        EXPECT_TRUE(contains(vcardText(e, VCardVersion::v3), "BDAY:--0517\r\n"));
        EXPECT_TRUE(contains(vcardText(e, VCardVersion::v4), "BDAY:--0517\r\n"));
        expectComesBack(e);
    }
}

// --- character sets --------------------------------------------------------------------------------------------------

TEST(VCardForeign, ASingleByteFileIsReadAndSaid) {
    TestDatabase db;
    auto report = importText(*db, card("N:M\xFCller;J\xFCrgen\r\nADR;WORK:;;Hauptstra\xDF"
                                       "e 5;K\xF6ln;;;\r\n"
                                       "NOTE;ENCODING=QUOTED-PRINTABLE:Gr=FC=DFe\r\n",
                                       "2.1"));
    EXPECT_EQ(names(*db), std::vector<std::string>{"Jürgen Müller"});
    EXPECT_EQ(onlyPerson(*db)->valueForProperty(kCXNoteProperty).string(), "Grüße");
    ASSERT_EQ(report.foreign.size(), 1u);
    EXPECT_EQ(report.foreign[0].charset, "WINDOWS-1252");
    EXPECT_TRUE(report.foreign[0].detected);
    EXPECT_EQ(report.foreign[0].lines, 3u);
    EXPECT_EQ(report.errorCount + report.noticeCount, 0u);
}

TEST(VCardForeign, TheCharacterSetThatIsNamedIsBelieved) {
    TestDatabase db;
    auto report = importText(*db, card("FN:\xD0\xCF\xD4\xD2\r\nN:;\xD0\xCF\xD4\xD2;;;\r\n", "2.1"), "KOI8-R");
    EXPECT_EQ(names(*db), std::vector<std::string>{"потр"});
    ASSERT_EQ(report.foreign.size(), 1u);
    EXPECT_FALSE(report.foreign[0].detected);
}

TEST(VCardForeign, CharacterSetsAreToldApart) {
    const std::vector<std::pair<std::string, std::string>> samples{
        {"WINDOWS-1251", "FN:Иван Петров\nADR:;;улица Ленина;Москва;;;\n"},
        {"WINDOWS-1250", "FN:Jiří Dvořák\nADR:;;Náměstí Míru;Plzeň;;;\nFN:Eliška Černá\nNOTE:přítelkyně z učitelka\n"},
        {"SHIFT_JIS", "FN:山田太郎\nADR:;;千代田区;東京都;;;\nFN:佐藤花子\n"},
        {"WINDOWS-1252", "FN:Hélène Lefèvre\nADR:;;12 rue de l’Église;Orléans;;;\n"}};
    for (const auto& [charset, text] : samples) {
        // Turned into the character set by the converter of the C library, which knows both directions.
        TestDatabase d;
        std::string bytes;
        FILE* pipe = ::popen(("printf %s '" + vcardEncodeBase64({text.begin(), text.end()}) +
                              "' | base64 -d | iconv -f UTF-8 -t " + charset)
                                 .c_str(),
                             "r");
        ASSERT_NE(pipe, nullptr);
        for (int c; (c = std::fgetc(pipe)) != EOF;) bytes += static_cast<char>(c);
        ASSERT_EQ(::pclose(pipe), 0);
        EXPECT_EQ(detectedCharset(bytes), charset);
    }
}

TEST(VCardForeign, AFileInUTF16IsRead) {
    std::string text = card("FN:Ann\r\n"), wide = "\xFF\xFE";
    for (char c : text) (wide += c) += '\0';
    TestDatabase db;
    auto report = importText(*db, wide);
    EXPECT_EQ(names(*db), std::vector<std::string>{"Ann"});
    ASSERT_EQ(report.foreign.size(), 1u);
    EXPECT_EQ(report.foreign[0].charset, "UTF-16");
}

// --- odd lines -------------------------------------------------------------------------------------------------------

TEST(VCardForeign, AnOddLineCostsThatLineAndTheCardIsNamed) {
    TestDatabase db;
    const std::string odd = "TEL;X-CUSTOM(CHARSET=UTF-8,ENCODING=QUOTED-PRINTABLE,=C3=9Cben):+49 30 1234567";
    const std::string text = card("N:Lee;Ann;;;\r\n" + odd + "\r\nEMAIL:ann@b.test\r\n", "2.1");
    auto report = importText(*db, text);
    EXPECT_EQ(report.imported, 1u);
    ASSERT_EQ(report.notices.size(), 1u);
    EXPECT_EQ(report.notices[0].line, 4u);
    EXPECT_TRUE(contains(report.notices[0].reason, "Ann Lee")) << report.notices[0].reason;
    const auto phones = onlyPerson(*db)->multiValueForProperty(kCXPhoneProperty);
    ASSERT_TRUE(phones);
    EXPECT_EQ(phones->labelAtIndex(0), "Üben");
    EXPECT_EQ(phones->valueAtIndex(0).string(), "+49 30 1234567");
    std::string out = exportAll(*db, VCardVersion::v4);
    for (size_t fold; (fold = out.find("\r\n ")) != std::string::npos;) out.erase(fold, 3);
    EXPECT_TRUE(contains(out, "X-ROLVANE-UNREAD:" + vcardEscape(odd))) << out;
    EXPECT_EQ(importText(*db, text).unchanged, 1u);
}

// --- twice -----------------------------------------------------------------------------------------------------------

TEST(VCardForeign, CardsWithoutUIDAreFoundAgain) {
    TestDatabase db;
    const std::string text =
        card("N:Lee;Ann;;;\r\nTEL;CELL:+49 170 1234567\r\nNOTE:x\r\n", "2.1") + card("N:Moss;Bo;;;\r\n", "2.1") +
        card("N:Moss;Bo;;;\r\nADR;HOME:;;S;C;;;\r\n", "2.1") + card("N:Reed;Cy;;;\r\nTEL;HOME:111111\r\n", "2.1") +
        card("N:Reed;Cy;;;\r\nTEL;HOME:222222\r\n", "2.1") + card("FN:Quartet\r\nX-ROLVANE-KIND:group\r\n");
    auto first = importText(*db, text);
    EXPECT_EQ(first.imported, 5u);
    EXPECT_EQ(first.doubtful, 2u) << "the second Bo Moss and the second Cy Reed";
    const int64_t position = db->journalPosition();
    for (int i = 0; i < 3; i++) {
        auto again = importText(*db, text);
        EXPECT_EQ(again.imported + again.updated, 0u);
        EXPECT_EQ(again.unchanged, 5u);
        EXPECT_EQ(again.doubtful, 0u);
    }
    EXPECT_EQ(db->journalPosition(), position);
    EXPECT_EQ(db->listGroups(RemoteLocation("")).size(), 1u);
    auto changed = importText(*db, card("N:Lee;Ann;;;\r\nTEL;CELL:0170 1234567\r\nNOTE:y\r\n", "2.1"));
    EXPECT_EQ(changed.updated, 1u) << "the number is the same without the country's";
    EXPECT_EQ(names(*db).size(), 5u);
}

TEST(VCardForeign, TwoCardsOfOneFileAreNotOneWhenThatWouldReplaceSomething) {
    TestDatabase db;
    auto report = importText(*db, card("N:Lee;Ann;;;\r\nTEL:5550100\r\nNOTE:the elder\r\n") +
                                      card("N:Lee;Ann;;;\r\nTEL:5550100\r\nNOTE:the younger\r\n"));
    EXPECT_EQ(report.imported, 2u);
    EXPECT_EQ(report.doubtful, 1u);
}

TEST(VCardForeign, ATrialChangesNothing) {
    TestDatabase db;
    VCardImport import(*db);
    import.setDryRun(true);
    std::istringstream in(card("FN:Ann\r\nCATEGORIES:Friends\r\n"));
    import.addStream(in, "text.vcf");
    EXPECT_EQ(import.finish().imported, 1u);
    EXPECT_EQ(names(*db).size(), 0u);
    EXPECT_EQ(db->listGroups(RemoteLocation("")).size(), 0u);
}

} // namespace
} // namespace rolvane
