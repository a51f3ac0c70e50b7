#pragma once

#include <string>

/// The usage text, every line with its newline.
std::string MWUsageText();

/// Writes the usage text to standard output.
void MWPrintUsage();

/// ASCII letters in lower case, everything else as it is.
std::string MWLowercased(std::string text);
