#include "platform/HeapsnapReader.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "support/RecordedTree.h"

namespace {

const std::string kCorpus = MEMWEIGHT_HEAPSNAPS;

std::string textOf(const std::string& name) {
    std::ifstream file(kCorpus + "/" + name);
    return {std::istreambuf_iterator<char>(file), {}};
}

std::vector<HeapsnapRegion> regionsOf(const HeapsnapReader& reader) {
    std::vector<HeapsnapRegion> regions;
    reader.enumerateRegions([&](const HeapsnapRegion& region) {
        regions.push_back(region);
        return false;
    });
    return regions;
}

std::string replaced(std::string text, const std::string& what, const std::string& with) {
    const size_t at = text.find(what);
    EXPECT_NE(at, std::string::npos) << what;
    return text.replace(at, what.size(), with);
}

std::string refusal(const std::string& text) {
    const auto reader = HeapsnapReader::open(text);
    return reader ? "(none)" : reader.error().description.value_or("(no description)");
}

TEST(HeapsnapReader, ReadsEveryMember) {
    const auto reader = HeapsnapReader::openFile(kCorpus + "/editor.heapsnap");
    ASSERT_TRUE(reader) << reader.error().description.value_or("");
    const HeapsnapProcess& process = (*reader)->process();
    EXPECT_EQ(process.pid, 812);
    EXPECT_EQ(process.name, "editor");
    EXPECT_TRUE(process.is64bit);
    EXPECT_EQ(process.description, "editor [812] X86-64");
    EXPECT_FALSE(process.hasSharedCache);
    EXPECT_EQ(process.pageSize, 4096U);
    EXPECT_EQ(process.physMemweight, 1048576U);
    EXPECT_EQ(process.physMemweightPeak, 2097152U);
    EXPECT_TRUE(process.breakdown);
    const auto regions = regionsOf(**reader);
    ASSERT_EQ(regions.size(), 1U);
    const HeapsnapRegion& region = regions[0];
    EXPECT_EQ(std::tie(region.start, region.length, region.offset, region.resident, region.sharedNowPrivate,
                       region.swappedOut, region.dirty, region.reusable, region.objectId),
              std::make_tuple(4194304U, 8192U, 16U, 8192U, 1U, 2U, 4U, 5U, UINT64_MAX));
    EXPECT_EQ(std::tie(region.protection, region.maxProtection, region.userTag, region.submap,
                       region.purgeState, region.referenceCount, region.shareMode, region.externalPager),
              std::make_tuple(5U, 7U, 3U, 1U, 2U, 65535U, 1U, true));
    EXPECT_EQ(*region.type, "__TEXT");
    EXPECT_EQ(*region.path, "/usr/bin/editor");
}

TEST(HeapsnapReader, WhatIsLeftOutHasDefaultsAndWhatIsUnknownIsPassedOver) {
    const auto reader = HeapsnapReader::openFile(kCorpus + "/least.heapsnap");
    ASSERT_TRUE(reader) << reader.error().description.value_or("");
    EXPECT_TRUE((*reader)->process().hasSharedCache);
    EXPECT_EQ((*reader)->process().binaryImages, "");
    const auto regions = regionsOf(**reader);
    ASSERT_EQ(regions.size(), 1U);
    EXPECT_EQ(regions[0].shareMode, 2U);
    EXPECT_EQ(regions[0].purgeState, 3U);
    EXPECT_EQ(*regions[0].type, "");
}

TEST(HeapsnapReader, RefusesWithThePlace) {
    const std::string whole = textOf("editor.heapsnap");
    const std::string least = textOf("least.heapsnap");
    const auto region = [&](const std::string& members) {
        return replaced(least, R"({"start":0,"length":0})", members);
    };
    struct Case {
        std::string text;
        std::string refusal;
    };
    const Case cases[] = {
        {"", "not valid JSON at byte 1"},
        {whole + "x", "not valid JSON at byte " + std::to_string(whole.size() + 1)},
        {replaced(whole, "editor", "\xFF"), "not valid JSON at byte 87"},
        {"[]", "the document is not an object"},
        {"5", "the document is not an object"},
        {"{}", "format is missing"},
        {replaced(whole, "heapsnap", "picture"), "format is not \"heapsnap\""},
        {replaced(whole, "\"version\": 1", "\"version\": 2"), "version 2 is not known"},
        {replaced(whole, "\"version\": 1", "\"version\": 1, \"version\": 1"), "version is there twice"},
        {replaced(least, "\"page_size\":1,", "\"page_size\":0,"), "page_size is 0"},
        {replaced(least, "\"page_size\":1,", ""), "page_size is missing"},
        {replaced(least, "\"page_size\":1,", "\"page_size\":4294967296,"),
         "page_size is not a whole number from 0 to 4294967295"},
        {replaced(least, "\"breakdown\":false", "\"breakdown\":0"), "breakdown is not true or false"},
        {replaced(whole, "\"pid\": 812", "\"pid\": 2147483648"),
         "process.pid is not a whole number from 0 to 2147483647"},
        {replaced(whole, "\"pid\": 812", "\"pid\": -1"),
         "process.pid is not a whole number from 0 to 2147483647"},
        {replaced(whole, "\"pid\": 812", "\"pid\": 1.5"),
         "process.pid is not a whole number from 0 to 2147483647"},
        {replaced(whole, "\"pid\": 812", "\"pid\": 1e99"),
         "process.pid is not a whole number from 0 to 2147483647"},
        {replaced(whole, "\"name\": \"editor\"", "\"name\": null"), "process.name is not a text"},
        {replaced(whole, "\"name\": \"editor\"", "\"name\": [\"x\"]"), "process.name is not a text"},
        {replaced(least, "\"name\":\"\",", ""), "process.name is missing"},
        {"{\"process\": []}", "process is not an object"},
        {"{\"regions\": {}}", "regions is not an array"},
        {"{\"regions\": 1}", "regions is not an array"},
        {region("7"), "regions[0] is not an object"},
        {region("[]"), "regions[0] is not an object"},
        {region(R"({"start":0,"length":1},{"start":1})"), "regions[1].length is missing"},
        {region(R"({"start":0,"length":1,"ref_count":65536})"),
         "regions[0].ref_count is not a whole number from 0 to 65535"},
        {region(R"({"start":0,"length":1,"share_mode":256})"),
         "regions[0].share_mode is not a whole number from 0 to 255"},
        {region(R"({"start":18446744073709551616,"length":1})"),
         "regions[0].start is not a whole number from 0 to 18446744073709551615"},
        {region(R"({"start":18446744073709551615,"length":2})"), "regions[0] ends behind the last address"},
        {region(R"({"start":0,"length":8},{"start":7,"length":8})"),
         "regions[1] begins before the one before it ends"},
        {region(R"({"start":18446744073709551615,"length":1},{"start":18446744073709551615,"length":1})"),
         "regions[1] begins before the one before it ends"},
        {"{\"later\": " + std::string(100000, '['), "nested deeper than 1000 levels"},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(refusal(c.text), c.refusal) << c.text.substr(0, 300);
    }
    EXPECT_EQ(refusal(region(R"({"start":18446744073709551615,"length":1})")), "(none)");
    EXPECT_EQ(refusal(region("")), "(none)") << "a process without memory";
}

TEST(HeapsnapReader, EveryCutIsRefused) {
    const std::string whole = textOf("editor.heapsnap");
    for (size_t length = 0; length < whole.rfind('}'); ++length) {
        EXPECT_TRUE(refusal(whole.substr(0, length)).starts_with("not valid JSON at byte")) << length;
    }
}

class HeapsnapFile : public RecordedTree {
protected:
    static std::string refusalOf(const std::filesystem::path& path) {
        const auto reader = HeapsnapReader::openFile(path);
        return reader ? "(none)" : reader.error().domain + ": " + reader.error().description.value_or("");
    }
};

TEST_F(HeapsnapFile, OnlyFilesAreOpenedAndOnlyWhatIsNeededIsRead) {
    EXPECT_EQ(refusalOf(_top + "/none"), "MWFileError: No such file or directory");
    EXPECT_EQ(refusalOf(_top), "MWFileError: Is a directory");
    ASSERT_EQ(mkfifo(place("pipe").c_str(), 0600), 0);
    EXPECT_EQ(refusalOf(place("pipe")), "HeapsnapReaderError: not a regular file");
    // Nothing but zeros behind the beginning, and more of them than there is memory.
    write("sparse", "{");
    std::filesystem::resize_file(place("sparse"), uint64_t{10} << 30U);
    EXPECT_EQ(refusalOf(place("sparse")), "HeapsnapReaderError: not valid JSON at byte 2");
}

}  // namespace
