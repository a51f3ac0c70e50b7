#pragma once

#include <cstddef>
#include <string_view>

/// The length in bytes, 1 to 4, of the character that `text` begins with; 0 when `text` is empty or does not
/// begin with well-formed UTF-8. Overlong forms, surrogates and what lies above U+10FFFF are not well-formed.
size_t MWUTF8CharacterLength(std::string_view text);
