#pragma once

/// Writes the program's name and the version that both programs have to standard output.
void MWPrintVersion(const char* program);
