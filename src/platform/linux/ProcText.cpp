#include "platform/linux/ProcText.h"

#include <algorithm>
#include <array>
#include <cstring>
#include <utility>

namespace procfs {

namespace {

template <class Number>
bool takeField(std::string_view& text, Number& number) {
    std::string_view word = takeWord(text);
    return takeNumber(word, number);
}

}  // namespace

std::optional<uint64_t> parseKilobytes(std::string_view text) {
    skipBlanks(text);
    uint64_t kilobytes = 0;
    if (!takeNumber(text, kilobytes) || kilobytes > UINT64_MAX / 1024) {
        return std::nullopt;
    }
    skipBlanks(text);
    return text.starts_with("kB") ? std::optional(kilobytes * 1024) : std::nullopt;
}

// The command name stands in parentheses and can hold blanks and parentheses itself, so the fields behind it
// are counted from the last closing one.
std::optional<ProcStat> parseStat(std::string_view text) {
    ProcStat stat;
    const size_t close = text.rfind(')');
    std::string_view front = text;
    if (close == std::string_view::npos || !takeNumber(front, stat.pid) || !takePrefix(front, " (")) {
        return std::nullopt;
    }
    const auto nameStart = static_cast<size_t>(front.data() - text.data());
    if (close < nameStart || close + 2 >= text.size()) {
        return std::nullopt;
    }
    stat.comm = text.substr(nameStart, close - nameStart);
    std::string_view rest = text.substr(close + 2);
    rest = takeLine(rest);
    const std::string_view state = takeWord(rest);
    if (state.empty() || !takeField(rest, stat.ppid) || stat.pid < 0 || stat.ppid < 0) {
        return std::nullopt;
    }
    stat.state = state.front();
    // The words passed over before flags (9), num_threads (20), starttime (22), startcode (26), endcode (27)
    // and startstack (28).
    constexpr std::array<int, 6> kSkippedBefore = {4, 10, 1, 3, 0, 0};
    const std::array<uint64_t*, 6> fields = {&stat.flags,     &stat.threads, &stat.startTime,
                                             &stat.startCode, &stat.endCode, &stat.startStack};
    for (size_t i = 0; i < fields.size(); ++i) {
        for (int skipped = 0; skipped < kSkippedBefore[i]; ++skipped) {
            takeWord(rest);
        }
        if (!takeField(rest, *fields[i])) {
            return std::nullopt;
        }
    }
    return stat;
}

ProcStatus parseStatus(std::string_view text) {
    ProcStatus status;
    const std::array<std::pair<std::string_view, uint64_t*>, 8> fields = {
        {{"VmHWM:", &status.vmHwm},
         {"VmLck:", &status.vmLck},
         {"RssFile:", &status.rssFile},
         {"RssAnon:", &status.rssAnon},
         {"RssShmem:", &status.rssShmem},
         {"VmPTE:", &status.vmPte},
         {"VmSwap:", &status.vmSwap},
         {"HugetlbPages:", &status.hugetlbPages}}};
    while (!text.empty()) {
        std::string_view line = takeLine(text);
        if (takePrefix(line, "x86_Thread_features:")) {
            status.hasShadowStack = line.find("shstk") != std::string_view::npos;
            continue;
        }
        for (const auto& [name, value] : fields) {
            if (takePrefix(line, name)) {
                *value = parseKilobytes(line).value_or(0);
                status.hasMemory = true;
                break;
            }
        }
    }
    return status;
}

std::string nameFromCommandLine(std::string_view commandLine) {
    const std::string_view program = commandLine.substr(0, commandLine.find('\0'));
    if (program.find_first_of(" :") != std::string_view::npos) {
        return {};
    }
    return std::string(program.substr(program.rfind('/') + 1));
}

uint64_t parseNamespace(std::string_view link) {
    uint64_t number = 0;
    link.remove_prefix(std::min(link.find('['), link.size()));
    return takePrefix(link, "[") && takeNumber(link, number) && link == "]" ? number : 0;
}

// Entries are pairs of type and value; the first type is a small number, so in the 32-bit form the upper half
// of the first eight bytes is the first value, which is an address or a capability mask and not 0.
std::optional<bool> auxvIs64bit(std::string_view auxv) {
    uint64_t first = 0;
    if (auxv.size() < sizeof(first)) {
        return std::nullopt;
    }
    std::memcpy(&first, auxv.data(), sizeof(first));
    return first <= UINT32_MAX;
}

}  // namespace procfs
