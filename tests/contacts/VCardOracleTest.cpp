// An independent reader and writer of vCards must see in our text what we mean, and we in its text what it means.

#include "VCardGenerators.h"

#include "contacts/vcard/VCardFields.h"
#include "contacts/vcard/VCardLabels.h"
#include "contacts/vcard/VCardText.h"

#include <libebook-contacts/libebook-contacts.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <fstream>
#include <iterator>
#include <memory>
#include <ostream>
#include <sstream>

namespace rolvane {
namespace {

using namespace vcardtest;

using Labelled = std::vector<std::pair<std::string, std::string>>;

// What both sides must agree on.
struct View {
    std::string formattedName, note, title;
    std::vector<std::string> name, organization;
    Labelled phones, mails, addresses;
    std::string photo; // base64

    friend bool operator==(const View&, const View&) = default;
    friend std::ostream& operator<<(std::ostream& out, const View& v) {
        out << "\nFN    " << v.formattedName << "\nNOTE  " << v.note << "\nTITLE " << v.title;
        for (const auto& s : v.name) out << "\nN     " << s;
        for (const auto& s : v.organization) out << "\nORG   " << s;
        for (const auto* list : {&v.phones, &v.mails, &v.addresses})
            for (const auto& [label, value] : *list) out << "\n      [" << label << "] " << value;
        return out << "\nPHOTO " << v.photo.substr(0, 60) << " (" << v.photo.size() << ")\n";
    }
};

void dropTrailingEmpty(std::vector<std::string>& list) {
    while (!list.empty() && list.back().empty()) list.pop_back();
}

// --- what we see ---------------------------------------------------------------------------------------------------

Labelled texts(const Dictionary& p, const char* property) {
    Labelled out;
    auto multi = CXMultiValue::fromValue(p[property]);
    for (size_t i = 0; multi && i < multi->count(); i++)
        out.emplace_back(multi->labelAtIndex(i), multi->valueAtIndex(i).string());
    return out;
}

std::string addressText(const Dictionary& a) {
    std::string out;
    for (const char* key : {kCXAddressPOBoxKey, kCXAddressExtendedKey, kCXAddressStreetKey, kCXAddressCityKey,
                            kCXAddressStateKey, kCXAddressZIPKey, kCXAddressCountryKey})
        (out += a[key].string()) += '|';
    return out;
}

View viewOf(const Dictionary& p) {
    View v;
    v.formattedName = p[kCXFormattedNameProperty] ? p[kCXFormattedNameProperty].string() : vcardDerivedFormattedName(p);
    v.note = p[kCXNoteProperty].string();
    v.title = p[kCXJobTitleProperty].string();
    for (const char* key :
         {kCXLastNameProperty, kCXFirstNameProperty, kCXMiddleNameProperty, kCXTitleProperty, kCXSuffixProperty})
        v.name.push_back(p[key].string());
    dropTrailingEmpty(v.name);
    v.organization = {p[kCXOrganizationProperty].string()};
    std::string units = p[kCXDepartmentProperty].string();
    for (size_t start = 0; !units.empty() && start != std::string::npos;) {
        size_t end = units.find("; ", start);
        v.organization.push_back(units.substr(start, end == std::string::npos ? end : end - start));
        start = end == std::string::npos ? end : end + 2;
    }
    dropTrailingEmpty(v.organization);
    v.phones = texts(p, kCXPhoneProperty);
    v.mails = texts(p, kCXEmailProperty);
    auto addresses = CXMultiValue::fromValue(p[kCXAddressProperty]);
    for (size_t i = 0; addresses && i < addresses->count(); i++)
        v.addresses.emplace_back(addresses->labelAtIndex(i), addressText(addresses->valueAtIndex(i).dictionary()));
    v.photo = vcardEncodeBase64(p[kCXPhotoProperty].data());
    return v;
}

// --- what the library sees -----------------------------------------------------------------------------------------

struct Unref {
    void operator()(gpointer object) const { g_object_unref(object); }
};
using Card = std::unique_ptr<EVCard, Unref>;

std::vector<std::string> valuesOf(EVCardAttribute* attribute) {
    std::vector<std::string> out;
    for (GList* l = e_vcard_attribute_get_values(attribute); l; l = l->next)
        out.emplace_back(static_cast<const char*>(l->data));
    return out;
}

std::string labelOf(EVCardAttribute* attribute, const char* name) {
    std::vector<std::string> types;
    for (GList* p = e_vcard_attribute_get_params(attribute); p; p = p->next) {
        auto* param = static_cast<EVCardAttributeParam*>(p->data);
        if (!vcardEqualNoCase(e_vcard_attribute_param_get_name(param), "TYPE")) continue;
        for (GList* v = e_vcard_attribute_param_get_values(param); v; v = v->next)
            types.push_back(vcardLower(static_cast<const char*>(v->data)));
    }
    return vcardLabelForTypes(name, types);
}

View viewOf(EVCard* card) {
    View v;
    for (GList* l = e_vcard_get_attributes(card); l; l = l->next) {
        auto* a = static_cast<EVCardAttribute*>(l->data);
        std::string name = vcardUpper(e_vcard_attribute_get_name(a));
        auto values = valuesOf(a);
        std::string first = values.empty() ? "" : values.front();
        if (name == "FN") v.formattedName = first;
        if (name == "NOTE") v.note = first;
        if (name == "TITLE") v.title = first;
        if (name == "N") v.name = values, dropTrailingEmpty(v.name);
        if (name == "ORG") v.organization = values, dropTrailingEmpty(v.organization);
        if (name == "TEL") v.phones.emplace_back(labelOf(a, "TEL"), first);
        if (name == "EMAIL") v.mails.emplace_back(labelOf(a, "EMAIL"), first);
        if (name == "ADR") {
            std::string text;
            values.resize(7);
            for (const auto& part : values) (text += part) += '|';
            v.addresses.emplace_back(labelOf(a, "ADR"), text);
        }
        if (name == "PHOTO") {
            GString* bytes = e_vcard_attribute_get_value_decoded(a);
            if (bytes) v.photo = vcardEncodeBase64(Bytes(bytes->str, bytes->str + bytes->len));
            if (bytes) g_string_free(bytes, TRUE);
        }
    }
    return v;
}

Card parse(const std::string& text) {
    return Card(e_vcard_new_from_string(text.c_str()));
}

View ourView(const std::string& text) {
    auto r = readText(text);
    for (const auto& e : r.errors) ADD_FAILURE() << e.description();
    return r.entities.size() == 1 ? viewOf(r.entities[0].properties) : View{};
}

// --- the same text, both readers -----------------------------------------------------------------------------------

TEST(VCardOracle, BothReadersSeeTheSameInAVariedCorpus) {
    const std::vector<std::string> corpus{
        "N:Stevenson;John;Philip;Dr.;Jr.\r\nFN:Dr. John Stevenson\r\nTEL;TYPE=HOME,VOICE:+1 202 555 "
        "0100\r\nTEL;TYPE=CELL:+1 202 555 0101\r\n",
        "FN:Änne "
        "Süßkind\r\nN:Süßkind;Änne;;;\r\nEMAIL;TYPE=INTERNET;TYPE=WORK:anne@example.org\r\nEMAIL;TYPE=HOME:a@b."
        "test\r\n",
        "FN:山田\r\nN:山田;太郎;;;\r\nADR;TYPE=HOME:;;欅通り 3-14;小川町;埼玉県;000-0000;日本\r\nNOTE:一行\\n二行\\, "
        "三行\\; 四行\r\n",
        "FN:Folded\r\nN:Fol\r\n ded;;;;\r\nNOTE:one two thr\r\n ee four fi\r\n  ve\r\n",
        "FN:Org\r\nN:;;;;\r\nORG:ABC\\, Inc.;North American Division;Marketing\r\nTITLE:Director\\, Research\r\n",
        "FN:Back\\\\slash\r\nN:Back\\\\slash;Semi\\;colon;Com\\,ma;;\r\n",
        "FN:Photo\r\nN:Photo;;;;\r\nPHOTO;ENCODING=b;TYPE=JPEG:/9j/4AAQSkZJRgABAQAAAQABAAD//gA7Q1JFQVRPUjogZ2Q\r\n "
        "tanBlZw==\r\n",
        "item1.TEL:+44 20 7946 0001\r\nitem1.X-LABEL:Hut\r\nFN:Group\r\nN:Group;;;;\r\n",
        "FN:Fax\r\nN:Fax;;;;\r\nTEL;TYPE=WORK;TYPE=FAX:+1 202 555 0102\r\nTEL;TYPE=\"HOME\",FAX:+1 202 555 "
        "0103\r\nTEL;TYPE=PAGER:7\r\n",
        "FN:Many\r\nN:Many;;;;\r\nADR;TYPE=WORK:PO 1;Room 2;Street "
        "3\\nRear;City;State;ZIP;Country\r\nADR;TYPE=HOME:;;Only Street;;;;\r\n",
        "FN:שלום עולם\r\nN:עולם;שלום;;;\r\nNOTE:مرحبا\\nनमस्ते\\nสวัสดี\\n😀\r\n",
    };
    for (const auto& lines : corpus) {
        std::string text = "BEGIN:VCARD\r\nVERSION:3.0\r\n" + lines + "END:VCARD";
        View theirs = viewOf(parse(text).get()), ours = ourView(text + "\r\n");
        // A label of its own is said by another line; the library leaves it there.
        if (lines.find("X-LABEL") != std::string::npos) {
            EXPECT_EQ(ours.phones.at(0).first, "Hut");
            ours.phones.at(0).first = "";
        }
        EXPECT_EQ(ours, theirs) << text;
    }
}

TEST(VCardOracle, QuotedPrintableOfOldCardsReadsTheSame) {
    std::string text = "BEGIN:VCARD\r\nVERSION:2.1\r\nN;ENCODING=QUOTED-PRINTABLE;CHARSET=UTF-8:M=C3=BCller;J=C3=B6rg;;"
                       ";\r\nFN;QUOTED-PRINTABLE:J=C3=B6rg\r\n"
                       "TEL;HOME;VOICE:+49 30 23125 001\r\nTEL;CELL:+49 30 23125 002\r\nEND:VCARD";
    View theirs = viewOf(parse(text).get());
    // The names are stated here, because getting at decoded text is another call of the library's; the rest is
    // compared.
    theirs.name = {"Müller", "Jörg"};
    theirs.formattedName = "Jörg";
    EXPECT_EQ(ourView(text + "\r\n"), theirs);
}

TEST(VCardOracle, BothReadersSeeTheSameInTheDemonstrationsPeople) {
    std::ifstream in(ROLVANE_SOURCE_DIR "/share/demo/people.vcf", std::ios::binary);
    std::string all((std::istreambuf_iterator<char>(in)), {});
    size_t compared = 0;
    for (size_t at = 0, end; (end = all.find("END:VCARD\r\n", at)) != std::string::npos; at = end + 11) {
        std::string text = all.substr(at, end + 9 - at);
        if (text.find("VERSION:3.0") == std::string::npos || text.find("-KIND:") != std::string::npos) continue;
        View theirs = viewOf(parse(text).get()), ours = ourView(text + "\r\n");
        for (auto [mine, other] : {std::pair(&ours.phones, &theirs.phones), std::pair(&ours.mails, &theirs.mails)})
            for (size_t i = 0; i < mine->size() && i < other->size(); i++)
                if ((*other)[i].first.empty()) (*mine)[i].first.clear(); // labels of their own stand in another line
        ASSERT_EQ(ours, theirs) << text;
        compared++;
    }
    EXPECT_GT(compared, 150u);
}

// --- generated people ----------------------------------------------------------------------------------------------

// A text that has no blanks at its ends: what structured names do with those differs between programs.
std::string word() {
    std::string s = *someText();
    std::erase(s, '\t');
    std::string t(vcardTrim(s));
    return t.empty() ? "x" : t;
}

Dictionary plainPerson() {
    Dictionary p;
    for (const char* key :
         {kCXFirstNameProperty, kCXLastNameProperty, kCXMiddleNameProperty, kCXTitleProperty, kCXSuffixProperty,
          kCXFormattedNameProperty, kCXNoteProperty, kCXJobTitleProperty, kCXOrganizationProperty})
        if (*rc::gen::arbitrary<bool>()) p.set(key, word());
    auto label = [] { return *rc::gen::element<std::string>("Home", "Work", "Other", ""); };
    for (const char* key : {kCXPhoneProperty, kCXEmailProperty}) {
        CXMutableMultiValue m;
        for (int n = *rc::gen::inRange(0, 4); n > 0; n--) m.addValue(word(), label());
        if (!m.empty()) p.set(key, m.toValue());
    }
    CXMutableMultiValue addresses;
    for (int n = *rc::gen::inRange(0, 3); n > 0; n--)
        addresses.addValue(
            Dictionary{{kCXAddressStreetKey, word()}, {kCXAddressCityKey, word()}, {kCXAddressCountryKey, word()}},
            label());
    if (!addresses.empty()) p.set(kCXAddressProperty, addresses.toValue());
    if (*rc::gen::arbitrary<bool>()) {
        Bytes photo = *rc::gen::nonEmpty<Bytes>();
        p.set(kCXPhotoProperty, photo);
        p.set(kCXPhotoTypeProperty, "image/png");
    }
    return p;
}

RC_GTEST_PROP(VCardOracleProperty, TheLibraryReadsWhatWeWrite, ()) {
    VCardEntity e;
    e.properties = plainPerson();
    View ours = viewOf(e.properties);
    std::string text = vcardText(e, VCardVersion::v3);
    RC_LOG() << text << ours << viewOf(parse(text).get());
    RC_ASSERT(viewOf(parse(text).get()) == ours);
    View theirs = viewOf(parse(vcardText(e, VCardVersion::v4)).get());
    theirs.photo = ours.photo; // it knows inline photos of 3.0 only
    RC_ASSERT(theirs == ours);
}

void append(EVCard* card, const char* name, const std::vector<std::string>& values, const std::string& type = "") {
    EVCardAttribute* a = e_vcard_attribute_new(nullptr, name);
    if (!type.empty()) e_vcard_attribute_add_param_with_value(a, e_vcard_attribute_param_new("TYPE"), type.c_str());
    for (const auto& v : values) e_vcard_attribute_add_value(a, v.c_str());
    e_vcard_append_attribute(card, a);
}

RC_GTEST_PROP(VCardOracleProperty, WeReadWhatTheLibraryWrites, ()) {
    Card card(e_vcard_new());
    append(card.get(), "FN", {word()});
    append(card.get(), "N", {word(), word(), word(), word(), word()});
    append(card.get(), "NOTE", {word()});
    append(card.get(), "ORG", {word(), word()});
    for (int n = *rc::gen::inRange(0, 3); n > 0; n--)
        append(card.get(), "TEL", {word()}, *rc::gen::element<std::string>("HOME", "WORK", "CELL", ""));
    for (int n = *rc::gen::inRange(0, 3); n > 0; n--)
        append(card.get(), "EMAIL", {word()}, *rc::gen::element<std::string>("HOME", "WORK", ""));
    append(card.get(), "ADR", {"", word(), word(), word(), word(), word(), word()}, "WORK");
    Bytes photo = *rc::gen::nonEmpty<Bytes>();
    EVCardAttribute* a = e_vcard_attribute_new(nullptr, "PHOTO");
    e_vcard_attribute_add_param_with_value(a, e_vcard_attribute_param_new("ENCODING"), "b");
    e_vcard_attribute_add_value_decoded(a, reinterpret_cast<const char*>(photo.data()), static_cast<int>(photo.size()));
    e_vcard_append_attribute(card.get(), a);
    View theirs = viewOf(card.get());
    char* written = e_vcard_to_string(card.get(), EVC_FORMAT_VCARD_30);
    std::string text = written;
    g_free(written);
    auto read = readText(text + "\r\n");
    RC_ASSERT(read.errors.empty());
    RC_ASSERT(read.entities.size() == 1u);
    View ours = viewOf(read.entities[0].properties);
    RC_LOG() << text << theirs << ours;
    // An organisation's units are one text with us, in which "; " separates them.
    theirs.organization = {theirs.organization[0], theirs.organization[1]};
    ours.organization = {read.entities[0].properties[kCXOrganizationProperty].string(),
                         read.entities[0].properties[kCXDepartmentProperty].string()};
    RC_ASSERT(ours == theirs);
}

} // namespace
} // namespace rolvane
