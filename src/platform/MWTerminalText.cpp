#include "platform/MWTerminalText.h"

#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <iterator>

#include "platform/MWHostInterface.h"
#include "platform/MWUTF8.h"

namespace {

/// Marks of the direction of writing, by which a part of a line changes places with another, and separators
/// of lines and paragraphs.
bool turnsText(std::string_view character) {
    constexpr std::string_view kMarks[] = {"\u061C", "\u200E", "\u200F", "\u2028", "\u2029",
                                           "\u202A", "\u202B", "\u202C", "\u202D", "\u202E",
                                           "\u2066", "\u2067", "\u2068", "\u2069"};
    return std::ranges::find(kMarks, character) != std::end(kMarks);
}

/// The length of the printable character that `text` (not empty) begins with; 0 when it begins with
/// something else.
size_t printableLength(std::string_view text) {
    const auto byteAt = [text](size_t index) { return static_cast<uint8_t>(text[index]); };
    const size_t length = MWUTF8CharacterLength(text);
    const bool isC0Control = length == 1 && (byteAt(0) < 0x20 || byteAt(0) == 0x7F);
    const bool isC1Control = length == 2 && byteAt(0) == 0xC2 && byteAt(1) < 0xA0;
    const bool isEscape = text.front() == '\\';
    return isC0Control || isC1Control || isEscape || turnsText(text.substr(0, length)) ? 0 : length;
}

/// As listings of files have them.
std::string escaped(char byte) {
    constexpr std::string_view kWithLetter = "\a\b\t\n\v\f\r\\";
    constexpr std::string_view kLetters = "abtnvfr\\";
    const size_t place = kWithLetter.find(byte);
    return place == std::string_view::npos ? fmt::format("\\{:03o}", static_cast<uint8_t>(byte))
                                           : fmt::format("\\{}", kLetters[place]);
}

}  // namespace

std::string MWTerminalText(std::string_view text) {
    std::string printable;
    printable.reserve(text.size());
    while (!text.empty()) {
        const size_t length = printableLength(text);
        if (length == 0) {
            printable += escaped(text.front());
        } else {
            printable += text.substr(0, length);
        }
        text.remove_prefix(std::max<size_t>(length, 1));
    }
    return printable;
}

std::string MWErrorText(std::string_view text) {
    return MWHostInterface::current().isatty(STDERR_FILENO) ? MWTerminalText(text) : std::string(text);
}
