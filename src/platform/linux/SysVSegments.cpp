#include "platform/linux/SysVSegments.h"

#include <algorithm>
#include <array>

#include "platform/linux/ProcText.h"

namespace procfs {

namespace {

std::vector<std::string_view> wordsOf(std::string_view line) {
    std::vector<std::string_view> words;
    for (std::string_view word = takeWord(line); !word.empty(); word = takeWord(line)) {
        words.push_back(word);
    }
    return words;
}

/// The place of each heading that is read, in a line.
struct Columns {
    explicit Columns(const std::vector<std::string_view>& headings) {
        for (size_t index = 0; index < kNames.size(); ++index) {
            const auto found = std::ranges::find(headings, kNames[index]);
            places[index] = static_cast<size_t>(found - headings.begin());
        }
    }

    static constexpr std::array<std::string_view, 7> kNames = {"shmid", "size", "cpid", "nattch",
                                                               "ctime", "rss",  "swap"};
    std::array<size_t, kNames.size()> places = {};
};

bool readSegment(const std::vector<std::string_view>& words, const Columns& columns, SysVSegment& segment) {
    size_t column = 0;
    const auto read = [&](auto& number) {
        const size_t place = columns.places[column++];
        std::string_view word = place < words.size() ? words[place] : std::string_view();
        return takeNumber(word, number) && word.empty();
    };
    return read(segment.identifier) && read(segment.size) && read(segment.creator) &&
           read(segment.attached) && read(segment.changeTime) && read(segment.resident) &&
           read(segment.swapped) && segment.creator >= 0;
}

}  // namespace

std::vector<SysVSegment> parseSysVSegments(std::string_view text) {
    const Columns columns(wordsOf(takeLine(text)));
    std::vector<SysVSegment> segments;
    while (!text.empty()) {
        SysVSegment segment;
        if (readSegment(wordsOf(takeLine(text)), columns, segment)) {
            segments.push_back(segment);
        }
    }
    return segments;
}

}  // namespace procfs
