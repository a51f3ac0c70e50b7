#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/MWHostInterface.h"

/// The functions of the running kernel, from `kallsyms`.
class KernelSymbols {
public:
    explicit KernelSymbols(std::string_view kallsyms);
    /// None below the first function, and where addresses are hidden from the caller (they then read as 0).
    std::optional<std::string> nameForAddress(uint64_t address) const;

private:
    struct Symbol {
        uint64_t address;
        std::string name;
    };
    std::vector<Symbol> _symbols;  ///< ascending
};

/// Places in the kernel's source, by the number of the site in the records made from `allocinfo`.
using KernelSourceLocations = std::map<uint64_t, KernelSymbolicator::SourceLocation>;

/// Reads `kallsyms`, which takes a tenth of a second, when the first address needs it.
class LinuxKernelSymbolicator : public KernelSymbolicator {
public:
    /// `procDirectory` outlives this.
    LinuxKernelSymbolicator(int procDirectory, std::shared_ptr<const KernelSourceLocations> locations)
        : _procDirectory(procDirectory), _locations(std::move(locations)) {}

    std::optional<std::string> nameForAddress(uint64_t address) override;
    std::optional<SourceLocation> sourceLocationForAddress(uint64_t address) override;

private:
    int _procDirectory;
    std::shared_ptr<const KernelSourceLocations> _locations;  ///< may be none
    std::optional<KernelSymbols> _symbols;
};
