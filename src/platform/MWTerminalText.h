#pragma once

#include <string>
#include <string_view>

/// `text` as a terminal may be shown it: control characters, marks of the direction of writing, backslashes
/// and bytes that are not part of well-formed UTF-8 as the escapes of C, "\\n" or "\\033". Names and paths
/// come from the measured processes, which may choose them freely.
std::string MWTerminalText(std::string_view text);

/// `text` as it goes to standard error: escaped when that is a terminal, else as it is.
std::string MWErrorText(std::string_view text);
