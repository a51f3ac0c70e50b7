#include "platform/linux/FrameGenerations.h"

#include <algorithm>

namespace {

// Frames are compared at one page of one family only, so 32 bits tell them apart; 0 stands for none. Hidden
// frames are all alike.
uint32_t folded(uint64_t frame) {
    const auto bits = static_cast<uint32_t>(frame ^ (frame >> 32U));
    return bits == 0 ? 1 : bits;
}

}  // namespace

void FrameGenerations::assign(uint64_t window, std::span<const Page> pages, std::span<uint32_t> generations) {
    const std::lock_guard lock(_mutex);
    Window& table = _windows[window];
    std::transform(pages.begin(), pages.end(), generations.begin(),
                   [&](const Page& page) { return _assign(table, page); });
}

uint64_t FrameGenerations::pages() const {
    const std::lock_guard lock(_mutex);
    return _pages;
}

uint32_t FrameGenerations::_assign(Window& window, const Page& page) {
    const uint32_t frame = folded(page.frame);
    for (size_t generation = 0; generation < window.size(); ++generation) {
        uint32_t& slot = (*window[generation])[page.slot];
        if (slot == 0) {
            slot = frame;
            ++_pages;
        }
        if (slot == frame) {
            return static_cast<uint32_t>(generation);
        }
    }
    window.push_back(std::make_unique<Generation>());
    (*window.back())[page.slot] = frame;
    ++_pages;
    return static_cast<uint32_t>(window.size() - 1);
}
