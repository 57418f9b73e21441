#include "foundation/Utf8.h"

#include <gtest/gtest.h>

namespace rolvane {
namespace {

// Every code point at the edges of the lengths and of what is allowed.
constexpr char32_t kEdges[] = {0, 0x7f, 0x80, 0x7ff, 0x800, 0xd7ff, 0xe000, 0xfffd, 0xffff, 0x10000, 0x10ffff};

TEST(Utf8Test, EveryCodePointIsTakenAsItWasAppended) {
    for (char32_t c = 0; c <= 0x10ffff; ++c) {
        if (c >= 0xd800 && c <= 0xdfff) continue;
        std::string text;
        appendUtf8(c, text);
        std::string_view rest = text;
        ASSERT_EQ(takeCodePoint(rest), c);
        ASSERT_TRUE(rest.empty());
    }
}

TEST(Utf8Test, RefusesEveryBrokenForm) {
    for (const char* bad : {"\x80", "\xbf", "\xc0\xaf", "\xc1\xbf", "\xe0\x9f\xbf", "\xf0\x8f\xbf\xbf", "\xed\xa0\x80",
                            "\xed\xbf\xbf", "\xf4\x90\x80\x80", "\xf5\x80\x80\x80", "\xfe", "\xff", "\xc3", "\xe2\x82",
                            "\xf0\x9f\x98", "\xc3(", "\xe2(\xa1", "plain text before \xff"})
        EXPECT_FALSE(isUtf8(bad)) << bad;
}

TEST(Utf8Test, TakesEveryEdgeWhereverItStands) {
    for (const char32_t c : kEdges)
        for (size_t before = 0; before < 10; ++before) {
            std::string text(before, 'a');
            appendUtf8(c, text);
            EXPECT_TRUE(isUtf8(text + "abcdefghi")) << static_cast<uint32_t>(c);
            EXPECT_TRUE(isUtf8(text)) << static_cast<uint32_t>(c);
        }
}

TEST(Utf8Test, FindsAControlCharacterWhereverItStands) {
    for (size_t before = 0; before < 18; ++before)
        for (int c = 0; c < 0x20; ++c) {
            const std::string text = std::string(before, 'a') + static_cast<char>(c) + std::string(9, 'b');
            EXPECT_EQ(xmlTextFault(text).has_value(), c != '\t' && c != '\n' && c != '\r') << before << " " << c;
        }
    EXPECT_EQ(xmlTextFault("ab\x01"), "it has the character U+0001 at byte 2, which XML cannot carry");
    EXPECT_EQ(xmlTextFault("abc\xff"), "it is not UTF-8 at byte 3");
    EXPECT_TRUE(xmlTextFault("\xef\xbf\xbe").has_value());
    EXPECT_EQ(xmlTextFault("\xef\xbf\xbd\xf0\x9f\xbf\xbf\x7f"), std::nullopt);
}

TEST(Utf8Test, CountsUtf16Units) {
    EXPECT_EQ(utf16Length(""), 0u);
    EXPECT_EQ(utf16Length("a\xc3\xa9\xe2\x82\xac"), 3u);
    EXPECT_EQ(utf16Length("\xf0\x9f\x98\x80"), 2u);
    EXPECT_EQ(utf16Length("a\xff\x80"), 3u);
}

} // namespace
} // namespace rolvane
