#include "VCardGenerators.h"

#include "contacts/vcard/VCardFields.h"
#include "contacts/vcard/VCardText.h"
#include "foundation/PropertyList.h"

#include <gtest/gtest.h>

namespace rolvane {
namespace {

using namespace vcardtest;

VCardEntity readOne(const std::string& lines, const std::string& version = "3.0") {
    return readOneCard(lines, version);
}

std::string reasonFor(const std::string& lines, const std::string& version = "3.0") {
    auto r = readCard(lines, version);
    return r.entities.empty() && r.errors.size() == 1 ? r.errors[0].reason : "(no error)";
}

CXMultiValue multi(const Dictionary& p, const char* property) {
    return CXMultiValue::fromValue(p[property]).value_or(CXMultiValue());
}

using Pairs = std::vector<std::pair<std::string, std::string>>;
Pairs labelled(const Dictionary& p, const char* property) {
    Pairs out;
    auto all = multi(p, property);
    for (const auto& e : all.entries()) out.emplace_back(e.label, e.value.string());
    return out;
}

bool contains(const std::string& text, std::string_view part) {
    std::string flat;
    for (size_t i = 0; i < text.size(); i++)
        if (text.compare(i, 3, "\r\n ") == 0)
            i += 2;
        else
            flat += text[i];
    return flat.find(part) != std::string::npos;
}

TEST(VCardReader, ReadsNameOrganisationAndTexts) {
    auto e = readOne(
        "N:Stevenson;John;Philip,Paul;Dr.;Jr.,M.D.\r\nFN:Dr. John Philip Paul Stevenson Jr.\\, M.D.\r\n"
        "NICKNAME:Jim,Jimmie\r\nORG:ABC\\, Inc.;North;Sales\r\nTITLE:Director\\; R&D\r\nNOTE:one\\ntwo\\,three\r\n");
    const Dictionary& p = e.properties;
    EXPECT_EQ(p[kCXLastNameProperty].string(), "Stevenson");
    EXPECT_EQ(p[kCXMiddleNameProperty].string(), "Philip Paul");
    EXPECT_EQ(p[kCXTitleProperty].string(), "Dr.");
    EXPECT_EQ(p[kCXSuffixProperty].string(), "Jr., M.D.");
    EXPECT_FALSE(p[kCXFormattedNameProperty]) << "it says what the parts say";
    EXPECT_EQ(p[kCXNicknameProperty].string(), "Jim, Jimmie");
    EXPECT_EQ(p[kCXOrganizationProperty].string(), "ABC, Inc.");
    EXPECT_EQ(p[kCXDepartmentProperty].string(), "North; Sales");
    EXPECT_EQ(p[kCXJobTitleProperty].string(), "Director; R&D");
    EXPECT_EQ(p[kCXNoteProperty].string(), "one\ntwo,three");
}

TEST(VCardReader, AFormattedNameThatSaysSomethingElseIsKept) {
    EXPECT_EQ(readOne("N:王;小明;;;\r\nFN:王小明\r\n").properties[kCXFormattedNameProperty].string(), "王小明");
}

TEST(VCardReader, TypesBecomeLabels) {
    auto e = readOne(
        "TEL;TYPE=HOME,VOICE:1\r\nTEL;TYPE=cell:2\r\nTEL;TYPE=WORK;TYPE=FAX:3\r\nTEL;TYPE=\"home,fax\":4\r\nTEL;PAGER:"
        "5\r\n"
        "TEL;TYPE=main-number:6\r\nTEL;TYPE=car:7\r\nTEL:8\r\nTEL;TYPE=WORK:9\r\nEMAIL;TYPE=INTERNET,work:a@b.test\r\n"
        "EMAIL;TYPE=INTERNET:c@d.test\r\n");
    EXPECT_EQ(labelled(e.properties, kCXPhoneProperty), (Pairs{{"Home", "1"},
                                                               {"Mobile", "2"},
                                                               {"WorkFax", "3"},
                                                               {"HomeFax", "4"},
                                                               {"Pager", "5"},
                                                               {"Main", "6"},
                                                               {"Car", "7"},
                                                               {"", "8"},
                                                               {"Work", "9"}}));
    EXPECT_EQ(labelled(e.properties, kCXEmailProperty), (Pairs{{"Work", "a@b.test"}, {"", "c@d.test"}}));
}

TEST(VCardReader, SeveralValuesUnderOneLabelAllStay) {
    auto e = readOne("TEL;TYPE=home:1\r\nTEL;TYPE=home:2\r\nTEL;TYPE=home:1\r\n");
    EXPECT_EQ(labelled(e.properties, kCXPhoneProperty), (Pairs{{"Home", "1"}, {"Home", "2"}, {"Home", "1"}}));
}

TEST(VCardReader, AGroupCanCarryACustomLabel) {
    auto e = readOne("item1.TEL:1\r\nitem1.X-ABLABEL:Ski hut\r\nitem2.X-ANY-LABEL:Boat\\, "
                     "red\r\nitem2.EMAIL;TYPE=home:a@b.test\r\n");
    EXPECT_EQ(labelled(e.properties, kCXPhoneProperty), (Pairs{{"Ski hut", "1"}}));
    EXPECT_EQ(labelled(e.properties, kCXEmailProperty), (Pairs{{"Boat, red", "a@b.test"}}));
}

TEST(VCardReader, PreferredValuesComeFirst) {
    EXPECT_EQ(labelled(readOne("TEL:1\r\nTEL;TYPE=home,pref:2\r\n").properties, kCXPhoneProperty),
              (Pairs{{"Home", "2"}, {"", "1"}}));
    EXPECT_EQ(labelled(readOne("TEL:1\r\nTEL;PREF=50:2\r\nTEL;PREF=1:3\r\n", "4.0").properties, kCXPhoneProperty),
              (Pairs{{"", "3"}, {"", "2"}, {"", "1"}}));
}

TEST(VCardReader, TelephoneURIsAreNumbers) {
    auto e = readOne("TEL;VALUE=uri;TYPE=\"voice,home\":tel:+1-555-555-5555;ext=5102\r\n", "4.0");
    EXPECT_EQ(labelled(e.properties, kCXPhoneProperty), (Pairs{{"Home", "+1-555-555-5555;ext=5102"}}));
}

TEST(VCardReader, AddressesAreStructured) {
    auto e = readOne("ADR;TYPE=work;CC=DE:Box 7;Room 3;Main St, 5\\n2nd yard;Köln;NRW;50667;Germany\r\nADR:;;;;;;\r\n");
    auto m = multi(e.properties, kCXAddressProperty);
    ASSERT_EQ(m.count(), 1u);
    Dictionary a = m.valueAtIndex(0).dictionary();
    EXPECT_EQ(a[kCXAddressPOBoxKey].string(), "Box 7");
    EXPECT_EQ(a[kCXAddressExtendedKey].string(), "Room 3");
    EXPECT_EQ(a[kCXAddressStreetKey].string(), "Main St, 5\n2nd yard");
    EXPECT_EQ(a[kCXAddressCityKey].string(), "Köln");
    EXPECT_EQ(a[kCXAddressStateKey].string(), "NRW");
    EXPECT_EQ(a[kCXAddressZIPKey].string(), "50667");
    EXPECT_EQ(a[kCXAddressCountryKey].string(), "Germany");
    EXPECT_EQ(a[kCXAddressCountryCodeKey].string(), "DE");
    EXPECT_EQ(m.labelAtIndex(0), "Work");
}

TEST(VCardReader, FullBirthdaysAreDatesAndOthersAreText) {
    Date day(482112000); // 1985-04-12
    for (const char* text : {"1985-04-12", "19850412", "1985-04-12T00:00:00Z"})
        EXPECT_EQ(readOne(std::string("BDAY:") + text + "\r\n").properties[kCXBirthdayProperty], Value(day)) << text;
    EXPECT_EQ(readOne("BDAY;VALUE=date-time:1985-04-12T01:00:00Z\r\n").properties[kCXBirthdayProperty],
              Value(day.addingSeconds(3600)));
    for (const char* text :
         {"--0412", "1985-04", "1985", "---12", "1985-02-30", "19850412T231000", "1985-04-12T23:10:00-08:00"}) {
        auto e = readOne(std::string("BDAY:") + text + "\r\n", "4.0");
        EXPECT_FALSE(e.properties[kCXBirthdayProperty]) << text;
        EXPECT_EQ(e.properties[kCXBirthdayTextProperty].string(), text);
    }
    EXPECT_EQ(readOne("BDAY;VALUE=text:circa 1800\r\n", "4.0").properties[kCXBirthdayTextProperty].string(),
              "circa 1800");
}

TEST(VCardReader, PhotosOfAllVersionsAreBytes) {
    Bytes png{0x89, 'P', 'N', 'G', '\r', '\n', 0x1A, '\n', 1, 2, 3};
    std::string data = vcardEncodeBase64(png);
    for (auto [line, version] :
         std::vector<std::pair<std::string, std::string>>{{"PHOTO;ENCODING=b;TYPE=PNG:" + data, "3.0"},
                                                          {"PHOTO;PNG;BASE64:" + data, "2.1"},
                                                          {"PHOTO;ENCODING=BASE64:" + data, "3.0"},
                                                          {"PHOTO:data:image/png;base64," + data, "4.0"},
                                                          {"PHOTO:data:image/png\\;base64\\," + data, "4.0"}}) {
        auto e = readOne(line + "\r\n", version);
        EXPECT_EQ(e.properties[kCXPhotoProperty].data(), png) << line;
        EXPECT_EQ(e.properties[kCXPhotoTypeProperty].string(), "image/png") << line;
    }
}

TEST(VCardReader, APhotoElsewhereIsKeptAsItIs) {
    auto e = readOne("FN:x\r\nPHOTO;VALUE=uri:http://example.org/p.jpg\r\n");
    EXPECT_FALSE(e.properties[kCXPhotoProperty]);
    EXPECT_TRUE(contains(vcardText(e, VCardVersion::v3), "PHOTO;VALUE=uri:http://example.org/p.jpg\r\n"));
}

TEST(VCardReader, ADamagedPhotoIsKeptAsItStandsAndSaid) {
    for (const auto& [line, version, reason] : std::vector<std::tuple<std::string, std::string, std::string>>{
             {"PHOTO;ENCODING=b:AB!!CD", "3.0", "the photo's base64 is damaged"},
             {"PHOTO:data:image/png;base64,A", "4.0", "the photo's base64 is damaged"},
             {"PHOTO:data:nothing", "4.0", "the photo's data: URI has no comma"},
             {"LOGO;ENCODING=b:AB!!CD", "3.0", "the base64 of LOGO is damaged"}}) {
        auto e = readOne("FN:x\r\n" + line + "\r\n", version);
        EXPECT_FALSE(e.properties[kCXPhotoProperty]);
        ASSERT_EQ(e.notices.size(), 1u) << line;
        EXPECT_EQ(e.notices[0].reason, reason);
        EXPECT_FALSE(e.notices[0].lost);
        EXPECT_EQ(e.properties[kCXVCardExtraProperty].array()[0].string(), "X-ROLVANE-UNREAD:" + vcardEscape(line));
    }
}

TEST(VCardReader, AnEmptyCardAndANamelessGroupAreBad) {
    EXPECT_EQ(reasonFor(""), "the card is empty");
    EXPECT_EQ(reasonFor("KIND:group\r\nUID:x\r\n", "4.0"), "the group has no name (FN)");
}

TEST(VCardReader, CategoriesAreNamesInWhichACommaMayBeEscaped) {
    auto e = readOne("FN:x\r\nCATEGORIES:Family,Choir\\, old\r\nCATEGORIES:Work\r\n");
    EXPECT_EQ(e.categories, (std::vector<std::string>{"Family", "Choir, old", "Work"}));
}

TEST(VCardReader, GroupsOfBothVersionsHaveMembers) {
    auto four =
        readOne("KIND:group\r\nFN:Choir\r\nUID:urn:uuid:g\r\nMEMBER:urn:uuid:a\r\nMEMBER:urn:uuid:b\r\n", "4.0");
    auto three = readOne("X-ROLVANE-KIND:group\r\nN:Choir;;;;\r\nFN:Choir\r\nUID:urn:uuid:g\r\nX-ROLVANE-MEMBER:urn:"
                         "uuid:a\r\nX-ROLVANE-MEMBER:urn:uuid:b\r\n");
    for (const auto& e : {four, three}) {
        EXPECT_TRUE(e.isGroup);
        EXPECT_EQ(e.uid, "urn:uuid:g");
        EXPECT_EQ(e.properties[kCXGroupNameProperty].string(), "Choir");
        EXPECT_EQ(e.members, (std::vector<std::string>{"urn:uuid:a", "urn:uuid:b"}));
    }
}

TEST(VCardReader, AFileCannotSetWithWhomARecordIsShared) {
    VCardEntity e;
    e.properties = {{"First", "x"}};
    std::string text = vcardText(e, VCardVersion::v4);
    Bytes location = BinaryValue::encode(Value("http://evil.test/x/Contacts"));
    text.insert(text.find("END:"), "X-ROLVANE-VALUE;X-NAME=RemoteLocation:" + vcardEncodeBase64(location) + "\r\n");
    auto r = readText(text);
    ASSERT_EQ(r.entities.size(), 1u);
    EXPECT_FALSE(r.entities[0].properties[kCXRemoteLocationProperty]);
}

TEST(VCardReader, ADamagedExactValueIsKeptAsItStandsAndSaid) {
    for (const char* value : {"AAAA", "!"}) {
        auto e = readOne("FN:x\r\nNOTE:y\r\nX-ROLVANE-VALUE;X-NAME=Note:" + std::string(value) + "\r\n");
        EXPECT_EQ(e.properties[kCXNoteProperty].string(), "y");
        ASSERT_EQ(e.notices.size(), 1u);
        EXPECT_NE(e.notices[0].reason.find("Note"), std::string::npos);
    }
}

TEST(VCardWriter, WithWhomARecordIsSharedIsNeverWritten) {
    VCardEntity e;
    CXMutableMultiValue m;
    m.addValue("http://example.org/me/Contacts", kCXPublishLabel);
    e.properties = {{"First", "x"}};
    for (const char* key : {kCXRemoteLocationProperty, kCXReadSharingACLProperty, kCXReadWriteSharingACLProperty})
        e.properties.set(key, m.toValue());
    for (auto v : {VCardVersion::v3, VCardVersion::v4}) {
        EXPECT_FALSE(contains(vcardText(e, v), "Remote"));
        EXPECT_FALSE(contains(vcardText(e, v), "Sharing"));
        EXPECT_FALSE(contains(vcardText(e, v), "X-ROLVANE-VALUE"));
    }
}

TEST(VCardWriter, WritesWhatEachVersionAsksFor) {
    VCardEntity e;
    e.uid = "urn:uuid:00000000-0000-4000-8000-000000000001";
    CXMutableMultiValue phones, dates, mails;
    phones.addValue("+44 20 7946 0001", kCXHomeLabel);
    phones.addValue("+44 20 7946 0002", "Ski hut");
    mails.addValue("a@example.org", kCXWorkLabel);
    dates.addValue(Date(482112000), kCXAnniversaryLabel);
    e.properties = {{"First", "Ann"},
                    {"Last", "Lee"},
                    {"Phone", phones.toValue()},
                    {"Email", mails.toValue()},
                    {"OtherDates", dates.toValue()},
                    {"Birthday", Date(482112000)},
                    {"Photo", Bytes{0xFF, 0xD8, 0xFF}},
                    {"PhotoType", "image/jpeg"}};
    std::string three = vcardText(e, VCardVersion::v3), four = vcardText(e, VCardVersion::v4);
    for (const char* part :
         {"BEGIN:VCARD\r\nVERSION:3.0\r\n", "UID:urn:uuid:00000000-0000-4000-8000-000000000001\r\n", "FN:Ann Lee\r\n",
          "N:Lee;Ann;;;\r\n", "TEL;TYPE=home,voice:+44 20 7946 0001\r\n", "item1.TEL:+44 20 7946 0002\r\n",
          "item1.X-ABLabel:Ski hut\r\n", "EMAIL;TYPE=work:a@example.org\r\n", "BDAY:1985-04-12\r\n",
          "PHOTO;ENCODING=b;TYPE=JPEG:/9j/\r\n", "item2.X-ABDATE:1985-04-12\r\nitem2.X-ABLabel:_$!<Anniversary>!$_\r\n",
          "END:VCARD\r\n"})
        EXPECT_TRUE(contains(three, part)) << part << "\n" << three;
    for (const char* part :
         {"BEGIN:VCARD\r\nVERSION:4.0\r\n", "BDAY:19850412\r\n", "PHOTO:data:image/jpeg;base64,/9j/\r\n",
          "ANNIVERSARY:19850412\r\n", "EMAIL;TYPE=work:a@example.org\r\n"})
        EXPECT_TRUE(contains(four, part)) << part << "\n" << four;
    EXPECT_FALSE(contains(three + four, "X-ROLVANE-VALUE")) << "nothing here needs it";
}

TEST(VCardWriter, UnknownPropertiesParametersAndGroupsAreKept) {
    std::string lines =
        "UID:not a "
        "uuid\r\nFN;LANGUAGE=en:Ann\r\nN;SORT-AS=\"Lee,Ann\":Lee;Ann;;;\r\nitem7.TEL;TYPE=car;X-FOO=\"a;b\":1\r\n"
        "item7.X-ABADR:us\r\nTEL;TYPE=home,voice,msg;PREF=1:2\r\nX-COLOUR;X-A=1:red\\, "
        "green\r\nNOTE:first\r\nNOTE;LANGUAGE=fr:deux\r\n"
        "ADR;LABEL=\"x^ny\";TYPE=home;CC=GB:;;S;C;;;\r\nKIND:location\r\n";
    auto e = readOne(lines, "4.0");
    for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
        std::string text = vcardText(e, version);
        for (const char* part :
             {"UID:not a uuid\r\n", "FN;LANGUAGE=en:Ann\r\n", "N;SORT-AS=\"Lee,Ann\":Lee;Ann;;;\r\n",
              "item7.X-ABADR:us\r\n", "item7.TEL;TYPE=car;X-FOO=\"a;b\":1\r\n", "X-COLOUR;X-A=1:red\\, green\r\n",
              "NOTE:first\r\n", "NOTE;LANGUAGE=fr:deux\r\n", "LABEL=x^ny", "CC=GB:;;S;C;;;\r\n", "KIND:location\r\n"})
            EXPECT_TRUE(contains(text, part)) << part << "\n" << text;
        EXPECT_TRUE(contains(text, version == VCardVersion::v3 ? "TEL;TYPE=home,voice,msg,pref:2\r\n"
                                                               : "TEL;TYPE=home,voice,msg;PREF=1:2\r\n"))
            << text;
        auto again = readText(text);
        ASSERT_EQ(again.entities.size(), 1u);
        EXPECT_EQ(withoutIdentifiers(again.entities[0].properties), withoutIdentifiers(e.properties))
            << description(again.entities[0].properties) << description(e.properties);
    }
}

TEST(VCardWriter, ParametersOfAnEditedValueAreDropped) {
    auto e = readOne("FN:x\r\nTEL;X-FOO=1;TYPE=home:1\r\n");
    CXMutableMultiValue phones(multi(e.properties, kCXPhoneProperty));
    phones.replaceValueAtIndex(0, "2");
    e.properties.set(kCXPhoneProperty, phones.toValue());
    std::string text = vcardText(e, VCardVersion::v4);
    EXPECT_TRUE(contains(text, "TEL;TYPE=home,voice:2\r\n"));
    EXPECT_FALSE(contains(text, "X-FOO"));
}

RC_GTEST_PROP(VCardRoundTrip, AnyPersonComesBackFromEitherVersion, ()) {
    VCardEntity e;
    e.properties = anyPerson();
    e.uid = "urn:uuid:00000000-0000-4000-8000-000000000001";
    e.categories = *rc::gen::unique<std::vector<std::string>>(
        rc::gen::suchThat(someText(), [](const std::string& s) { return !vcardTrim(s).empty(); }));
    for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
        auto again = readText(vcardText(e, version));
        RC_ASSERT(again.errors.empty());
        RC_ASSERT(again.entities.size() == 1u);
        RC_ASSERT(again.entities[0].uid == e.uid);
        RC_ASSERT(again.entities[0].categories == e.categories);
        RC_LOG() << vcardText(e, version) << description(again.entities[0].properties);
        RC_ASSERT(withoutIdentifiers(again.entities[0].properties) == withoutIdentifiers(e.properties));
    }
}

RC_GTEST_PROP(VCardRoundTrip, AnyGroupComesBackFromEitherVersion, ()) {
    VCardEntity e;
    e.isGroup = true;
    e.uid = "urn:uuid:00000000-0000-4000-8000-000000000002";
    auto name = rc::gen::suchThat(someText(), [](const std::string& s) { return !vcardTrim(s).empty(); });
    auto uid = rc::gen::map(rc::gen::inRange(0, 1000), [](int i) { return "urn:uuid:" + std::to_string(i); });
    e.properties = {{kCXGroupNameProperty, *name}};
    e.members = *rc::gen::container<std::vector<std::string>>(uid);
    e.subgroups = *rc::gen::container<std::vector<std::string>>(uid);
    int n = *rc::gen::inRange(0, 3);
    for (int i = 0; i < n; i++)
        e.choices.push_back(
            {*uid, *rc::gen::element<std::string>("Email", "Phone", "Address"), *anyText(), vcardEscape(*anyText())});
    for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
        auto again = readText(vcardText(e, version));
        RC_ASSERT(again.entities.size() == 1u);
        const auto& b = again.entities[0];
        RC_ASSERT(b.isGroup);
        RC_ASSERT(b.uid == e.uid);
        RC_ASSERT(b.properties == e.properties);
        RC_ASSERT(b.members == e.members);
        RC_ASSERT(b.subgroups == e.subgroups);
        RC_ASSERT(b.choices == e.choices);
    }
}

TEST(VCardUID, AUUIDStandsForItselfAndAnythingElseForOneThatNeverChanges) {
    EXPECT_EQ(vcardUUIDForUID("urn:uuid:F81D4FAE-7DEC-11D0-A765-00A0C91E6BF6"), "F81D4FAE-7DEC-11D0-A765-00A0C91E6BF6");
    EXPECT_EQ(vcardUUIDForUID("f81d4fae-7dec-11d0-a765-00a0c91e6bf6"), "f81d4fae-7dec-11d0-a765-00a0c91e6bf6");
    std::string a = vcardUUIDForUID("pas-id-4711");
    EXPECT_TRUE(vcardIsUUID(a)) << a;
    EXPECT_EQ(a[14], '5');
    EXPECT_EQ(a, vcardUUIDForUID("pas-id-4711"));
    EXPECT_NE(a, vcardUUIDForUID("pas-id-4712"));
}

} // namespace
} // namespace rolvane
