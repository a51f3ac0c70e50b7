#pragma once

#include <string>
#include <string_view>

/// `text` with every control character, and every byte that is not part of well-formed UTF-8,
/// replaced by '?'. Names and paths come from the measured processes, which may choose them freely.
std::string MWTerminalText(std::string_view text);
