#include "platform/linux/KernelSymbols.h"

#include <algorithm>

#include "platform/linux/ProcText.h"
#include "platform/linux/Procfs.h"

namespace {

constexpr size_t kLongestKallsyms = 256U << 20U;

bool isFunction(char type) {
    return type == 't' || type == 'T' || type == 'w' || type == 'W';
}

}  // namespace

// "ADDRESS TYPE NAME", "ADDRESS TYPE NAME\t[MODULE]", in no order that could be relied on.
KernelSymbols::KernelSymbols(std::string_view kallsyms) {
    while (!kallsyms.empty()) {
        std::string_view line = procfs::takeLine(kallsyms);
        uint64_t address = 0;
        if (!procfs::takeNumber(line, address, 16) || address == 0 || line.size() < 4 ||
            !isFunction(line[1])) {
            continue;
        }
        line.remove_prefix(3);
        std::string name(line);
        std::ranges::replace(name, '\t', ' ');
        _symbols.push_back({address, std::move(name)});
    }
    std::ranges::stable_sort(_symbols, {}, &Symbol::address);
}

std::optional<std::string> KernelSymbols::nameForAddress(uint64_t address) const {
    const auto next = std::ranges::upper_bound(_symbols, address, {}, &Symbol::address);
    return next == _symbols.begin() ? std::nullopt : std::optional(std::prev(next)->name);
}

std::optional<std::string> LinuxKernelSymbolicator::nameForAddress(uint64_t address) {
    if (!_symbols) {
        std::string text;
        procfs::readFile(_procDirectory, "kallsyms", text, kLongestKallsyms);
        _symbols.emplace(text);
    }
    return _symbols->nameForAddress(address);
}

std::optional<KernelSymbolicator::SourceLocation> LinuxKernelSymbolicator::sourceLocationForAddress(
    uint64_t address) {
    if (_locations == nullptr) {
        return std::nullopt;
    }
    const auto found = _locations->find(address);
    return found == _locations->end() ? std::nullopt : std::optional(found->second);
}
