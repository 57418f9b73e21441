#include "QrCode.h"

#include "Context.h"
#include "SafeText.h"
#include "Texts.h"

#include <cstdlib>
#include <iostream>
#include <memory>
#include <qrencode.h>

namespace rolvane::cli {

std::string qrCode(const std::string& text, bool coloured) {
    constexpr int kQuiet = 4; // modules
    const std::unique_ptr<QRcode, decltype(&QRcode_free)> code(QRcode_encodeString8bit(text.c_str(), 0, QR_ECLEVEL_M),
                                                               &QRcode_free);
    if (!code) throw CommandError(kFailed, translated("The text is too long for a QR code."));
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

void showQrCode(Context& context, const std::string& text) {
    const char* noColour = std::getenv("NO_COLOR");
    const std::string code = qrCode(text, context.dataIsTerminal() && !(noColour && *noColour));
    std::cout << code;
    const std::string row = qrCode(text, false);
    const size_t width = columnsOf(row.substr(0, row.find('\n'))), columns = context.dataColumns();
    if (columns > 0 && columns < width)
        context.warn(tr("The QR code is {} columns wide, and this terminal has {}: make it wider, and ask again.",
                        width, columns));
}

} // namespace rolvane::cli
