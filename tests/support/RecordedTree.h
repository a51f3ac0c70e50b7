#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "platform/linux/Cachestat.h"
#include "platform/linux/Procfs.h"

/// A tree of recorded files in the place of procfs, for the length of a test.
class RecordedTree : public testing::Test {
protected:
    void SetUp() override { ASSERT_NE(mkdtemp(_top.data()), nullptr); }
    void TearDown() override { std::filesystem::remove_all(_top); }

    std::filesystem::path place(const std::string& path) {
        const std::filesystem::path result = _top + "/" + path;
        std::filesystem::create_directories(result.parent_path());
        return result;
    }
    void write(const std::string& path, const std::string& text) { std::ofstream(place(path)) << text; }
    void link(const std::string& path, const char* target) {
        std::filesystem::create_symlink(target, place(path));
    }
    procfs::Descriptor directory(const std::string& path) {
        return procfs::open(AT_FDCWD, (_top + "/" + path).c_str(), O_DIRECTORY);
    }
    /// Writes a file's pages back. False where the kernel does not tell then that they are clean.
    bool makeClean(const std::string& path) {
        const procfs::Descriptor file = procfs::open(AT_FDCWD, (_top + "/" + path).c_str());
        fsync(file.get());
        const auto pages = readCachestat(file.get());
        return pages && pages->cached != 0 && pages->dirty + pages->writeback == 0;
    }

    std::string _top = testing::TempDir() + "memweight-proc-XXXXXX";
};
