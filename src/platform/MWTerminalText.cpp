#include "platform/MWTerminalText.h"

#include <algorithm>
#include <cstddef>
#include <cstdint>

namespace {

uint8_t byteAt(std::string_view text, size_t index) {
    return static_cast<uint8_t>(text[index]);
}

/// The length that the first byte of a UTF-8 sequence announces; 0 for a byte that begins none.
size_t announcedLength(uint8_t first) {
    if (first < 0x80) {
        return 1;
    }
    if (first >= 0xC2 && first <= 0xDF) {
        return 2;
    }
    if (first >= 0xE0 && first <= 0xEF) {
        return 3;
    }
    return first >= 0xF0 && first <= 0xF4 ? 4 : 0;
}

/// The length of the printable character that `text` (not empty) begins with; 0 when it begins with
/// something else.
size_t printableLength(std::string_view text) {
    const uint8_t first = byteAt(text, 0);
    const size_t length = announcedLength(first);
    const auto isContinuation = [](char c) { return (static_cast<uint8_t>(c) & 0xC0) == 0x80; };
    if (length == 0 || length > text.size() ||
        !std::ranges::all_of(text.substr(1, length - 1), isContinuation)) {
        return 0;
    }
    if (length == 1) {
        return first < 0x20 || first == 0x7F ? 0 : 1;
    }
    const uint8_t second = byteAt(text, 1);
    const bool isC1Control = first == 0xC2 && second < 0xA0;
    const bool isOverlong = (first == 0xE0 && second < 0xA0) || (first == 0xF0 && second < 0x90);
    const bool isNoCharacter = (first == 0xED && second >= 0xA0) || (first == 0xF4 && second >= 0x90);
    return isC1Control || isOverlong || isNoCharacter ? 0 : length;
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
