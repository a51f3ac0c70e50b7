#include "platform/MWLedgerTable.h"

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <string_view>
#include <vector>

#include "platform/MWHostInterface.h"

namespace {

constexpr size_t kFirstCapacity = 80;
/// More ledgers than any kernel has: one that still fills the buffer then is not believed.
constexpr size_t kLargestCapacity = kFirstCapacity << 10U;

std::string_view nameOf(const ledger_template_info& entry) {
    return {entry.lti_name.data(), strnlen(entry.lti_name.data(), entry.lti_name.size())};
}

}  // namespace

MWLedgerTable MWReadLedgerTable(MWHostInterface& host) {
    std::vector<ledger_template_info> entries;
    size_t filled = 0;
    for (size_t capacity = kFirstCapacity; filled == entries.size() && capacity <= kLargestCapacity;
         capacity *= 2) {
        entries.resize(capacity);
        if (host.ledgerTemplate(entries, filled) < 0) {
            std::perror("Unable to retrieve ledger template info");
            return {};
        }
    }
    entries.resize(std::min(filled, entries.size()));
    const auto found = std::ranges::find(entries, "page_table", nameOf);
    return {.entryCount = static_cast<int64_t>(entries.size()),
            .pageTableIndex = found == entries.end() ? -1 : found - entries.begin()};
}
