#pragma once

#include <cstdint>

class MWHostInterface;

/// The kernel's table of ledgers, as far as the program reads it.
struct MWLedgerTable {
    int64_t entryCount = -1;      ///< -1 when the table could not be read
    int64_t pageTableIndex = -1;  ///< of the entry "page_table"; -1 when there is none
};

/// Reads the table; a failure is told on standard error.
MWLedgerTable MWReadLedgerTable(MWHostInterface& host);
