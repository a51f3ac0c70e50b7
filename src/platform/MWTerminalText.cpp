#include "platform/MWTerminalText.h"

#include <algorithm>
#include <cstddef>
#include <cstdint>

#include "platform/MWUTF8.h"

namespace {

/// The length of the printable character that `text` (not empty) begins with; 0 when it begins with
/// something else.
size_t printableLength(std::string_view text) {
    const auto byteAt = [text](size_t index) { return static_cast<uint8_t>(text[index]); };
    const size_t length = MWUTF8CharacterLength(text);
    const bool isC0Control = length == 1 && (byteAt(0) < 0x20 || byteAt(0) == 0x7F);
    const bool isC1Control = length == 2 && byteAt(0) == 0xC2 && byteAt(1) < 0xA0;
    return isC0Control || isC1Control ? 0 : length;
}

}  // namespace

std::string MWTerminalText(std::string_view text) {
    std::string printable;
    printable.reserve(text.size());
    while (!text.empty()) {
        const size_t length = printableLength(text);
        printable += length == 0 ? "?" : text.substr(0, length);
        text.remove_prefix(std::max<size_t>(length, 1));
    }
    return printable;
}
