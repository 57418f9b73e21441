#include "contacts/vcard/VCardLine.h"
#include "contacts/vcard/VCardText.h"

#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>

#include <sstream>

namespace rolvane {
namespace {

std::string unfold(const std::string& folded) {
    std::string out;
    for (size_t i = 0; i < folded.size(); i++) {
        if (folded.compare(i, 3, "\r\n ") == 0)
            i += 2;
        else
            out += folded[i];
    }
    EXPECT_TRUE(out.ends_with("\r\n"));
    return out.substr(0, out.size() - 2);
}

// Any text of Unicode scalar values without control characters.
rc::Gen<std::string> anyText() {
    auto scalar =
        rc::gen::oneOf(rc::gen::inRange<uint32_t>(0x20, 0x7F), rc::gen::inRange<uint32_t>(0xA0, 0x600),
                       rc::gen::inRange<uint32_t>(0x900, 0xD7FF), rc::gen::inRange<uint32_t>(0x10000, 0x1FFFF),
                       rc::gen::elementOf(std::vector<uint32_t>{'\n', '\\', ',', ';', ':', '"', '^', '\'', ' ', '='}));
    return rc::gen::map(rc::gen::container<std::vector<uint32_t>>(scalar), [](const std::vector<uint32_t>& cs) {
        std::string out;
        for (uint32_t c : cs) {
            if (c < 0x80)
                out += static_cast<char>(c);
            else if (c < 0x800)
                (out += static_cast<char>(0xC0 | c >> 6)) += static_cast<char>(0x80 | (c & 63));
            else if (c < 0x10000)
                ((out += static_cast<char>(0xE0 | c >> 12)) += static_cast<char>(0x80 | (c >> 6 & 63))) +=
                    static_cast<char>(0x80 | (c & 63));
            else
                (((out += static_cast<char>(0xF0 | c >> 18)) += static_cast<char>(0x80 | (c >> 12 & 63))) +=
                 static_cast<char>(0x80 | (c >> 6 & 63))) += static_cast<char>(0x80 | (c & 63));
        }
        return out;
    });
}

TEST(VCardLine, APropertyHasAGroupParametersAndAValue) {
    auto line = vcardParseLine("item1.tel;TYPE=home,voice;PREF=1;X-A=\"a;b:c,d\":+44 20;7946:0001");
    ASSERT_TRUE(line);
    EXPECT_EQ(line->group, "item1");
    EXPECT_EQ(line->name, "TEL");
    EXPECT_EQ(line->parameter("type")->values, (std::vector<std::string>{"home", "voice"}));
    EXPECT_EQ(line->firstValueOf("X-A"), "a;b:c,d");
    EXPECT_EQ(line->value, "+44 20;7946:0001");
}

TEST(VCardLine, SeveralTypeParametersAndAQuotedListAreOneSetOfTypes) {
    auto line = vcardParseLine("TEL;TYPE=HOME;TYPE=\"voice,cell\":1");
    ASSERT_TRUE(line);
    EXPECT_EQ(line->types(), (std::vector<std::string>{"home", "voice", "cell"}));
    EXPECT_TRUE(line->hasType("CELL"));
    EXPECT_FALSE(line->hasType("work"));
}

TEST(VCardLine, BareWordsOfOldCardsAreTypesAndEncodings) {
    auto line = vcardParseLine("NOTE;HOME;QUOTED-PRINTABLE;CHARSET=ISO-8859-1:=E4", true);
    ASSERT_TRUE(line);
    EXPECT_EQ(line->types(), (std::vector<std::string>{"home"}));
    EXPECT_EQ(line->firstValueOf("ENCODING"), "QUOTED-PRINTABLE");
    EXPECT_EQ(line->firstValueOf("CHARSET"), "ISO-8859-1");
}

TEST(VCardLine, CaretEscapesInParametersAreResolved) {
    auto line = vcardParseLine("ADR;LABEL=\"Mr. ^'X^'^nStreet ^^1 ^z\":;;");
    ASSERT_TRUE(line);
    EXPECT_EQ(line->firstValueOf("LABEL"), "Mr. \"X\"\nStreet ^1 ^z");
    EXPECT_EQ(vcardParseLine("ADR;LABEL=a^nb:;;", true)->firstValueOf("LABEL"), "a^nb");
}

TEST(VCardLine, WhatIsNoContentLineIsRefusedWithAReason) {
    for (const char* text :
         {"no colon here", ":value", "TEL;TYPE=\"home:1", "TEL;=x:1", "TEL;TYPE=home", "TEL;A=\"b\"c:1", ""}) {
        std::string reason;
        EXPECT_FALSE(vcardParseLine(text, false, &reason)) << text;
        EXPECT_FALSE(reason.empty()) << text;
    }
}

TEST(VCardLine, LinesFoldAt75OctetsAndNeverInsideACharacter) {
    std::string text = "NOTE:";
    for (int i = 0; i < 60; i++) text += "ä漢😀";
    std::string out;
    vcardAppendFolded(out, text);
    std::istringstream lines(out);
    for (std::string line; std::getline(lines, line);) {
        ASSERT_TRUE(line.ends_with('\r'));
        line.pop_back();
        EXPECT_LE(line.size(), 75u);
        EXPECT_FALSE(vcardFirstInvalidUTF8(line)) << line;
    }
    EXPECT_EQ(unfold(out), text);
}

RC_GTEST_PROP(VCardLineProperty, FoldedTextUnfoldsToItself, ()) {
    std::string text = *anyText();
    std::erase(text, '\n');
    std::string out;
    vcardAppendFolded(out, text);
    RC_ASSERT(unfold(out) == text);
}

RC_GTEST_PROP(VCardLineProperty, EscapedTextComesBack, ()) {
    std::string text = *anyText();
    RC_ASSERT(vcardUnescape(vcardEscape(text)) == text);
    RC_ASSERT(vcardSplit(vcardEscape(text), ';').size() == 1u);
    RC_ASSERT(vcardSplit(vcardEscape(text), ',').size() == 1u);
    RC_ASSERT(vcardEscape(text).find('\n') == std::string::npos);
}

RC_GTEST_PROP(VCardLineProperty, AnyLineThatIsWrittenReadsTheSame, ()) {
    VCardLine line;
    line.group = *rc::gen::element<std::string>("", "item1", "g-2");
    line.name = *rc::gen::element<std::string>("TEL", "X-ANY-THING", "N");
    int n = *rc::gen::inRange(0, 4);
    for (int i = 0; i < n; i++)
        line.parameters.push_back(
            {"X-P" + std::to_string(i), *rc::gen::nonEmpty(rc::gen::container<std::vector<std::string>>(anyText()))});
    line.value = vcardEscape(*anyText());
    auto again = vcardParseLine(vcardFormatLine(line));
    RC_ASSERT(again.has_value());
    RC_ASSERT(*again == line);
}

TEST(VCardLine, AnUnknownEscapeKeepsItsBackslash) {
    EXPECT_EQ(vcardUnescape("a\\,b\\;c\\\\d\\ne\\Nf\\:g\\qh\\"), "a,b;c\\d\ne\nf:g\\qh\\");
}

TEST(VCardLine, SplittingHonoursEscapedSeparators) {
    auto parts = vcardSplit("a\\;b;c\\\\;;d", ';');
    EXPECT_EQ(parts, (std::vector<std::string_view>{"a\\;b", "c\\\\", "", "d"}));
}

TEST(VCardText, IllFormedUTF8IsFoundWhereItBegins) {
    EXPECT_FALSE(vcardFirstInvalidUTF8("plain, gr\xC3\xBC\xC3\x9F \xF0\x9F\x98\x80"));
    EXPECT_EQ(vcardFirstInvalidUTF8("caf\xE9 au lait"), 3u);
    EXPECT_EQ(vcardFirstInvalidUTF8("\xC0\xAF"), 0u);             // overlong
    EXPECT_EQ(vcardFirstInvalidUTF8("12345678\xED\xA0\x80"), 8u); // surrogate
    EXPECT_EQ(vcardFirstInvalidUTF8("\xF4\x90\x80\x80"), 0u);     // beyond Unicode
    EXPECT_EQ(vcardFirstInvalidUTF8("ab\xE6\xBC"), 2u);           // cut off
}

TEST(VCardText, DamagedBase64IsRefused) {
    EXPECT_EQ(vcardDecodeBase64("AQID"), (std::vector<uint8_t>{1, 2, 3}));
    EXPECT_EQ(vcardDecodeBase64("AQI ="), (std::vector<uint8_t>{1, 2}));
    EXPECT_EQ(vcardDecodeBase64("AQI"), (std::vector<uint8_t>{1, 2}));
    EXPECT_FALSE(vcardDecodeBase64("AQID!"));
    EXPECT_FALSE(vcardDecodeBase64("A"));
    EXPECT_FALSE(vcardDecodeBase64("AQ=D"));
    EXPECT_FALSE(vcardDecodeBase64("AQI=="));
}

RC_GTEST_PROP(VCardTextProperty, Base64ComesBack, (const std::vector<uint8_t>& bytes)) {
    RC_ASSERT(vcardDecodeBase64(vcardEncodeBase64(bytes)) == std::optional(bytes));
}

TEST(VCardText, CharacterSetsAreConvertedAndUnknownOnesRefused) {
    EXPECT_EQ(vcardConvertToUTF8("\xE9t\xE9", "ISO-8859-1"), "été");
    EXPECT_EQ(vcardConvertToUTF8("\x93\xFA", "SHIFT_JIS"), "日");
    EXPECT_FALSE(vcardConvertToUTF8("x", "NO-SUCH-SET"));
    EXPECT_FALSE(vcardConvertToUTF8("\xFF", "US-ASCII"));
}

TEST(VCardText, ControlCharactersAreFound) {
    EXPECT_FALSE(vcardHasControlCharacter("tab\tand\nline \xC2\xA0\xEF\xBF\xBD"));
    EXPECT_TRUE(vcardHasControlCharacter(std::string_view("a\0b", 3)));
    EXPECT_TRUE(vcardHasControlCharacter("a\x0B"));
    EXPECT_TRUE(vcardHasControlCharacter("\xEF\xBF\xBF"));
}

} // namespace
} // namespace rolvane
