#pragma once

#include <string>

namespace rolvane::cli {

class Context;

// The text as a QR code (ISO/IEC 18004, error correction level M) of half blocks in UTF-8, two rows of modules in a
// line, with the quiet zone of four modules that readers need. With `coloured` it is black on white whatever the
// terminal's colours are; without, light modules are the blocks, as suits a dark terminal.
// CommandError when the text is too long for one.
std::string qrCode(const std::string& text, bool coloured);

// The same on standard output, in colours where it is a terminal and nobody has asked for none (NO_COLOR). Says so when
// the terminal is too narrow for it.
void showQrCode(Context& context, const std::string& text);

} // namespace rolvane::cli
