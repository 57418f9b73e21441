// Cards as other programs write them, and as damage makes them: what was read is written so that it reads as the same
// again, in both versions, parameters, groups and lines of unknown meaning included.

#include "VCardGenerators.h"

#include "contacts/vcard/VCardFields.h"
#include "contacts/vcard/VCardText.h"
#include "foundation/PropertyList.h"
#include "support/CpuTime.h"

#include <gtest/gtest.h>

namespace rolvane {
namespace {

using namespace vcardtest;

VCardEntity readOne(const std::string& lines, const std::string& version = "4.0") {
    return readOneCard(lines, version);
}

std::vector<std::string> extras(const VCardEntity& e) {
    std::vector<std::string> all;
    for (const auto& v : e.properties[kCXVCardExtraProperty].array()) all.push_back(v.string());
    return all;
}

using Lines = std::vector<std::string>;

void expectComesBack(const VCardEntity& e) {
    for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
        std::string text = vcardText(e, version);
        auto again = readText(text);
        for (const auto& error : again.errors) ADD_FAILURE() << error.description() << "\n" << text;
        ASSERT_EQ(again.entities.size(), 1u) << text;
        const VCardEntity& b = again.entities[0];
        EXPECT_EQ(withoutIdentifiers(b.properties), withoutIdentifiers(e.properties))
            << text << description(b.properties) << description(e.properties);
        EXPECT_EQ(b.isGroup, e.isGroup) << text;
        EXPECT_EQ(b.categories, e.categories) << text;
        EXPECT_EQ(b.members, e.members) << text;
    }
}

void expectKept(const std::string& lines, const Lines& kept) {
    const VCardEntity e = readOne(lines);
    EXPECT_EQ(extras(e), kept);
    expectComesBack(e);
}

bool bothVersionsContain(const VCardEntity& e, const std::string& part) {
    return vcardText(e, VCardVersion::v3).find(part) != std::string::npos &&
           vcardText(e, VCardVersion::v4).find(part) != std::string::npos;
}

std::string exactLine(const std::string& property, const Value& value) {
    return "X-ROLVANE-VALUE;X-NAME=" + property + ":" + vcardEncodeBase64(BinaryValue::encode(value)) + "\r\n";
}

TEST(VCardLossless, EqualLinesKeepTheParametersOfEach) {
    expectKept("FN:x\r\nTEL;X-A=1:5\r\nTEL;X-A=1:5\r\n",
               {"+TEL;X-A=1;X-ROLVANE-LABEL=\"\":5", "+TEL;X-A=1;X-ROLVANE-LABEL=\"\":5"});
}

TEST(VCardLossless, AnUnknownLineThatStandsTwiceStaysTwice) {
    expectKept("FN:x\r\nX-PET:cat\r\nX-PET:cat\r\n", {"X-PET:cat", "X-PET:cat"});
}

TEST(VCardLossless, EqualValuesOfDifferentPreferenceKeepTheirParameters) {
    auto e = readOne("FN:x\r\nTEL;PREF=2;X-A=1:5\r\nTEL;PREF=1;X-B=1:5\r\n");
    EXPECT_EQ(extras(e).size(), 2u);
    expectComesBack(e);
}

TEST(VCardLossless, ALineWithNothingInItLeavesThePlaceToTheNext) {
    auto e = readOne("FN:x\r\nNICKNAME:,\r\nNICKNAME:Jim\r\nORG: ;\r\nORG:Mill\r\nN:;;;;\r\nN:Lee;Ann;;;\r\n");
    EXPECT_EQ(e.properties[kCXNicknameProperty].string(), "Jim");
    EXPECT_EQ(e.properties[kCXOrganizationProperty].string(), "Mill");
    EXPECT_EQ(e.properties[kCXLastNameProperty].string(), "Lee");
    EXPECT_EQ(extras(e), Lines{});
    expectComesBack(e);
}

TEST(VCardLossless, ALabelOfALineThatHasNoneIsKept) {
    expectKept("FN:x\r\nitem1.X-PET:cat\r\nitem1.X-ABLABEL:Tom\r\n", {"item1.X-ABLABEL:Tom", "item1.X-PET:cat"});
}

TEST(VCardLossless, AFurtherLabelOfAGroupIsKeptAndDoesNotBecomeTheLabel) {
    auto e = readOne("FN:x\r\nitem1.TEL;TYPE=home:1\r\nitem1.X-PET:cat\r\nitem1.X-ABLABEL:Home\r\n"
                     "item1.X-OTHERLABEL:Cabin\r\n");
    EXPECT_EQ(CXMultiValue::fromValue(e.properties[kCXPhoneProperty])->labelAtIndex(0), "Home");
    EXPECT_EQ(extras(e),
              (Lines{"+item1.TEL;TYPE=home;X-ROLVANE-LABEL=Home:1", "item1.X-OTHERLABEL:Cabin", "item1.X-PET:cat"}));
    expectComesBack(e);
}

TEST(VCardLossless, OneLabelServesAllLinesOfItsGroup) {
    auto e = readOne("FN:x\r\nitem1.TEL:1\r\nitem1.TEL:2\r\nitem1.X-ABLABEL:Cabin\r\n");
    for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
        std::string text = vcardText(e, version);
        size_t at = text.find("item1.X-ABLabel:Cabin\r\n");
        ASSERT_NE(at, std::string::npos) << text;
        EXPECT_EQ(text.find("LABEL", at + 15), std::string::npos) << text;
    }
    expectComesBack(e);
}

TEST(VCardLossless, AGroupNameCountsOnlyTheLinesThatAreWrittenAgain) {
    expectKept("FN:x\r\nitem1.TEL:1\r\nitem1.PRODID:a program\r\n", {});
}

TEST(VCardLossless, AnAnniversaryLeavesTheOtherLinesOfItsGroupUnlabelled) {
    auto e = readOne("FN:x\r\nitem1.ANNIVERSARY:19850412\r\nitem1.TEL;TYPE=car:1\r\n");
    EXPECT_FALSE(bothVersionsContain(e, "X-ROLVANE-VALUE")) << vcardText(e, VCardVersion::v3);
    EXPECT_TRUE(vcardText(e, VCardVersion::v3).find("item1.X-ANNIVERSARY:19850412\r\n") != std::string::npos);
    expectComesBack(e);
}

TEST(VCardLossless, ParametersOfATextByAForeignNameAreWrittenUnderOurs) {
    auto e = readOne("FN:x\r\nX-MAIDENNAME;LANGUAGE=en:Lee\r\n", "3.0");
    EXPECT_TRUE(bothVersionsContain(e, "X-ROLVANE-MAIDEN-NAME;LANGUAGE=en:Lee\r\n"));
    expectComesBack(e);
}

TEST(VCardLossless, ParametersOfABirthdayAreKept) {
    auto full = readOne("FN:x\r\nBDAY;VALUE=date;X-OMIT-YEAR=1604:1604-04-12\r\n", "3.0");
    EXPECT_NE(vcardText(full, VCardVersion::v3).find("BDAY;X-OMIT-YEAR=1604:1604-04-12\r\n"), std::string::npos);
    EXPECT_NE(vcardText(full, VCardVersion::v4).find("BDAY;X-OMIT-YEAR=1604:--0412\r\n"), std::string::npos);
    expectComesBack(full);
    auto text = readOne("FN:x\r\nBDAY;VALUE=text;LANGUAGE=fr:vers 1800\r\n");
    EXPECT_TRUE(bothVersionsContain(text, "BDAY;LANGUAGE=fr;VALUE=text:vers 1800\r\n"));
    expectComesBack(text);
}

TEST(VCardLossless, ABirthdayInTheYearNoughtIsText) {
    auto e = readOne("FN:x\r\nBDAY:00000412\r\nBDAY:19850412\r\n");
    EXPECT_EQ(e.properties[kCXBirthdayTextProperty].string(), "00000412");
    EXPECT_EQ(extras(e), Lines{"BDAY:19850412"});
    expectComesBack(e);
}

TEST(VCardLossless, ANicknameWithACommaOfItsOwnKeepsItsParameters) {
    auto e = readOne("FN:x\r\nNICKNAME;LANGUAGE=en:a\\, \\, b\r\n");
    EXPECT_TRUE(bothVersionsContain(e, "NICKNAME;LANGUAGE=en:a\\, \\, b\r\n"));
    expectComesBack(e);
}

TEST(VCardLossless, ACountryCodeWithBlanksCostsTheAddressNothing) {
    auto e = readOne("FN:x\r\nADR;LABEL=front;CC=\" GB\":;;S;;;;\r\n");
    EXPECT_TRUE(bothVersionsContain(e, "ADR;LABEL=front;CC=\" GB\":;;S;;;;\r\n"));
    expectComesBack(e);
}

TEST(VCardLossless, PartsBeyondTheKnownOnesOfAddressAndNameAreKept) {
    auto e =
        readOne("FN:x\r\nN:Lee;Ann;;;;Garcia\\;x;II\r\nADR;TYPE=home:;;S;C;;;;room 3;;floor\\, 2\r\nADR:;;T;;;;;;\r\n");
    EXPECT_TRUE(bothVersionsContain(e, "N:Lee;Ann;;;;Garcia\\;x;II\r\n"));
    EXPECT_TRUE(bothVersionsContain(e, "ADR;TYPE=home:;;S;C;;;;room 3;;floor\\, 2\r\n"));
    EXPECT_TRUE(bothVersionsContain(e, "ADR:;;T;;;;\r\n"));
    expectComesBack(e);
    auto nothingElse = readOne("N:;;;;;Garcia\r\n");
    EXPECT_EQ(extras(nothingElse), Lines{"N:;;;;;Garcia"});
    expectComesBack(nothingElse);
}

TEST(VCardLossless, ParametersOfAPhotoAreKeptUntilItIsAnotherPhoto) {
    auto e =
        readOne("FN:x\r\nitem1.PHOTO;ENCODING=b;TYPE=PNG;X-CROP=\"1,2\":iVBORw0KGgo=\r\nitem1.X-PET:cat\r\n", "3.0");
    EXPECT_TRUE(vcardText(e, VCardVersion::v3).find("item1.PHOTO;ENCODING=b;TYPE=PNG;X-CROP=\"1,2\":iVBORw0KGgo=") !=
                std::string::npos);
    EXPECT_TRUE(vcardText(e, VCardVersion::v4).find("item1.PHOTO;X-CROP=\"1,2\":data:image/png;base64,iVBO") !=
                std::string::npos);
    expectComesBack(e);
    e.properties.set(kCXPhotoProperty, Bytes{1, 2, 3});
    EXPECT_EQ(vcardText(e, VCardVersion::v4).find("X-CROP"), std::string::npos);
}

TEST(VCardLossless, ASecondHomePageIsKept) {
    auto e = readOne("FN:x\r\nURL;X-ROLVANE-HOMEPAGE=1:http://a.test\r\nURL;X-ROLVANE-HOMEPAGE=1:http://b.test\r\n");
    EXPECT_EQ(e.properties[kCXHomePageProperty].string(), "http://a.test");
    EXPECT_EQ(extras(e), Lines{"URL;X-ROLVANE-HOMEPAGE=1:http://b.test"});
    expectComesBack(e);
}

TEST(VCardLossless, AGroupKeepsFurtherNamesTheirParametersAndItsCategories) {
    auto e = readOne("KIND:group\r\nFN;LANGUAGE=en:Choir\r\nFN;LANGUAGE=de:Chor\r\nCATEGORIES:Music\r\n");
    EXPECT_EQ(e.properties[kCXGroupNameProperty].string(), "Choir");
    EXPECT_EQ(extras(e), (Lines{"+FN;LANGUAGE=en:Choir", "CATEGORIES:Music", "FN;LANGUAGE=de:Chor"}));
    expectComesBack(e);
}

// --- lines beside properties that are no longer there ----------------------------------------------------------------

TEST(VCardLossless, AKeptLineIsNotTakenForAPropertyThatThePersonRemoved) {
    auto e = readOne("FN:Ann\r\nFN:Anna\r\nN:;Ann;;;\r\nNICKNAME:Jim\r\nNICKNAME:Jack\r\nNICKNAME:Joe\r\n");
    for (const char* property : {kCXNicknameProperty, kCXFirstNameProperty}) e.properties.remove(property);
    for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
        std::string text = vcardText(e, version);
        EXPECT_NE(text.find("X-ROLVANE-KEPT:NICKNAME:Jack\r\n"), std::string::npos) << text;
        EXPECT_NE(text.find("X-ROLVANE-KEPT:FN:Anna\r\n"), std::string::npos) << text;
        EXPECT_EQ(text.find("X-ROLVANE-VALUE"), std::string::npos) << text;
    }
    expectComesBack(e);
}

TEST(VCardLossless, AKeptLineNeverMakesAPersonAGroup) {
    VCardEntity e;
    e.properties = {
        {kCXFirstNameProperty, "Ann"},
        {kCXVCardExtraProperty, Array{"CATEGORIES:Work", "KIND:group", "X-ROLVANE-UNREAD:PHOTO\\;ENCODING=b:!!"}}};
    expectComesBack(e);
}

TEST(VCardLossless, AKeptLineOfAnUnknownCharacterSetDoesNotMakeTheCardUnreadable) {
    VCardEntity e;
    e.properties = {{kCXFirstNameProperty, "Ann"}, {kCXVCardExtraProperty, Array{"X-PET;CHARSET=none:cat"}}};
    for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
        auto again = readText(vcardText(e, version));
        ASSERT_EQ(again.entities.size(), 1u) << vcardText(e, version);
        EXPECT_EQ(extras(again.entities[0]), Lines{"X-ROLVANE-KEPT:X-PET\\;CHARSET=none:cat"});
        expectComesBack(again.entities[0]);
    }
}

TEST(VCardLossless, AWrappedLineCannotEndTheCardOrSayWhoseItIs) {
    for (std::string inner : {"UID:other", "END:VCARD", "BEGIN:VCARD", "VERSION:2.1", "no line", "X-ROLVANE-KEPT:A:b",
                              "A;CHARSET=none:b", "A;ENCODING=QUOTED-PRINTABLE:b="}) {
        inner = vcardEscape(inner);
        auto e = readOne("UID:mine\r\nFN:x\r\nX-ROLVANE-KEPT:" + inner + "\r\n");
        EXPECT_EQ(e.uid, "mine");
        EXPECT_EQ(extras(e), (Lines{"UID:mine", "X-ROLVANE-KEPT:" + inner}));
        expectComesBack(e);
    }
}

TEST(VCardLossless, ACardHasOneUIDEvenWhenTwoWereKept) {
    VCardEntity e;
    e.properties = {{kCXFirstNameProperty, "Ann"},
                    {kCXVCardExtraProperty, Array{"UID;CHARSET=none:c", "UID:a", "UID:b"}}};
    for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
        auto again = readText(vcardText(e, version));
        ASSERT_EQ(again.entities.size(), 1u);
        EXPECT_EQ(again.entities[0].uid, "a");
        EXPECT_EQ(extras(again.entities[0]), Lines{"UID:a"});
    }
}

// --- exact values ----------------------------------------------------------------------------------------------------

TEST(VCardLossless, AnExactValueTakesTheParametersOfItsLineOver) {
    auto e = readOne("FN:x\r\nNICKNAME;LANGUAGE=en:Jim\r\n" + exactLine(kCXNicknameProperty, Value("Bob")));
    EXPECT_EQ(e.properties[kCXNicknameProperty].string(), "Bob");
    EXPECT_EQ(extras(e), Lines{"+NICKNAME;LANGUAGE=en:Bob"});
    expectComesBack(e);
}

TEST(VCardLossless, AnExactValueDropsTheParametersOfWhatItDoesNotHold) {
    CXMutableMultiValue phones;
    phones.addValue("1", "");
    phones.addValue("2", "");
    phones.addValue(Value(7), "");
    auto e = readOne("FN:x\r\nTEL;PREF=1;X-B=1:2\r\nTEL;X-A=1:1\r\nTEL;X-C=1:3\r\n" +
                     exactLine(kCXPhoneProperty, phones.toValue()));
    EXPECT_EQ(extras(e), (Lines{"+TEL;X-A=1;X-ROLVANE-LABEL=\"\":1", "+TEL;X-B=1;X-ROLVANE-LABEL=\"\":2"}))
        << "a preference that contradicts the order goes too";
    expectComesBack(e);
}

TEST(VCardLossless, ACardSetsNothingThatIsWrittenByRulesOfItsOwn) {
    for (const char* property : {kCXUIDProperty, kCXCreationDateProperty, kCXModificationDateProperty,
                                 kCXCategoriesProperty, kCXVCardExtraProperty}) {
        auto e = readOne("FN:x\r\n" + exactLine(property, Array{"X-PET:cat"}));
        EXPECT_FALSE(e.properties[property]) << property;
        expectComesBack(e);
    }
}

TEST(VCardLossless, ParametersOfCategoriesStayWithTheNamesThatAreStillThere) {
    auto e = readOne("FN:x\r\nCATEGORIES:Home\r\nCATEGORIES;TYPE=work;X-A=1:Mill,Board\\, old\r\nCATEGORIES:Club\r\n");
    EXPECT_EQ(e.categories, (Lines{"Home", "Mill", "Board, old", "Club"}));
    EXPECT_EQ(extras(e), Lines{"+CATEGORIES;TYPE=work;X-A=1:Mill,Board\\, old"});
    expectComesBack(e);
    e.categories = {"Board, old", "Home"};
    EXPECT_TRUE(bothVersionsContain(e, "\r\nCATEGORIES;TYPE=work;X-A=1:Board\\, old\r\nCATEGORIES:Home\r\n"));
    e.categories = {"Home"};
    EXPECT_FALSE(bothVersionsContain(e, "X-A=1"));
    expectComesBack(readOne("FN:x\r\nCATEGORIES:A\r\nCATEGORIES;X-A=1:A,B,,B\r\nCATEGORIES;X-A=2:B\r\n"));
    expectComesBack(readOne("FN:x\r\na.CATEGORIES:Mill\r\na.X-COLOUR:red\r\n"));
}

TEST(VCardLossless, ParametersOfTheKindAreKeptWhileItIsThatKind) {
    for (const char* kind : {"org", "individual"}) {
        auto e = readOne("FN:x\r\nKIND;X-A=1:" + std::string(kind) + "\r\nX-Y-KIND;X-B=2:" + kind + "\r\n");
        EXPECT_EQ(extras(e), (Lines{"+KIND;X-A=1:" + std::string(kind), "X-Y-KIND;X-B=2:" + std::string(kind)}));
        expectComesBack(e);
        EXPECT_NE(vcardText(e, VCardVersion::v4).find("\r\nKIND;X-A=1:" + std::string(kind)), std::string::npos);
    }
    auto company = readOne("FN:x\r\nKIND;X-A=1:organization\r\n");
    expectComesBack(company);
    company.properties.remove(kCXIsCompanyProperty);
    EXPECT_FALSE(bothVersionsContain(company, "KIND")) << "it is another kind now";
    expectComesBack(readOne("FN:x\r\nKIND;X-A=1:group\r\n"));
}

TEST(VCardLossless, ParametersOfAMemberAreKeptAsLongAsItIsOne) {
    auto e = readOne("FN:x\r\nKIND:group\r\nMEMBER;X-ROLE=chair:urn:uuid:ABCDEF00-0000-4000-8000-000000000001\r\n"
                     "MEMBER:mailto:jo@x\r\nMEMBER;PREF=1;VALUE=uri:mailto:al@x\r\n");
    EXPECT_EQ(extras(e), (Lines{"+MEMBER;PREF=1:" + vcardMemberKey("mailto:al@x"),
                                "+MEMBER;X-ROLE=chair:abcdef00-0000-4000-8000-000000000001"}));
    expectComesBack(e);
    e.members = {"urn:uuid:abcdef00-0000-4000-8000-000000000001"};
    EXPECT_TRUE(bothVersionsContain(e, "MEMBER;X-ROLE=chair:urn:uuid:abcdef00")) << "spelt in another way";
    EXPECT_FALSE(bothVersionsContain(e, "PREF"));
    std::swap(e.members, e.subgroups);
    EXPECT_TRUE(bothVersionsContain(e, "X-ROLVANE-SUBGROUP;X-ROLE=chair:urn:uuid:abcdef00"));
}

TEST(VCardLossless, ATextOfMoreThanAMegabyteIsReadAgain) {
    VCardEntity e;
    e.properties.set(kCXNoteProperty, std::string(1 << 20, 'n') + "\nand more");
    auto again = readText(vcardText(e, VCardVersion::v4));
    ASSERT_EQ(again.entities.size(), 1u);
    EXPECT_EQ(again.entities[0].properties[kCXNoteProperty], e.properties[kCXNoteProperty]);
}

// Lines whose values are not in the person's dictionary, with all that may stand before the colon.
RC_GTEST_PROP(VCardLossless, WhatIsSaidBesidesKindCategoriesAndMembersComesBack, ()) {
    const bool group = *rc::gen::arbitrary<bool>();
    const auto anyOf = [](std::vector<std::string> texts) { return *rc::gen::elementOf(std::move(texts)); };
    std::string lines = "FN:x\r\n";
    if (group) lines += "KIND:group\r\n";
    const int count = *rc::gen::inRange(0, 8);
    for (int i = 0; i < count; i++) {
        lines += anyOf({"", "", "a.", "b."});
        const std::string parameters = anyOf({"", ";X-A=1", ";PREF=2", ";TYPE=work;X-B=\"a,b\"", ";VALUE=text"});
        const std::string number = std::to_string(i);
        switch (*rc::gen::inRange(0, 4)) {
        case 0: lines += "KIND" + parameters + ":" + (group ? "group" : anyOf({"org", "individual"})); break;
        case 1: lines += "X-OTHER-KIND" + parameters + ":" + (group ? "group" : "individual"); break;
        case 2:
            lines += "CATEGORIES" + parameters + ":c" + number + anyOf({"", ",d" + number, "\\,e", ",c1", ",,"});
            break;
        default:
            lines += (group ? "MEMBER" : "X-PET") + parameters + ":" +
                     anyOf({"urn:x:1", "urn:uuid:abcdef00-0000-4000-8000-00000000000a",
                            "urn:uuid:ABCDEF00-0000-4000-8000-00000000000A"});
            break;
        }
        lines += "\r\n";
    }
    expectComesBack(readOne(lines));
    RC_ASSERT(!::testing::Test::HasFailure());
}

// Each of them would be taken for the kind once the one before it is out of the way.
VCardEntity personOfManyKinds(int kinds) {
    VCardEntity e;
    e.properties.set(kCXLastNameProperty, "Many");
    Array kept;
    for (int i = 0; i < kinds; i++) kept.append("X-A" + std::to_string(i) + "-KIND;X-B=1:individual");
    e.properties.set(kCXVCardExtraProperty, kept);
    return e;
}

TEST(VCardLossless, LinesThatTakeEachOthersPlaceAreWrittenInTimeProportionalToTheirNumber) {
    std::string last = personOfManyKinds(12).properties[kCXVCardExtraProperty].array()[11].string();
    EXPECT_TRUE(bothVersionsContain(personOfManyKinds(12), "X-ROLVANE-KEPT:" + vcardEscape(last)));
    const auto seconds = [](int kinds) {
        const VCardEntity e = personOfManyKinds(kinds);
        return test::leastCpuSeconds([&](auto start) {
            start();
            EXPECT_FALSE(vcardText(e, VCardVersion::v4).empty());
        });
    };
    EXPECT_LT(seconds(800), 8 * seconds(200)) << "16 times as much when each costs a card";
}

} // namespace
} // namespace rolvane
