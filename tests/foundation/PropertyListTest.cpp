#include "foundation/PropertyList.h"

#include "Generators.h"

#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>

#include <cmath>
#include <cstring>
#include <limits>

namespace rolvane {
namespace {

constexpr const char* kHead =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
    "<!DOCTYPE plist PUBLIC \"-//Rolvane//DTD PLIST 1.0//EN\" \"http://rolvane.net/DTDs/PropertyList-1.0.dtd\">\n"
    "<plist version=\"1.0\">\n";

std::string document(const std::string& body) {
    return kHead + body + "</plist>\n";
}
Value read(const std::string& body) {
    return PropertyList::fromXML(document(body));
}

// The reason with which the reader refuses the text; "" when it does not.
std::string refusal(const std::string& text, const PropertyListLimits& limits = {}) {
    try {
        PropertyList::fromXML(text, limits);
    } catch (const CXException& e) {
        EXPECT_EQ(e.name(), kCXPropertyListException);
        return e.reason();
    }
    return "";
}
std::string refusalOfBody(const std::string& body) {
    return refusal(document(body));
}

std::string writeRefusal(const Value& v) {
    try {
        PropertyList::toXML(v);
    } catch (const CXException& e) {
        EXPECT_EQ(e.name(), kCXPropertyListException);
        return e.reason();
    }
    return "";
}

bool has(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
}

std::string utf16(const std::u16string& text, bool bigEndian) {
    std::string out = bigEndian ? "\xfe\xff" : "\xff\xfe";
    for (const char16_t c : text) {
        const char high = static_cast<char>(c >> 8), low = static_cast<char>(c & 0xff);
        out += bigEndian ? high : low;
        out += bigEndian ? low : high;
    }
    return out;
}

Value nested(int depth) {
    Value v = Array{};
    for (int i = 1; i < depth; ++i) v = Array{v};
    return v;
}

TEST(PropertyListWriter, WritesTheCustomaryFormWithKeysInByteOrder) {
    const Dictionary d{
        {"b", 2}, {"a", Array{"x", true, false, 1.5, Date(0), Bytes{'h', 'i'}}}, {"Z", Dictionary{}}, {"c", Array{}}};
    EXPECT_EQ(PropertyList::toXML(d), document("<dict>\n"
                                               "\t<key>Z</key>\n"
                                               "\t<dict/>\n"
                                               "\t<key>a</key>\n"
                                               "\t<array>\n"
                                               "\t\t<string>x</string>\n"
                                               "\t\t<true/>\n"
                                               "\t\t<false/>\n"
                                               "\t\t<real>1.5</real>\n"
                                               "\t\t<date>1970-01-01T00:00:00Z</date>\n"
                                               "\t\t<data>\n"
                                               "\t\taGk=\n"
                                               "\t\t</data>\n"
                                               "\t</array>\n"
                                               "\t<key>b</key>\n"
                                               "\t<integer>2</integer>\n"
                                               "\t<key>c</key>\n"
                                               "\t<array/>\n"
                                               "</dict>\n"));
}

TEST(PropertyListWriter, GivesTheSameBytesWhateverTheOrderOfInsertion) {
    Dictionary a, b;
    a.set("one", 1), a.set("two", 2);
    b.set("two", 2), b.set("one", 1);
    EXPECT_EQ(PropertyList::toXML(a), PropertyList::toXML(b));
}

TEST(PropertyListWriter, EscapesMarkupAndKeepsCarriageReturns) {
    const std::string text = "<a & \"b\">]]>\r\n\t'";
    const std::string xml = PropertyList::toXML(text);
    EXPECT_TRUE(has(xml, "<string>&lt;a &amp; \"b\"&gt;]]&gt;&#13;\n\t'</string>")) << xml;
    EXPECT_EQ(PropertyList::fromXML(xml), Value(text));
}

TEST(PropertyListWriter, RefusesWhatXmlCannotCarryAndNamesThePlace) {
    const std::string reason = writeRefusal(Dictionary{{"outer", Dictionary{{"inner", std::string("a\0b", 3)}}}});
    EXPECT_TRUE(has(reason, "outer/inner") && has(reason, "U+0000")) << reason;
    for (const char* bad : {"\x01", "\x1f", "\x0b", "\xef\xbf\xbe", "\xef\xbf\xbf"}) {
        EXPECT_TRUE(has(writeRefusal(bad), "XML cannot carry")) << bad;
        EXPECT_TRUE(has(writeRefusal(Dictionary{{bad, 1}}), "a key cannot be written")) << bad;
    }
}

TEST(PropertyListWriter, RefusesTextThatIsNotUtf8) {
    for (const char* bad :
         {"\xff", "\xc3", "\xc0\x80", "\xe0\x81\x81", "\xed\xa0\x80", "\xf4\x90\x80\x80", "12345678\x80"})
        EXPECT_TRUE(has(writeRefusal(bad), "not UTF-8")) << bad;
    EXPECT_EQ(writeRefusal("\xc3\xa9\xe2\x82\xac\xf0\x9f\x98\x80\x7f"), "");
}

TEST(PropertyListWriter, RefusesAbsentValuesAndDatesThatNoCalendarHas) {
    EXPECT_TRUE(has(writeRefusal(Value()), "absent"));
    EXPECT_TRUE(has(writeRefusal(Array{Value()}), "absent"));
    EXPECT_TRUE(has(writeRefusal(Dictionary{{"when", Date(1e18)}}), "below \"when\""));
    EXPECT_TRUE(has(writeRefusal(Date(std::nan(""))), "date"));
}

TEST(PropertyListWriter, RefusesAContainerThatHoldsItself) {
    Dictionary d;
    d.set("self", d);
    EXPECT_TRUE(has(writeRefusal(d), "nested deeper than 64"));
    d.remove("self"); // or it would never be freed
}

TEST(PropertyListWriter, WritesWhatTheReaderTakesUpToTheDepthLimit) {
    EXPECT_EQ(PropertyList::fromXML(PropertyList::toXML(nested(64))), nested(64));
    EXPECT_TRUE(has(writeRefusal(nested(65)), "nested deeper than 64"));
}

TEST(PropertyListWriter, WritesNumbersThatAreNoneByName) {
    const double inf = std::numeric_limits<double>::infinity();
    const std::string xml = PropertyList::toXML(Array{std::nan(""), inf, -inf, -0.0});
    EXPECT_TRUE(has(xml, "<real>nan</real>\n\t<real>+infinity</real>\n\t<real>-infinity</real>\n\t<real>-0</real>"))
        << xml;
    const Array back = PropertyList::fromXML(xml).array();
    EXPECT_TRUE(std::isnan(back[0].real()));
    EXPECT_EQ(back[1], Value(inf));
    EXPECT_EQ(back[2], Value(-inf));
    EXPECT_TRUE(std::signbit(back[3].real()));
}

TEST(PropertyListWriter, DropsFractionsOfASecond) {
    EXPECT_EQ(PropertyList::fromXML(PropertyList::toXML(Date(1000.75))), Value(Date(1000)));
}

TEST(PropertyListWriter, WrapsDataAtSeventySixDigits) {
    const std::string xml = PropertyList::toXML(Bytes(58, 0));
    EXPECT_TRUE(has(xml, "<data>\n" + std::string(76, 'A') + "\nAA==\n</data>\n")) << xml;
}

RC_GTEST_PROP(PropertyListWriter, EveryValueReadsBackAsItself, ()) {
    const Value v = *test::plistValue();
    const std::string xml = PropertyList::toXML(v);
    const Value back = PropertyList::fromXML(xml);
    RC_ASSERT(back == v);
    RC_ASSERT(PropertyList::toXML(back) == xml);
}

RC_GTEST_PROP(PropertyListWriter, EveryRealReadsBackToTheLastBit, (uint64_t bits)) {
    double d;
    std::memcpy(&d, &bits, sizeof d);
    RC_PRE(!std::isnan(d));
    const Value back = PropertyList::fromXML(PropertyList::toXML(d));
    RC_ASSERT(back.type() == ValueType::real);
    const double read = back.real();
    RC_ASSERT(std::memcmp(&read, &d, sizeof d) == 0);
}

TEST(PropertyListReader, TakesCommentsCDataAndWhiteSpaceOfOtherWriters) {
    const Value v = PropertyList::fromXML("<?xml version='1.0'?>\n<!-- made elsewhere -->\n<plist>\n"
                                          "<?hint?><dict  ><!-- > -->\n<key> a<![CDATA[<b>]]></key >\n"
                                          "<string>x<!-- y -->&#x7A;&#233;&quot;&apos;</string>"
                                          "<key>n</key><integer> -7 </integer><key>t</key><true></true>"
                                          "</dict>\n</plist>\n<!-- end -->\n\n");
    const Dictionary expected{{" a<b>", "xz\xc3\xa9\"'"}, {"n", -7}, {"t", true}};
    EXPECT_EQ(v, Value(expected)) << v.description();
}

TEST(PropertyListReader, NeedsNoDocumentType) {
    EXPECT_EQ(PropertyList::fromXML("<plist><string/></plist>"), Value(""));
}

TEST(PropertyListReader, TakesAnyExternalIdentifierForPlist) {
    EXPECT_EQ(PropertyList::fromXML("<!DOCTYPE plist SYSTEM \"file:///etc/passwd\"><plist><true/></plist>"),
              Value(true));
}

TEST(PropertyListReader, TakesUtf16InEitherByteOrder) {
    const std::u16string text =
        u"<?xml version=\"1.0\" encoding=\"UTF-16\"?><plist><string>\u00e9\U0001F600</string></plist>";
    for (const bool big : {false, true})
        EXPECT_EQ(PropertyList::fromXML(utf16(text, big)), Value("\xc3\xa9\xf0\x9f\x98\x80"));
}

TEST(PropertyListReader, RefusesBrokenUtf16) {
    EXPECT_TRUE(has(refusal(utf16(u"<plist>", false) + "x"), "odd number"));
    std::u16string half = u"<plist>\n<string>";
    half += char16_t{0xd800};
    EXPECT_TRUE(has(refusal(utf16(half + u"</string></plist>", true)), "line 2: ")) << refusal(utf16(half, true));
}

TEST(PropertyListReader, SkipsAByteOrderMark) {
    EXPECT_EQ(PropertyList::fromXML("\xef\xbb\xbf<plist><integer>1</integer></plist>"), Value(1));
}

TEST(PropertyListReader, RefusesOtherEncodings) {
    EXPECT_TRUE(has(refusal("<?xml version=\"1.0\" encoding=\"ISO-8859-1\"?><plist><true/></plist>"), "ISO-8859-1"));
    EXPECT_TRUE(has(refusal("<?xml version=\"1.0\" encoding='UTF-16'?><plist><true/></plist>"), "UTF-16"));
    EXPECT_TRUE(has(refusal(std::string("<\0p\0l\0", 6)), "zero byte"));
}

TEST(PropertyListReader, RefusesADocumentTypeOfAnotherKind) {
    EXPECT_TRUE(has(refusal("<!DOCTYPE html SYSTEM \"x\"><plist><true/></plist>"), "\"html\""));
    EXPECT_TRUE(has(refusal("<!DOCTYPE plist><plist><true/></plist>"), "external identifier"));
}

TEST(PropertyListReader, RefusesEveryInternalSubset) {
    for (const char* subset : {"[]", " [ ]", "[<!ENTITY a \"b\">]", "[<!ENTITY % p SYSTEM \"file:///etc/passwd\">%p;]",
                               "[<!-- -->]", "[<!ELEMENT plist ANY>]"}) {
        const std::string reason =
            refusal("<!DOCTYPE plist SYSTEM \"x\"" + std::string(subset) + "><plist><true/></plist>");
        EXPECT_TRUE(has(reason, "internal subset")) << subset << ": " << reason;
    }
}

TEST(PropertyListReader, RefusesEveryEntityButTheFivePredefined) {
    EXPECT_EQ(read("<string>&lt;&gt;&amp;&quot;&apos;</string>"), Value("<>&\"'"));
    EXPECT_TRUE(has(refusalOfBody("<string>&nbsp;</string>"), "\"nbsp\""));
    EXPECT_TRUE(has(refusalOfBody("&value;"), "\"value\""));
    EXPECT_TRUE(has(refusal("<plist><string>&x;</string></plist>"), "\"x\""));
    EXPECT_TRUE(has(refusal("<plist version=\"&x;\"><string/></plist>"), "\"x\""));
}

TEST(PropertyListReader, RefusesNestedEntitiesBeforeTheyGrow) {
    std::string bomb = "<!DOCTYPE plist SYSTEM \"x\" [<!ENTITY a0 \"lol\">";
    for (int i = 1; i < 30; ++i)
        bomb +=
            "<!ENTITY a" + std::to_string(i) + " \"&a" + std::to_string(i - 1) + ";&a" + std::to_string(i - 1) + ";\">";
    EXPECT_TRUE(has(refusal(bomb + "]><plist><string>&a29;</string></plist>"), "internal subset"));
}

TEST(PropertyListReader, RefusesDuplicateKeys) {
    const std::string reason = refusalOfBody("<dict>\n<key>a</key><true/>\n<key>a</key><true/>\n</dict>");
    EXPECT_EQ(reason, "line 6: the key \"a\" is there twice");
}

TEST(PropertyListReader, SaysTheLineOfIllFormedText) {
    EXPECT_TRUE(refusalOfBody("<dict>\n<key>a</key>\n</array>").starts_with("line 6: "))
        << refusalOfBody("<dict>\n<key>a</key>\n</array>");
}

TEST(PropertyListReader, RefusesEveryTruncationOfADocument) {
    const std::string whole = PropertyList::toXML(Dictionary{{"k", Array{"a&b", 1, 2.5, Date(0), Bytes{1, 2}}}});
    const size_t end = whole.rfind("</plist>") + std::strlen("</plist>");
    for (size_t n = 0; n < end; ++n) EXPECT_NE(refusal(whole.substr(0, n)), "") << n;
    EXPECT_EQ(refusal(whole.substr(0, end)), "");
}

TEST(PropertyListReader, RefusesStructureThatIsNotAPropertyList) {
    const std::pair<const char*, const char*> cases[] = {
        {"", "no value"},
        {"<true/><true/>", "more than one value"},
        {"<key>a</key>", "key outside"},
        {"<array><key>a</key></array>", "key inside an array"},
        {"<dict><true/></dict>", "without a key"},
        {"<dict><key>a</key></dict>", "has no value"},
        {"<dict><key>a</key><key>b</key></dict>", "has no value"},
        {"<plist><true/></plist>", "inside <plist>"},
        {"<set/>", "unknown element <set>"},
        {"<Dict/>", "unknown element"},
        {"<string><true/></string>", "inside a value that has text only"},
        {"<true>yes</true>", "truth value"},
        {"<array>text</array>", "\"text\" outside a value"},
        {"text", "outside a value"},
        {"<integer/>", "not an integer"},
        {"<integer>1.5</integer>", "not an integer"},
        {"<integer>--1</integer>", "not an integer"},
        {"<integer>9223372036854775808</integer>", "not an integer"},
        {"<real>1e999</real>", "not a real"},
        {"<real>1,5</real>", "not a real"},
        {"<real>+-1</real>", "not a real"},
        {"<real/>", "not a real"},
        {"<date>yesterday</date>", "not a date"},
        {"<date>2026-02-30T00:00:00Z</date>", "not a date"},
        {"<data>a</data>", "not base64"},
        {"<data>a*==</data>", "not base64"},
        {"<data>YQ==YQ==</data>", "not base64"},
        {"<data>YQ=</data>", "not base64"},
        {"<p:true xmlns:p=\"x\"/>", "unknown element"},
    };
    for (const auto& [body, part] : cases) {
        const std::string reason = refusalOfBody(body);
        EXPECT_TRUE(has(reason, part)) << body << ": " << reason;
        EXPECT_TRUE(reason.starts_with("line ")) << reason;
    }
    EXPECT_TRUE(has(refusal("<dict/>"), "not <plist>"));
}

TEST(PropertyListReader, ReadsTheWholeRangeOfNumbers) {
    EXPECT_EQ(read("<integer>-9223372036854775808</integer>").integer(), std::numeric_limits<int64_t>::min());
    EXPECT_EQ(read("<integer>+9223372036854775807</integer>").integer(), std::numeric_limits<int64_t>::max());
    EXPECT_EQ(read("<integer>0x1F</integer>"), Value(31));
    EXPECT_EQ(read("<real> +1.5e3 </real>"), Value(1500.0));
    EXPECT_EQ(read("<real>1</real>").type(), ValueType::real);
    EXPECT_EQ(read("<data>\n aG k\t</data>"), Value(Bytes{'h', 'i'}));
    EXPECT_EQ(read("<date> 1970-01-01T01:00:00+01:00 </date>"), Value(Date(0)));
}

TEST(PropertyListReader, RefusesInvalidUtf8EvenInOverlongForms) {
    for (const char* bad : {"\xff", "\xc1\x81", "\xe0\x81\x81", "\xf0\x80\x81\x81", "\xed\xa0\x80", "\xc3"}) {
        EXPECT_NE(refusalOfBody("<string>" + std::string(bad) + "</string>"), "") << bad;
        EXPECT_NE(refusalOfBody("<string><![CDATA[" + std::string(bad) + "]]></string>"), "") << bad;
    }
    EXPECT_NE(refusalOfBody("<string>&#1;</string>"), "");
    EXPECT_NE(refusalOfBody("<string>&#xD800;</string>"), "");
}

TEST(PropertyListReader, HoldsTheLimits) {
    std::string deep;
    for (int i = 0; i < 65; ++i) deep += "<array>";
    EXPECT_TRUE(has(refusalOfBody(deep), "nested deeper than 64"));
    EXPECT_TRUE(has(refusalOfBody(std::string(200000, '<')), "line "));
    PropertyListLimits limits;
    limits.maxBytes = document("<true/>").size();
    EXPECT_EQ(refusal(document("<true/>"), limits), "");
    EXPECT_TRUE(has(refusal(document("<true/>") + " ", limits), "more than the limit"));
    limits.maxDepth = 1;
    limits.maxBytes = 10000;
    EXPECT_EQ(refusal(document("<array/>"), limits), "");
    EXPECT_TRUE(has(refusal(document("<array><array/></array>"), limits), "nested deeper than 1"));
}

TEST(PropertyListReader, RefusesTagsThatWouldCostSquareTime) {
    std::string tag = "<plist";
    for (int i = 0; i < 100000; ++i) tag += " a" + std::to_string(i) + "='>'";
    EXPECT_TRUE(has(refusal("\n" + tag + "><true/></plist>"), "line 2: a tag is longer than 512 bytes"));
}

TEST(PropertyListReader, TakesATextOfManyMegabytes) {
    const Dictionary d{{"photo", Bytes(8000000, 0x5a)}, {"note", std::string(10100000, 'n')}};
    EXPECT_TRUE(PropertyList::fromXML(PropertyList::toXML(d)) == Value(d));
}

TEST(PropertyListReader, DoesNotShowControlCharactersOfTheTextInItsReason) {
    const std::string reason = refusalOfBody("<integer>\n\n1&#13;\t\x7f" + std::string(500, 'x') + "</integer>");
    EXPECT_TRUE(has(reason, "\"1???xxx")) << reason;
    EXPECT_LT(reason.size(), 200u);
}

RC_GTEST_PROP(PropertyListReader, NeverThrowsAnythingButItsOwnException, ()) {
    std::string text = PropertyList::toXML(*test::plistValue());
    const int edits = *rc::gen::inRange(1, 6);
    for (int i = 0; i < edits; ++i) text[*rc::gen::inRange<size_t>(0, text.size())] = *rc::gen::arbitrary<char>();
    try {
        const Value v = PropertyList::fromXML(text);
        RC_ASSERT(PropertyList::fromXML(PropertyList::toXML(v)).description() == v.description());
    } catch (const CXException& e) {
        RC_ASSERT(e.name() == kCXPropertyListException);
    }
}

} // namespace
} // namespace rolvane
