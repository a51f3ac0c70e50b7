#include "output/MWOutputFile.h"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <utility>
#include <vector>

#include "output/MWWholeFile.h"
#include "platform/linux/MWLinuxHost.h"
#include "support/FakeHost.h"
#include "support/RecordedTree.h"

namespace {

constexpr uid_t kSomebody = 65534;

class OutputFiles : public RecordedTree {
protected:
    std::string at(const std::string& name) const { return _top + "/" + name; }
    std::string contentOf(const std::string& name) const {
        std::ifstream file(at(name));
        return std::string(std::istreambuf_iterator<char>(file), {});
    }
    /// errno of writing a report to the path; 0 when it was written.
    static int errorOf(const std::string& path) {
        const auto file = MWOutputFile::create(path);
        if (file == nullptr) {
            return errno;
        }
        file->write("report");
        return file->finish();
    }
    size_t entries(const std::string& folder) const {
        return static_cast<size_t>(std::distance(std::filesystem::directory_iterator(at(folder)), {}));
    }
};

TEST_F(OutputFiles, FollowNoLinkThatAnotherUserPlanted) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "needs root, to make files of another user";
    }
    write("secret", "old");
    write("own/file", "old");
    for (const char* folder : {"open", "closed"}) {
        std::filesystem::create_directory(at(folder));
        for (const auto& [link, target] : std::vector<std::pair<std::string, std::string>>{
                 {"/planted", at("secret")}, {"/folder", at("own")}, {"/mine", "../own/file"}}) {
            std::filesystem::create_symlink(target, at(folder) + link);
            const uid_t owner = link == "/mine" ? 0 : kSomebody;
            ASSERT_EQ(lchown((at(folder) + link).c_str(), owner, owner), 0);
        }
    }
    ASSERT_EQ(chmod(at("open").c_str(), 01777), 0);
    std::filesystem::create_symlink("open/planted", at("chain"));
    for (const char* path : {"open/planted", "open/folder/file", "open/folder/new", "chain"}) {
        EXPECT_EQ(errorOf(at(path)), EACCES) << path;
    }
    MWLinuxHost().unlinkRegularFile(at("open/folder/file"));
    EXPECT_EQ(contentOf("secret") + contentOf("own/file"), "oldold") << "nor removed by way of one";
    EXPECT_EQ(entries("own"), 1U);

    EXPECT_EQ(errorOf(at("open/mine")), 0);
    EXPECT_EQ(contentOf("own/file"), "report");
    EXPECT_EQ(errorOf(at("closed/planted")), 0) << "nobody else can plant one there";
    EXPECT_EQ(contentOf("secret"), "report");
    ASSERT_EQ(chown(at("open").c_str(), kSomebody, kSomebody), 0);
    EXPECT_EQ(errorOf(at("open/planted")), 0) << "the folder's owner could do worse";
}

TEST_F(OutputFiles, AreFoundByAnyPath) {
    write("a/file", "longer than the report");
    std::filesystem::create_symlink("loop", at("loop"));
    std::filesystem::create_symlink("a", at("b"));
    std::filesystem::create_symlink("a/made", at("dangling"));
    const std::vector<std::pair<std::string, int>> cases = {
        {at("a//./../b/file"), 0},
        {at("b/new"), 0},
        {at("dangling"), 0},
        {"/dev/null", 0},
        {"/dev/full", ENOSPC},
        {"", ENOENT},
        {"/", EISDIR},
        {at("new/"), ENOENT},
        {at("a"), EISDIR},
        {at("loop"), ELOOP},
        {at("nowhere/file"), ENOENT},
        {at("a/file/file"), ENOTDIR},
        {at(std::string(300, 'n')), ENAMETOOLONG},
    };
    for (const auto& [path, error] : cases) {
        EXPECT_EQ(errorOf(path), error) << path;
    }
    for (const char* name : {"a/file", "a/new", "a/made"}) {
        EXPECT_EQ(contentOf(name), "report") << name;
    }
    // An open file that has no name any more can be reached through /proc alone.
    const auto open = MWOutputFile::create(at("gone"));
    std::filesystem::remove(at("gone"));
    EXPECT_EQ(errorOf("/proc/self/fd/" + std::to_string(open->descriptor())), 0);
    EXPECT_FALSE(std::filesystem::exists(at("gone")));
}

TEST_F(OutputFiles, HoldWholePiecesWhenThereIsNoMoreRoom) {
    const FakeHost host;
    rlimit before = {};
    getrlimit(RLIMIT_FSIZE, &before);
    const auto handler = std::signal(SIGXFSZ, SIG_IGN);
    const rlimit limit = {.rlim_cur = 10000, .rlim_max = before.rlim_max};
    ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &limit), 0);
    const auto file = MWOutputFile::create(at("file"));
    for (int piece = 0; piece < 3; ++piece) {
        file->write(std::string(6000, 'x'));
    }
    setrlimit(RLIMIT_FSIZE, &before);
    std::signal(SIGXFSZ, handler);
    testing::internal::CaptureStderr();
    file->close();
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "memweight: " + at("file") + ": File too large\n");
    EXPECT_EQ(contentOf("file").size(), 6000U);
}

TEST_F(OutputFiles, AWholeFileTakesItsNameAtTheEnd) {
    std::filesystem::create_directory(at("folder"));
    const auto begin = [&] {
        auto file = MWWholeFile::create(*MWOutputPlace::find(at("folder/file")));
        file->contents().write("text");
        return file;
    };
    begin();
    EXPECT_EQ(entries("folder"), 0U) << "given up";
    const auto first = begin();
    EXPECT_EQ(first->publish(false), 0);
    EXPECT_EQ(contentOf("folder/file"), "text");
    EXPECT_EQ(std::filesystem::status(at("folder/file")).permissions(), std::filesystem::perms(0600));
    write("folder/file", "old");
    EXPECT_EQ(begin()->publish(false), EEXIST);
    EXPECT_EQ(contentOf("folder/file"), "old");
    EXPECT_EQ(begin()->publish(true), 0);
    EXPECT_EQ(contentOf("folder/file"), "text");
    EXPECT_EQ(entries("folder"), 1U);
}

}  // namespace
