#pragma once

#include <string>
#include <string_view>

/// Appends `text` as a JSON string, quoted and escaped. Any bytes give a string that every parser takes: each
/// byte that is not part of well-formed UTF-8 becomes a text like "\\xff", so that different names stay
/// different.
void MWAppendJSONString(std::string& to, std::string_view text);
