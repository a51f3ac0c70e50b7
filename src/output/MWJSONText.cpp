#include "output/MWJSONText.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <iterator>

#include "platform/MWUTF8.h"

namespace {

/// Whether the byte stands for itself and is a character of its own.
bool isPlain(char c) {
    const auto byte = static_cast<uint8_t>(c);
    return byte >= 0x20 && byte < 0x80 && c != '"' && c != '\\';
}

void appendEscaped(std::string& to, char c) {
    switch (c) {
        case '"':
            to += "\\\"";
            break;
        case '\\':
            to += "\\\\";
            break;
        case '\n':
            to += "\\n";
            break;
        case '\r':
            to += "\\r";
            break;
        case '\t':
            to += "\\t";
            break;
        default:
            fmt::format_to(std::back_inserter(to), "\\u{:04x}", static_cast<uint8_t>(c));
    }
}

/// Appends what `text` (not empty, beginning with no plain byte) begins with; returns its length.
size_t appendSpecial(std::string& to, std::string_view text) {
    const size_t length = MWUTF8CharacterLength(text);
    if (length == 0) {
        fmt::format_to(std::back_inserter(to), "\\\\x{:02x}", static_cast<uint8_t>(text.front()));
        return 1;
    }
    const bool isC1Control = length == 2 && text[0] == '\xC2' && static_cast<uint8_t>(text[1]) < 0xA0;
    if (length == 1 || isC1Control) {
        appendEscaped(to, text[length - 1]);  // also for whoever looks at the file on a terminal
    } else {
        to += text.substr(0, length);
    }
    return length;
}

}  // namespace

void MWAppendJSONString(std::string& to, std::string_view text) {
    to += '"';
    while (!text.empty()) {
        const auto plain = std::ranges::find_if_not(text, isPlain) - text.begin();
        to += text.substr(0, static_cast<size_t>(plain));
        text.remove_prefix(static_cast<size_t>(plain));
        if (!text.empty()) {
            text.remove_prefix(appendSpecial(to, text));
        }
    }
    to += '"';
}
