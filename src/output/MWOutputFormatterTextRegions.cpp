// The region listing of the text report.

#include <fmt/format.h>

#include <iterator>
#include <optional>

#include "model/MWMemoryRegion.h"
#include "output/MWOutputFormatterText.h"
#include "process/MWProcess.h"

namespace {

/// Of an object's identifier, what the column of ten digits holds.
constexpr uint64_t kShownIdentifierBits = 0xFFFFFFFFFF;

/// A process can have a hundred thousand regions: rows reach the stream in pieces of about this size.
constexpr size_t kPieceSize = size_t{64} << 10;

std::string addressColumns(const MWMemoryRegion& region) {
    const uint64_t object = region.object_id() & kShownIdentifierBits;
    if (region.start() == MWNoAddress) {
        return fmt::format("        unmapped -         unmapped [{:10x}]", object);
    }
    return fmt::format("{:16x} - {:16x} [{:10x}]", region.start(), region.end(), object);
}

void writePiece(std::string& text, std::FILE* output) {
    std::fwrite(text.data(), 1, text.size(), output);
    text.clear();
}

}  // namespace

void MWOutputFormatterText::printSpanlistLikeOutputForProcess(const MWProcess& process,
                                                              const MWMemoryRegionList& regions) {
    _verbose = true;
    std::string text = _shown(process.displayString()) + "\n\n" + _spanlistHeader();
    for (const auto& region : regions) {
        text += _spanlistRow(*region, process.pageSize());
        if (text.size() >= kPieceSize) {
            writePiece(text, _output);
        }
    }
    text += "\n";
    writePiece(text, _output);
}

std::string MWOutputFormatterText::_spanlistHeader() const {
    const bool swapped = _shows(MWTextShowSwapped);
    const bool wired = _shows(MWTextShowWired);
    return fmt::format(
        "           start                end  [objectid]      VRT     DRT{}     CLN     RCL{}   tag "
        "(detail)\n"
        "      ----------         ----------  ----------    -----   -----{}   -----   -----{}   "
        "------------\n",
        swapped ? "     SWP" : "", wired ? "    WIRE" : "", swapped ? "   -----" : "",
        wired ? "   -----" : "");
}

std::string MWOutputFormatterText::_spanlistRow(const MWMemoryRegion& region, uint64_t pageSize) const {
    std::string row = addressColumns(region);
    const auto appendPages = [&](uint64_t size) {
        fmt::format_to(std::back_inserter(row), " {:7}", _pagesForSize(size, pageSize));
    };
    appendPages(region.size());
    appendPages(region.dirtySize() + region.swappedSize());
    if (_shows(MWTextShowSwapped)) {
        appendPages(region.swappedSize());
    }
    appendPages(region.cleanNonSpecSize());
    appendPages(region.reclaimableSize());
    if (_shows(MWTextShowWired)) {
        appendPages(region.wiredSize());
    }
    row += "   " + _shown(region.name());
    if (const auto detail = _truncatedNameForString(region.detailedName())) {
        row += " " + _shown(*detail);
    }
    return row + "\n";
}
