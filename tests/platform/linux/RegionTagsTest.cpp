#include "platform/linux/RegionTags.h"

#include <fmt/format.h>
#include <gtest/gtest.h>

#include <array>
#include <random>
#include <sstream>
#include <string>
#include <vector>

#include "platform/MWRegionTags.h"
#include "platform/RecordedFile.h"
#include "platform/linux/AddressSpace.h"

namespace {

std::vector<uint32_t> tagsOf(const std::string& smaps, RegionNames& names) {
    ShmemDevices devices;
    std::vector<procfs::Vma> vmas = procfs::parseSmaps(smaps);
    const std::vector<BackedVma> backed = backedVmas(vmas, devices, -1);
    return tagsForVmas(backed, imagesOfVmas(backed), names);
}

std::string kindOf(uint32_t tag, const RegionNames& names) {
    for (const MWRegionTagName& known : MWRegionTagNames) {
        if (known.tag == tag) {
            return tag == MWTagNone ? "-" : known.name;
        }
    }
    return names.nameForTag(tag).value_or("");
}

/// One mapping: the beginning of its line in smaps, and what matters of the rest.
struct Row {
    std::string mapping;
    std::string dirty;
    std::string flags;
    std::string path;
};

std::string smapsOf(const Row& row) {
    const char* device = row.path.starts_with('/') ? "fe:00 9" : "00:00 0";
    return fmt::format("{} 00000000 {} {}\nPrivate_Dirty: {} kB\nVmFlags: mr mw me {}\n", row.mapping, device,
                       row.path, row.dirty, row.flags);
}

/// The fields of "A | B | C", without the blanks around them.
std::array<std::string, 5> fieldsOf(const std::string& line) {
    std::array<std::string, 5> fields;
    std::istringstream text(line);
    for (std::string& field : fields) {
        std::getline(text, field, '|');
        field.erase(0, field.find_first_not_of(' '));
        field.erase(field.find_last_not_of(' ') + 1);
    }
    return fields;
}

/// The mappings of one process, and the kind that each is to be told as.
struct Group {
    std::string name;
    std::string smaps;
    std::vector<std::string> kinds;
};

std::vector<Group> recordedGroups() {
    std::vector<Group> groups;
    std::istringstream lines(recordedFile("regions.txt"));
    for (std::string line; std::getline(lines, line);) {
        if (line.starts_with('[')) {
            groups.push_back({.name = line, .smaps = {}, .kinds = {}});
        } else if (!line.empty() && !line.starts_with('#')) {
            const auto [kind, mapping, dirty, flags, path] = fieldsOf(line);
            groups.back().smaps += smapsOf({mapping, dirty, flags, path});
            groups.back().kinds.push_back(kind);
        }
    }
    return groups;
}

TEST(RegionTagsTest, RecordedMappingsAreToldAsTheirKind) {
    const std::vector<Group> groups = recordedGroups();
    EXPECT_EQ(groups.size(), 16U);
    for (const Group& group : groups) {
        RegionNames names;
        std::vector<std::string> kinds;
        for (const uint32_t tag : tagsOf(group.smaps, names)) {
            kinds.push_back(kindOf(tag, names));
        }
        EXPECT_EQ(kinds, group.kinds) << group.name;
    }
}

// Whatever stands beside whatever: each mapping gets one tag.
TEST(RegionTagsTest, AnySequenceOfMappingsIsTagged) {
    std::mt19937 random(20);
    const auto pick = [&](const auto& choices) { return choices[random() % std::size(choices)]; };
    const char* const permissions[] = {"---p", "rw-p", "r--p", "r-xp", "rwxp", "rw-s"};
    const char* const paths[] = {"", "", "", "", "/usr/bin/node", "/usr/lib/libjvm.so", "[heap]", "[anon:x]"};
    const char* const flags[] = {"", "ac", "nr", "nh ac", "ht", "gd"};
    const uint64_t sizes[] = {0x1000, 0x40000, 0x2000000, 0x4000000};
    for (int round = 0; round < 300; ++round) {
        uint64_t at = pick(std::to_array<uint64_t>({0x1000, 0x7fff7000, 0xc000000000, 0x7f0000000000}));
        std::string smaps;
        const size_t count = 1 + random() % 30;
        for (size_t i = 0; i < count; ++i) {
            const uint64_t start = at + random() % 2 * pick(sizes);
            at = start + pick(sizes);
            smaps += smapsOf(
                {fmt::format("{:x}-{:x} {}", start, at, pick(permissions)), "4", pick(flags), pick(paths)});
        }
        RegionNames names;
        const std::vector<uint32_t> tags = tagsOf(smaps, names);
        ASSERT_EQ(tags.size(), count);
        for (const uint32_t tag : tags) {
            EXPECT_LE(tag, MWTagLastDynamic) << smaps;
        }
    }
}

}  // namespace
