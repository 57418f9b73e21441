#include "contacts/vcard/VCardScanner.h"
#include "foundation/CXException.h"

#include <gtest/gtest.h>

#include <fstream>
#include <memory>
#include <sstream>
#include <sys/resource.h>

namespace rolvane {
namespace {

struct Scan {
    std::vector<VCard> cards;
    std::vector<VCardError> errors;
    uint64_t bytes = 0;
};

Scan scan(std::istream& in, VCardLimits limits = {}) {
    Scan result;
    VCardScanner scanner(
        in, "test.vcf", [&](const VCardError& e) { result.errors.push_back(e); }, limits);
    while (auto card = scanner.next()) result.cards.push_back(*card);
    result.bytes = scanner.bytesRead();
    return result;
}

Scan scan(const std::string& text, VCardLimits limits = {}) {
    std::istringstream in(text);
    return scan(in, limits);
}

std::string card(const std::string& lines, const std::string& version = "3.0") {
    return "BEGIN:VCARD\r\nVERSION:" + version + "\r\n" + lines + "END:VCARD\r\n";
}

// A stream that makes its text up as it is read, so that a test of a hundred megabytes needs none of them.
class Endless : public std::streambuf {
public:
    Endless(std::string prefix, std::string unit, size_t units, std::string suffix)
        : _prefix(std::move(prefix)), _unit(std::move(unit)), _suffix(std::move(suffix)), _left(units) {}

protected:
    int_type underflow() override {
        if (_stage == 0) {
            _stage = 1;
            give(_prefix);
        } else if (_left > 0) {
            _left--;
            give(_unit);
        } else if (_stage == 1) {
            _stage = 2;
            give(_suffix);
        } else {
            return traits_type::eof();
        }
        return gptr() == egptr() ? underflow() : traits_type::to_int_type(*gptr());
    }

private:
    void give(std::string& s) { setg(s.data(), s.data(), s.data() + s.size()); }
    std::string _prefix, _unit, _suffix;
    size_t _left;
    int _stage = 0;
};

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr long kAllocatorSlack = 1 << 20; // kilobytes; sanitizers hold freed memory back
#else
constexpr long kAllocatorSlack = 0;
#endif

long peakKilobytes() {
    rusage usage{};
    getrusage(RUSAGE_SELF, &usage);
    return usage.ru_maxrss;
}

TEST(VCardScanner, AFileHoldsManyCardsOfSeveralVersions) {
    auto r = scan(card("FN:A\r\n") + "\r\n" + card("FN:B\r\n", "4.0") + card("FN:C\r\n", "2.1"));
    ASSERT_EQ(r.cards.size(), 3u);
    EXPECT_TRUE(r.errors.empty());
    EXPECT_EQ(r.cards[0].version, "3.0");
    EXPECT_EQ(r.cards[1].version, "4.0");
    EXPECT_EQ(r.cards[2].lines.at(0).value, "C");
    EXPECT_EQ(r.cards[1].firstLine, 6u);
}

TEST(VCardScanner, AnEmptyFileHasNoCardAndNoError) {
    EXPECT_TRUE(scan("").errors.empty());
    EXPECT_TRUE(scan("\n\n").errors.empty());
}

TEST(VCardScanner, LinesMayEndInLineFeedOrCarriageReturnAlone) {
    for (const char* end : {"\n", "\r"}) {
        std::string text;
        for (const char* l : {"BEGIN:VCARD", "VERSION:3.0", "NOTE:one", "  two", "END:VCARD"}) (text += l) += end;
        auto r = scan(text);
        ASSERT_EQ(r.cards.size(), 1u);
        EXPECT_EQ(r.cards[0].lines.at(0).value, "one two");
        EXPECT_EQ(r.cards[0].lines.at(0).number, 3u);
    }
}

TEST(VCardScanner, AByteOrderMarkIsPassedOver) {
    auto r = scan("\xEF\xBB\xBF" + card("FN:A\r\n"));
    EXPECT_EQ(r.cards.size(), 1u);
    EXPECT_TRUE(r.errors.empty());
}

TEST(VCardScanner, AFileInUTF16IsRefusedWithAReason) {
    for (const std::string& start :
         {std::string("\xFF\xFE"
                      "B\0",
                      4),
          std::string("\xFE\xFF\0B", 4), std::string("B\0E\0", 4), std::string("\0B\0E", 4)}) {
        auto r = scan(start + std::string("\0E\0G\0I\0N", 8));
        EXPECT_TRUE(r.cards.empty());
        ASSERT_EQ(r.errors.size(), 1u);
        EXPECT_NE(r.errors[0].reason.find("UTF-16"), std::string::npos);
        EXPECT_EQ(r.errors[0].description(), "test.vcf:1: " + r.errors[0].reason);
    }
}

TEST(VCardScanner, FoldsThatCutACharacterAreJoinedBeforeItIsJudged) {
    auto r = scan(card("FN:caf\xC3\r\n \xA9\r\n"));
    ASSERT_EQ(r.cards.size(), 1u);
    EXPECT_EQ(r.cards[0].lines[0].value, "café");
}

TEST(VCardScanner, ALineInLatin1WithoutACharacterSetToReadItWithIsKeptInBase64) {
    auto r = scan(card("FN:A\r\n") + card("UID:x\r\nFN:Ren\xE9\r\nNOTE:more\r\n") + card("FN:B\r\n"));
    ASSERT_EQ(r.cards.size(), 3u);
    EXPECT_EQ(r.cards[1].lines[1].name, "X-ROLVANE-UNREAD");
    EXPECT_EQ(r.cards[1].lines[1].firstValueOf("X-BASE64"), "1");
    EXPECT_EQ(r.cards[1].lines[1].value, "Rk46UmVu6Q==");
    EXPECT_EQ(r.cards[1].lines[2].value, "more");
    ASSERT_EQ(r.cards[1].notices.size(), 1u);
    EXPECT_EQ(r.cards[1].notices[0].line, 8u);
    EXPECT_EQ(r.cards[1].notices[0].reason, "the text is not UTF-8");
    EXPECT_TRUE(r.errors.empty());
}

TEST(VCardScanner, TextThatNamesNoCharacterSetIsReadWithTheOneThatWasGiven) {
    std::istringstream in(card("FN:Ren\xE9\r\nNOTE:caf\xC3\xA9\r\nTEL;TYPE=b\xFCro:1\r\n"
                               "TITLE;ENCODING=QUOTED-PRINTABLE:K=F6chin\r\n",
                               "2.1"));
    VCardScanner scanner(in, "test.vcf", [](const VCardError& e) { ADD_FAILURE() << e.description(); });
    scanner.setFallbackCharset("WINDOWS-1252");
    auto one = scanner.next();
    ASSERT_TRUE(one);
    EXPECT_EQ(one->lines[0].value, "René");
    EXPECT_EQ(one->lines[1].value, "café");
    EXPECT_EQ(one->lines[2].types(), std::vector<std::string>{"büro"});
    EXPECT_EQ(one->lines[3].value, "Köchin");
    EXPECT_EQ(scanner.fallbackLines(), 3u);
    EXPECT_TRUE(one->notices.empty());
}

TEST(VCardScanner, ACharacterSetThatIsNamedIsConverted) {
    auto r = scan(
        card("FN;CHARSET=ISO-8859-1:Ren\xE9\r\nNOTE;CHARSET=SHIFT_JIS;ENCODING=QUOTED-PRINTABLE:=93=FA\r\n", "2.1"));
    ASSERT_EQ(r.cards.size(), 1u);
    EXPECT_EQ(r.cards[0].lines[0].value, "René");
    EXPECT_EQ(r.cards[0].lines[1].value, "日");
    EXPECT_TRUE(r.cards[0].lines[1].parameters.empty());
    auto bad = scan(card("FN;CHARSET=KLINGON:x\r\n", "2.1"));
    ASSERT_EQ(bad.cards.size(), 1u);
    ASSERT_EQ(bad.cards[0].notices.size(), 1u);
    EXPECT_NE(bad.cards[0].notices[0].reason.find("KLINGON"), std::string::npos);
    EXPECT_EQ(bad.cards[0].lines[0].value, "FN\\;CHARSET=KLINGON:x");
}

TEST(VCardScanner, QuotedPrintableTextGoesOnAfterASoftBreak) {
    auto r = scan(card("NOTE;QUOTED-PRINTABLE:one=0D=0Atwo =C3=\r\n=A4 =3D=\r\n three\r\nFN:x\r\n", "2.1"));
    ASSERT_EQ(r.cards.size(), 1u);
    EXPECT_EQ(r.cards[0].lines[0].value, "one\\ntwo ä = three");
    EXPECT_EQ(r.cards[0].lines[1].value, "x");
}

TEST(VCardScanner, ALoneBackslashBeforeADecodedLineEndStays) {
    auto r = scan(card("NOTE;QUOTED-PRINTABLE:C:=5C=0D=0Ad\r\nNOTE;QUOTED-PRINTABLE:e=5C=5C=0Af\r\n", "2.1"));
    ASSERT_EQ(r.cards.size(), 1u);
    EXPECT_EQ(vcardUnescape(r.cards[0].lines[0].value), "C:\\\nd");
    EXPECT_EQ(vcardUnescape(r.cards[0].lines[1].value), "e\\\nf");
}

TEST(VCardScanner, OnlyAnEncodingMakesALineQuotedPrintable) {
    for (const char* line : {"X-A;X-B=QUOTED-PRINTABLE:abc=", "X-A;X-B=\";QUOTED-PRINTABLE;\":abc=",
                             "X-QUOTED-PRINTABLE:abc=", "X-A:a;QUOTED-PRINTABLE:="}) {
        auto r = scan(card(std::string(line) + "\r\nFN:x\r\n"));
        ASSERT_EQ(r.cards.size(), 1u);
        EXPECT_EQ(r.cards[0].lines.size(), 2u) << line;
    }
    for (const char* line : {"X-A;X-B=\"a:b\";ENCODING=quoted-printable:a=", "X-A; ENCODING = QUOTED-PRINTABLE :a=",
                             "X-A;quoted-printable;X-B=1:a="}) {
        auto r = scan(card(std::string(line) + "\r\nFN:x\r\n"));
        ASSERT_EQ(r.cards.size(), 1u) << line;
        ASSERT_EQ(r.cards[0].lines.size(), 1u) << line;
        EXPECT_EQ(r.cards[0].lines[0].value, "aFN:x");
    }
}

TEST(VCardScanner, ADamagedBeginOrEndMakesItsCardBad) {
    for (const char* mark : {"END:VCAR", "END:", "END;X-A=1:VCARD", "item1.END:VCARD", "BEGIN:VEVENT", "begin:x"}) {
        auto r = scan(card("FN:Ann\r\n" + std::string(mark) + "\r\nFN:Bob\r\n") + card("FN:good\r\n"));
        ASSERT_EQ(r.cards.size(), 1u) << mark;
        EXPECT_EQ(r.cards[0].lines[0].value, "good");
        ASSERT_EQ(r.errors.size(), 1u) << mark;
        EXPECT_EQ(r.errors[0].line, 4u);
        EXPECT_NE(r.errors[0].reason.find("neither BEGIN:VCARD nor END:VCARD"), std::string::npos);
    }
}

TEST(VCardScanner, Base64OfOldCardsMayStandAtTheLeftMargin) {
    std::string unit(64, 'A');
    auto r = scan(card("PHOTO;PNG;BASE64:" + unit + "\r\n" + unit + "\r\n " + unit + "\r\n\r\nFN:x\r\n", "2.1"));
    ASSERT_EQ(r.cards.size(), 1u);
    EXPECT_EQ(r.cards[0].lines[0].value.size(), 192u);
    EXPECT_EQ(r.cards[0].lines[1].value, "x");
}

TEST(VCardScanner, ACardInsideAnAgentIsKeptAsItsText) {
    auto r = scan(card("FN:boss\r\nAGENT:\r\nBEGIN:VCARD\r\nFN:help\r\nEND:VCARD\r\nTEL:1\r\n", "2.1"));
    ASSERT_EQ(r.cards.size(), 1u);
    EXPECT_TRUE(r.errors.empty());
    EXPECT_EQ(vcardUnescape(r.cards[0].lines[1].value), "BEGIN:VCARD\nFN:help\nEND:VCARD");
    EXPECT_EQ(r.cards[0].lines[2].name, "TEL");
}

TEST(VCardScanner, ACardThatBeginsInsideAnotherEndsTheBadOne) {
    auto r = scan("BEGIN:VCARD\r\nVERSION:3.0\r\nFN:open\r\n" + card("FN:good\r\n"));
    ASSERT_EQ(r.cards.size(), 1u);
    EXPECT_EQ(r.cards[0].lines[0].value, "good");
    ASSERT_EQ(r.errors.size(), 1u);
    EXPECT_EQ(r.errors[0].line, 1u);
    EXPECT_NE(r.errors[0].reason.find("END:VCARD"), std::string::npos);
}

TEST(VCardScanner, AFileThatEndsInsideACardNamesTheCard) {
    auto r = scan(card("FN:A\r\n") + "BEGIN:VCARD\r\nVERSION:3.0\r\nFN:cut o");
    EXPECT_EQ(r.cards.size(), 1u);
    ASSERT_EQ(r.errors.size(), 1u);
    EXPECT_EQ(r.errors[0].line, 5u);
    EXPECT_NE(r.errors[0].reason.find("the file ends"), std::string::npos);
}

TEST(VCardScanner, ALineThatIsNoPropertyIsKeptAndTheCardGoesIn) {
    auto r = scan(card("FN:A\r\nthis is no property\r\nTEL:1\r\n") + card("FN:B\r\n"));
    ASSERT_EQ(r.cards.size(), 2u);
    EXPECT_TRUE(r.errors.empty());
    ASSERT_EQ(r.cards[0].lines.size(), 3u);
    EXPECT_EQ(vcardFormatLine(r.cards[0].lines[1]), "X-ROLVANE-UNREAD:this is no property");
    ASSERT_EQ(r.cards[0].notices.size(), 1u);
    EXPECT_EQ(r.cards[0].notices[0].line, 4u);
}

TEST(VCardScanner, ANumberBehindAParameterThatCannotBeReadIsReadAllTheSame) {
    const std::string odd = "TEL;X-CUSTOM(CHARSET=UTF-8,ENCODING=QUOTED-PRINTABLE,=C3=9Cbungsraum):+49 30 1";
    auto r = scan(card("FN:A\r\n" + odd + "\r\nTEL;TYPE=\"home:2\r\n", "2.1"));
    ASSERT_EQ(r.cards.size(), 1u);
    ASSERT_EQ(r.cards[0].lines.size(), 5u);
    EXPECT_EQ(r.cards[0].lines[1].value, vcardEscape(odd));
    EXPECT_EQ(r.cards[0].lines[2].value, "+49 30 1");
    EXPECT_EQ(r.cards[0].lines[2].firstValueOf("TYPE"), "Übungsraum");
    EXPECT_EQ(r.cards[0].lines[4].name, "TEL");
    EXPECT_EQ(r.cards[0].lines[4].value, "2");
    EXPECT_EQ(r.cards[0].notices.size(), 2u);
}

TEST(VCardScanner, AnUnknownVersionIsRefused) {
    auto r = scan(card("FN:A\r\n", "7.5") + card("FN:B\r\n"));
    ASSERT_EQ(r.cards.size(), 1u);
    ASSERT_EQ(r.errors.size(), 1u);
    EXPECT_NE(r.errors[0].reason.find("7.5"), std::string::npos);
}

TEST(VCardScanner, AControlCharacterIsLeftOutAndTheLineIsKeptAsItStands) {
    auto r = scan(card("FN:A\x01\r\n") + card(std::string("FN:B\0C\r\n", 8)) +
                  card("NOTE;ENCODING=QUOTED-PRINTABLE:=0C\r\n", "2.1"));
    ASSERT_EQ(r.cards.size(), 3u);
    EXPECT_EQ(r.cards[0].lines[0].value, "Rk46QQE=");
    EXPECT_EQ(r.cards[0].lines[1].value, "A");
    EXPECT_EQ(r.cards[1].lines[1].value, "BC");
    EXPECT_EQ(r.cards[2].lines.size(), 1u);
    for (const auto& c : r.cards) EXPECT_EQ(c.notices.size(), 1u);
    EXPECT_TRUE(r.errors.empty());
}

TEST(VCardScanner, TextOutsideCardsIsReportedOnceAStretch) {
    auto r = scan("hello\r\nworld\r\n" + card("FN:A\r\n") + "bye\r\n");
    EXPECT_EQ(r.cards.size(), 1u);
    ASSERT_EQ(r.errors.size(), 2u);
    EXPECT_EQ(r.errors[0].line, 1u);
    EXPECT_EQ(r.errors[1].line, 7u);
}

TEST(VCardScanner, AnEndlessLineCostsItselfAndNoMemory) {
    std::string mb(1 << 20, 'x');
    Endless source("BEGIN:VCARD\r\nVERSION:3.0\r\nNOTE:", mb, 100, "\r\nEND:VCARD\r\n" + card("FN:good\r\n"));
    std::istream in(&source);
    long before = peakKilobytes();
    auto r = scan(in);
    EXPECT_LT(peakKilobytes() - before, (200 << 10) + kAllocatorSlack);
    EXPECT_TRUE(r.errors.empty());
    ASSERT_EQ(r.cards.size(), 2u);
    ASSERT_EQ(r.cards[0].notices.size(), 1u);
    EXPECT_TRUE(r.cards[0].notices[0].lost);
    EXPECT_EQ(r.cards[0].notices[0].line, 3u);
    EXPECT_EQ(r.cards[0].notices[0].reason, "the line is longer than 64 MB");
    EXPECT_GT(r.bytes, 100u << 20);
}

TEST(VCardScanner, ALineFoldedWithoutEndIsCappedToo) {
    std::string block;
    while (block.size() < 1 << 20) block += " folded text that goes on and on and on\r\n";
    Endless source("BEGIN:VCARD\r\nVERSION:3.0\r\nNOTE:x\r\n", block, 20, "END:VCARD\r\n" + card("FN:good\r\n"));
    std::istream in(&source);
    auto r = scan(in, {.lineBytes = 16 << 20});
    ASSERT_EQ(r.cards.size(), 2u);
    ASSERT_EQ(r.cards[0].notices.size(), 1u);
    EXPECT_EQ(r.cards[0].notices[0].line, 3u);
}

TEST(VCardScanner, ACardWithoutEndIsCapped) {
    std::string block;
    while (block.size() < 1 << 20) block += "TEL:+1 555 0100\r\n";
    Endless source("BEGIN:VCARD\r\nVERSION:3.0\r\n", block, 3, card("FN:good\r\n"));
    std::istream in(&source);
    auto r = scan(in, {.cardBytes = 2 << 20});
    EXPECT_EQ(r.cards.size(), 1u);
    ASSERT_EQ(r.errors.size(), 1u);
    EXPECT_EQ(r.errors[0].reason, "the card is longer than 2 MB");
}

TEST(VCardScanner, ALineOfAnyNameHasOneLimit) {
    VCardLimits limits{.lineBytes = 5000, .cardBytes = 100000};
    std::string data(4000, 'A');
    for (const char* name : {"PHOTO;ENCODING=b", "item1.photo", "NOTE"}) {
        EXPECT_TRUE(scan(card(name + (":" + data) + "\r\n"), limits).cards.at(0).notices.empty()) << name;
        EXPECT_EQ(scan(card(name + (":" + data) + data + "\r\n"), limits).cards.at(0).notices.size(), 1u) << name;
    }
}

TEST(VCardScanner, AHundredMegabytesOfCardsPassInConstantMemory) {
    std::string block;
    while (block.size() < 1 << 20) block += card("N:Doe;Jo;;;\r\nFN:Jo Doe\r\nNOTE:" + std::string(4000, 'n') + "\r\n");
    Endless source("", block, 100, ""); // a hundred megabytes
    std::istream in(&source);
    size_t cards = 0, errors = 0;
    VCardScanner scanner(in, "big.vcf", [&](const VCardError&) { errors++; });
    long before = peakKilobytes();
    while (scanner.next()) cards++;
    EXPECT_LT(peakKilobytes() - before, (8 << 10) + kAllocatorSlack);
    EXPECT_GT(cards, 20000u);
    EXPECT_EQ(errors, 0u);
}

TEST(VCardScanner, AStreamThatCannotBeReadIsAnException) {
    struct Broken : std::streambuf {
        int_type underflow() override { throw std::ios_base::failure("gone"); }
    } broken;
    std::istream in(&broken);
    VCardScanner scanner(in, "gone.vcf", [](const VCardError&) {});
    EXPECT_THROW(scanner.next(), CXException);
}

} // namespace
} // namespace rolvane
