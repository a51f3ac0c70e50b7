#include "process/MWInterningTables.h"

#include <algorithm>

namespace {

constexpr size_t kPathSlots = 2047;
constexpr size_t kPathProbes = 18;
constexpr size_t kSegmentNameSlots = 16;

/// The text in the slot; when that is empty, `made` (made from `text` on first use) after it was stored
/// there.
const std::string& textInSlot(std::atomic<const std::string*>& slot, std::string_view text,
                              std::unique_ptr<const std::string>& made) {
    const std::string* stored = slot.load(std::memory_order_acquire);
    if (stored != nullptr) {
        return *stored;
    }
    if (made == nullptr) {
        made = std::make_unique<const std::string>(text);
    }
    const bool won = slot.compare_exchange_strong(stored, made.get(), std::memory_order_release,
                                                  std::memory_order_acquire);
    return won ? *made.release() : *stored;
}

}  // namespace

MWInterningTable::~MWInterningTable() {
    std::for_each(_slots.begin(), _slots.end(), [](const Slot& slot) { delete slot.load(); });
}

MWSharedText MWInterningTable::intern(std::string_view text, size_t firstSlot) {
    std::unique_ptr<const std::string> made;
    for (size_t probe = 0; probe < _mostProbes; ++probe) {
        const std::string& stored = textInSlot(_slots[(firstSlot + probe) % _slots.size()], text, made);
        if (stored == text) {
            return MWUncountedText(stored);
        }
    }
    return made != nullptr ? MWSharedText(std::move(made)) : std::make_shared<const std::string>(text);
}

// The program's tables are never destroyed: texts from them are held until the very end.

MWSharedText MWInternPath(std::string_view path, uint64_t baseAddress) {
    static MWInterningTable& table = *new MWInterningTable(kPathSlots, kPathProbes);
    const uint64_t a = baseAddress;
    return table.intern(path, (a ^ (a >> 8U) ^ (a >> 16U) ^ (a >> 24U)) % kPathSlots);
}

MWSharedText MWInternSegmentName(std::string_view name) {
    static MWInterningTable& table = *new MWInterningTable(kSegmentNameSlots, kSegmentNameSlots);
    return table.intern(name);
}
