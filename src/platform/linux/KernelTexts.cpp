#include "platform/linux/KernelTexts.h"

#include <algorithm>
#include <array>
#include <climits>
#include <optional>

#include "platform/MWSizeMath.h"
#include "platform/linux/ProcText.h"

namespace procfs {

namespace {

// Takes the last word off the end of `text`; empty when there is none.
std::string_view takeLastWord(std::string_view& text) {
    text = text.substr(0, text.find_last_not_of(" \t") + 1);
    const std::string_view word = text.substr(text.find_last_of(" \t") + 1);
    text.remove_suffix(word.size());
    return word;
}

std::optional<uint64_t> numberOf(std::string_view word, int base = 10) {
    uint64_t number = 0;
    return takeNumber(word, number, base) && word.empty() ? std::optional(number) : std::nullopt;
}

template <class Row>
std::vector<Row> parseRows(std::string_view text, std::optional<Row> (*parse)(std::string_view line)) {
    std::vector<Row> rows;
    while (!text.empty()) {
        if (auto row = parse(takeLine(text))) {
            rows.push_back(*std::move(row));
        }
    }
    return rows;
}

// "NAME <active> <all> <size> <per slab> <pages per slab> : tunables ... : slabdata <active> <all> <shared>".
// Names have had blanks in them.
std::optional<SlabCache> parseSlabRow(std::string_view line) {
    constexpr std::string_view kSlabdata = " : slabdata ";
    const size_t slabdata = line.find(kSlabdata);
    if (line.starts_with('#') || slabdata == std::string_view::npos) {
        return std::nullopt;
    }
    std::string_view slabs = line.substr(slabdata + kSlabdata.size());
    takeWord(slabs);
    const auto allSlabs = numberOf(takeWord(slabs));
    std::string_view head = line.substr(0, line.find(" : "));
    const auto pagesPerSlab = numberOf(takeLastWord(head));
    takeLastWord(head);
    const auto size = numberOf(takeLastWord(head));
    takeLastWord(head);
    const auto active = numberOf(takeLastWord(head));
    skipBlanks(head);
    head = head.substr(0, head.find_last_not_of(" \t") + 1);
    if (!allSlabs || !pagesPerSlab || !size || !active || head.empty()) {
        return std::nullopt;
    }
    return SlabCache{.name = std::string(head),
                     .activeObjects = *active,
                     .objectSize = *size,
                     .pagesPerSlab = *pagesPerSlab,
                     .slabs = *allSlabs};
}

bool isCall(std::string_view word) {
    const size_t offset = word.find("+0x");
    return (offset != 0 && offset != std::string_view::npos) || word.starts_with("0x");
}

// "NAME SIZE ..."
std::optional<LoadedModule> parseModule(std::string_view line) {
    const std::string_view name = takeWord(line);
    const auto bytes = numberOf(takeWord(line));
    return bytes ? std::optional(LoadedModule{std::string(name), *bytes}) : std::nullopt;
}

// "BYTES CALLS FILE:LINE func:NAME", "BYTES CALLS FILE:LINE [MODULE] func:NAME"
std::optional<AllocationSite> parseAllocation(std::string_view line) {
    const auto bytes = numberOf(takeWord(line));
    takeWord(line);
    const std::string_view place = takeWord(line);
    std::string_view function = takeWord(line);
    std::string_view module;
    if (function.starts_with('[')) {
        module = function.substr(1, function.find(']') - 1);
        function = takeWord(line);
    }
    const size_t colon = std::min(place.rfind(':'), place.size());
    const auto number = numberOf(place.substr(std::min(colon + 1, place.size())));
    if (!bytes || !number || !takePrefix(function, "func:")) {
        return std::nullopt;
    }
    return AllocationSite{.bytes = *bytes,
                          .file = std::string(place.substr(0, colon)),
                          .line = static_cast<int>(std::min<uint64_t>(*number, INT_MAX)),
                          .module = std::string(module),
                          .function = std::string(function)};
}

}  // namespace

uint64_t Figures::operator[](std::string_view name) const {
    const auto found = _figures.find(name);
    return found == _figures.end() ? 0 : found->second;
}

uint64_t Figures::sum(std::initializer_list<std::string_view> names) const {
    uint64_t sum = 0;
    for (const std::string_view name : names) {
        sum = MWSaturatingAdd(sum, (*this)[name]);
    }
    return sum;
}

Figures parseMeminfo(std::string_view text) {
    Figures figures;
    while (!text.empty()) {
        const std::string_view line = takeLine(text);
        const size_t colon = std::min(line.find(':'), line.size());
        if (const auto bytes = parseKilobytes(line.substr(std::min(colon + 1, line.size())))) {
            figures.set(line.substr(0, colon), *bytes);
        }
    }
    return figures;
}

Figures parseVmstat(std::string_view text) {
    Figures figures;
    while (!text.empty()) {
        std::string_view line = takeLine(text);
        const std::string_view name = takeWord(line);
        if (const auto figure = numberOf(takeWord(line))) {
            figures.set(name, *figure);
        }
    }
    return figures;
}

uint64_t pagesInPerCpuLists(std::string_view zoneinfo) {
    uint64_t pages = 0;
    while (!zoneinfo.empty()) {
        std::string_view line = takeLine(zoneinfo);
        if (takeWord(line) == "count:") {
            pages = MWSaturatingAdd(pages, numberOf(takeWord(line)).value_or(0));
        }
    }
    return pages;
}

std::vector<SlabCache> parseSlabinfo(std::string_view text) {
    return parseRows(text, parseSlabRow);
}

std::string VmallocCaller::function() const {
    const std::string word = call.substr(0, call.find(' '));
    const size_t offset = word.find("+0x");
    return offset == std::string::npos ? "" : word.substr(0, offset);
}

std::string VmallocCaller::name() const {
    const size_t module = call.find(" [");
    const std::string plain = function();
    return plain.empty() || module == std::string::npos ? plain : plain + call.substr(module);
}

uint64_t VmallocCaller::address() const {
    std::string_view digits = std::string_view(call).substr(0, call.find(' '));
    return takePrefix(digits, "0x") ? numberOf(digits, 16).value_or(0) : 0;
}

// "0xSTART-0xEND SIZE CALL [MODULE] pages=N ...", the words behind the size in any number.
std::map<VmallocCaller, uint64_t> parseVmallocinfo(std::string_view text) {
    std::map<VmallocCaller, uint64_t> pages;
    while (!text.empty()) {
        std::string_view line = takeLine(text);
        takeWord(line);
        takeWord(line);
        VmallocCaller caller;
        for (std::string_view word = takeWord(line); !word.empty(); word = takeWord(line)) {
            if (caller.call.empty() && isCall(word)) {
                caller.call = word;
            } else if (!caller.call.empty() && word.starts_with('[')) {
                caller.call += " " + std::string(word);
            } else if (takePrefix(word, "pages=")) {
                uint64_t& sum = pages[caller];
                sum = MWSaturatingAdd(sum, numberOf(word).value_or(0));
                break;
            }
        }
    }
    return pages;
}

std::vector<LoadedModule> parseModules(std::string_view text) {
    return parseRows(text, parseModule);
}

std::vector<AllocationSite> parseAllocinfo(std::string_view text) {
    return parseRows(text, parseAllocation);
}

}  // namespace procfs
