#pragma once

#include "contacts/vcard/VCardLine.h"

#include <cstdint>
#include <functional>
#include <istream>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

// Why a card did not go in. `line` counts from 1 and is the line at which the damage shows.
struct VCardError {
    std::string file;
    size_t line = 0;
    std::string reason;

    std::string description() const { return file + ":" + std::to_string(line) + ": " + reason; }
};

// What of a card that went in did not go in as it stood, and why. `line` as in VCardError.
struct VCardNotice {
    size_t line = 0;
    std::string reason;
    bool lost = false; // the line is left out; else it is kept as it stands
};

// A line that cannot be read is kept under this name: its text as the text of a value, in base64 behind X-BASE64=1
// where it is not text.
inline constexpr const char* kVCardUnreadLine = "X-ROLVANE-UNREAD";

// One card as content lines, without BEGIN, END and VERSION. Text is well-formed UTF-8 without control characters,
// quoted-printable and CHARSET are already resolved; base64 is not.
struct VCard {
    std::string version = "3.0"; // "2.1", "3.0" or "4.0"
    std::vector<VCardLine> lines;
    size_t firstLine = 0; // of its BEGIN:VCARD
    std::vector<VCardNotice> notices;
};

// What an input may cost. A card beyond a limit is a bad card, and its text is not held in memory.
struct VCardLimits {
    size_t lineBytes = 64 << 20;  // an unfolded content line, a photo's among them
    size_t cardBytes = 128 << 20; // all lines of a card together, with kVCardLineCost bytes for each
};

inline constexpr size_t kVCardLineCost = 200;

// Cuts a stream into cards (RFC 2426, RFC 6350, and vCard 2.1 leniently), one at a time and in constant memory: never
// more than one card and one block of the stream are held. A line that cannot be read costs that line alone: it is kept
// under kVCardUnreadLine, what can be made of its value is read besides, and the card has a notice. A bad card is
// reported and left out, and reading goes on at the next BEGIN:VCARD. Used on one thread; the stream is borrowed.
class VCardScanner {
public:
    using ErrorHandler = std::function<void(const VCardError&)>;

    // `fileName` is what errors name.
    VCardScanner(std::istream& in, std::string fileName, ErrorHandler onError, VCardLimits limits = {});

    // The next good card, or nothing at the end of the stream. Throws CXException (kCXVCardException) when the stream
    // itself cannot be read.
    std::optional<VCard> next();

    // For text that is no UTF-8 and names no character set. Without one such a line is not read.
    void setFallbackCharset(std::string charset) { _fallback = std::move(charset); }
    size_t fallbackLines() const { return _fallbackLines; } // that were read with it

    uint64_t bytesRead() const { return _bytesRead; } // of the stream, up to the current block's use

    // Reports a card that was scanned well but means nothing, in the same way as the scanner's own findings.
    void reject(size_t line, const std::string& reason) { _onError({_fileName, line, reason}); }

private:
    struct Unfolded { // a logical line being gathered
        std::string text;
        size_t number = 0;
        bool tooLong = false;
        bool present = false;
    };

    bool fillBlock();
    void examineStart();
    bool readPhysical(std::string& into, size_t limit, bool& tooLong);
    bool readUnfolded(Unfolded& line);
    bool continues(Unfolded& line, const std::string& next) const;

    std::optional<VCard> readCard(size_t beginLine);
    bool addLine(VCard& card, Unfolded& line);
    void addUnread(VCard& card, const Unfolded& line, const std::string& reason);
    bool decodeLine(VCardLine& line, std::string& reason);
    bool convertByFallback(std::string& text);
    bool setVersion(VCard& card, const VCardLine& line, std::string& reason) const;
    std::optional<std::string> nestedCard();
    void junk(size_t line);

    std::istream& _in;
    std::string _fileName;
    ErrorHandler _onError;
    VCardLimits _limits;

    std::vector<char> _block;
    size_t _blockStart = 0, _blockEnd = 0;
    char _separator = '\n';
    std::string _fallback;
    size_t _fallbackLines = 0;
    bool _examined = false, _ended = false;
    uint64_t _bytesRead = 0;

    std::string _ahead; // a physical line that was read and belongs to the next logical one
    bool _haveAhead = false, _aheadTooLong = false;
    size_t _physicalNumber = 0;
    bool _version21 = false;             // of the card being read: its lines continue differently
    std::optional<size_t> _pendingBegin; // a BEGIN:VCARD that ended the card before it
    bool _inJunk = false;
};

inline constexpr const char* kCXVCardException = "CXVCardException";

} // namespace rolvane
