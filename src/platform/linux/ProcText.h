#pragma once

#include <charconv>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace procfs {

/// What `stat` tells of a process.
struct ProcStat {
    int32_t pid = 0;
    std::string comm;  ///< at most 15 bytes, blanks and parentheses included
    char state = '?';
    int32_t ppid = 0;
    uint64_t flags = 0;
    uint64_t threads = 0;
    uint64_t startTime = 0;  ///< clock ticks since boot
    // Addresses of the program; 0 where the caller may not look, and once the memory is gone.
    uint64_t startCode = 0;
    uint64_t endCode = 0;
    uint64_t startStack = 0;

    bool isKernelThread() const { return (flags & 0x00200000U) != 0; }
    /// The thread that this was read of has ended, or is ending and may have no memory any more (PF_EXITING).
    /// The process can live on in other threads.
    bool threadEnded() const { return state == 'Z' || state == 'X' || (flags & 0x4U) != 0; }
    /// Whether two looks at one thread saw the same program.
    bool isSameProgramAs(const ProcStat& other) const {
        return startCode == other.startCode && endCode == other.endCode && startStack == other.startStack;
    }
};

/// What `status` tells of a process, in bytes. Exact from about Linux 6.16 (and 6.12 stable), before that off
/// by some hundred kB; a line that is not there (a kernel thread, an older kernel) counts as 0.
struct ProcStatus {
    uint64_t vmHwm = 0;
    uint64_t rssAnon = 0;
    uint64_t rssFile = 0;
    uint64_t rssShmem = 0;
    uint64_t vmPte = 0;
    uint64_t vmSwap = 0;  ///< without swapped shmem
    uint64_t hugetlbPages = 0;
    uint64_t vmLck = 0;           ///< locked by mlock
    bool hasShadowStack = false;  ///< of x86
    bool hasMemory = false;       ///< what has ended, and kernel threads, have none and no such lines
};

/// None when the text is no `stat` line.
std::optional<ProcStat> parseStat(std::string_view text);
ProcStatus parseStatus(std::string_view text);
/// The file name of argv[0] in the text of `cmdline`; empty when there is none or when the process rewrote
/// its title (a blank or a colon in argv[0]).
std::string nameFromCommandLine(std::string_view commandLine);
/// Whether the text of `auxv` has 64-bit entries; none when it is too short to tell.
std::optional<bool> auxvIs64bit(std::string_view auxv);

/// The number in "ipc:[NUMBER]", what the link of a namespace reads; 0 for any other text.
uint64_t parseNamespace(std::string_view link);

/// Takes a number off the front of `text`; false and nothing taken when there is none or it does not fit.
template <class Number>
bool takeNumber(std::string_view& text, Number& number, int base = 10) {
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number, base);
    if (error != std::errc()) {
        return false;
    }
    text.remove_prefix(static_cast<size_t>(end - text.data()));
    return true;
}

/// Takes `prefix` off the front of `text`, if it is there.
inline bool takePrefix(std::string_view& text, std::string_view prefix) {
    if (!text.starts_with(prefix)) {
        return false;
    }
    text.remove_prefix(prefix.size());
    return true;
}

inline void skipBlanks(std::string_view& text) {
    const size_t first = text.find_first_not_of(" \t");
    text.remove_prefix(first == std::string_view::npos ? text.size() : first);
}

/// Takes the next word off the front of `text`; empty at the end.
inline std::string_view takeWord(std::string_view& text) {
    skipBlanks(text);
    const std::string_view word = text.substr(0, text.find_first_of(" \t"));
    text.remove_prefix(word.size());
    return word;
}

/// Takes the next line, without its line end, off the front of `text`.
inline std::string_view takeLine(std::string_view& text) {
    const size_t end = text.find('\n');
    const std::string_view line = text.substr(0, end);
    text.remove_prefix(end == std::string_view::npos ? text.size() : end + 1);
    return line;
}

/// "  123 kB" in bytes; none for anything else, also for what does not fit in 64 bits.
std::optional<uint64_t> parseKilobytes(std::string_view text);

}  // namespace procfs
