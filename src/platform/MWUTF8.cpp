#include "platform/MWUTF8.h"

#include <algorithm>
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

}  // namespace

size_t MWUTF8CharacterLength(std::string_view text) {
    const size_t length = text.empty() ? 0 : announcedLength(byteAt(text, 0));
    const auto isContinuation = [](char c) { return (static_cast<uint8_t>(c) & 0xC0) == 0x80; };
    if (length <= 1) {
        return length;
    }
    if (length > text.size() || !std::ranges::all_of(text.substr(1, length - 1), isContinuation)) {
        return 0;
    }
    const uint8_t first = byteAt(text, 0);
    const uint8_t second = byteAt(text, 1);
    const bool isOverlong = (first == 0xE0 && second < 0xA0) || (first == 0xF0 && second < 0x90);
    const bool isNoCharacter = (first == 0xED && second >= 0xA0) || (first == 0xF4 && second >= 0x90);
    return isOverlong || isNoCharacter ? 0 : length;
}
