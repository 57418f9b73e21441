#include "QrCode.h"

#include "Context.h"

#include <memory>
#include <qrencode.h>

namespace rolvane::cli {

std::string qrCode(const std::string& text, bool coloured) {
    constexpr int kQuiet = 4; // modules
    const std::unique_ptr<QRcode, decltype(&QRcode_free)> code(QRcode_encodeString8bit(text.c_str(), 0, QR_ECLEVEL_M),
                                                               &QRcode_free);
    if (!code) throw CommandError(kFailed, "The text is too long for a QR code.");
    const int width = code->width;
    const auto isLight = [&](int x, int y) {
        const bool outside = x < 0 || y < 0 || x >= width || y >= width;
        return outside || (code->data[y * width + x] & 1) == 0;
    };
    std::string out;
    for (int y = -kQuiet; y < width + kQuiet; y += 2) {
        if (coloured) out += "\033[38;5;231;48;5;16m"; // white on black
        for (int x = -kQuiet; x < width + kQuiet; ++x) {
            const bool upper = isLight(x, y), lower = y + 1 >= width + kQuiet || isLight(x, y + 1);
            out += upper && lower ? "█" : upper ? "▀" : lower ? "▄" : " ";
        }
        if (coloured) out += "\033[0m";
        out += "\n";
    }
    return out;
}

} // namespace rolvane::cli
