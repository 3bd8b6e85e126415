#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "TestSupport.h"
#include "util/FileSystemHelper.h"
#include "util/FileSystemUtilities.h"

namespace tavrix::payload {
namespace {

namespace fs = std::filesystem;
using test::TempDir;
using test::writeText;

mode_t modeOf(const std::string& path) {
    struct stat info {};
    EXPECT_EQ(::lstat(path.c_str(), &info), 0) << path;
    return info.st_mode & 07777;
}

// A copy keeps modes and links, and never replaces what is there.
TEST(FileSystemPrimitives, CopyKeepsModesAndLinksAndNeverReplaces) {
    TempDir dir;
    writeText(dir / "tree/script", "#!/bin/sh\n");
    ::chmod((dir / "tree/script").c_str(), 0750);
    ::chmod((dir / "tree").c_str(), 0705);
    fs::create_symlink("script", dir / "tree/l");
    EXPECT_EQ(copyItemTree(dir / "tree", dir / "copy"), 0);
    EXPECT_EQ(test::snapshotTree(dir / "copy"),
              (test::Tree{{"script", "#!/bin/sh\n"}, {"l", "-> script"}}));
    EXPECT_EQ(modeOf(dir / "copy/script"), 0750u);
    EXPECT_EQ(modeOf(dir / "copy"), 0705u);

    writeText(dir / "a", "a");
    writeText(dir / "b", "b");
    EXPECT_EQ(copyItemTree(dir / "a", dir / "b"), EEXIST);
    EXPECT_EQ(test::readText(dir / "b"), "b");
}

TEST(FileSystemHelper, ListCreateAndRemove) {
    TempDir dir;
    FileSystemHelper helper;
    std::vector<std::string> list{"untouched"};
    EXPECT_EQ(helper.listDirectory(dir / "missing", list, false), ENOENT);
    EXPECT_EQ(list, std::vector<std::string>{"untouched"});
    writeText(dir / "d/one", "");
    writeText(dir / "d/sub/two", "");
    ASSERT_EQ(helper.listDirectory(dir / "d", list, false), 0);
    std::sort(list.begin(), list.end());
    EXPECT_EQ(list, (std::vector<std::string>{"one", "sub"}));
    ASSERT_EQ(helper.listDirectory(dir / "d", list, true), 0);
    std::sort(list.begin(), list.end());
    EXPECT_EQ(list, (std::vector<std::string>{dir / "d/one", dir / "d/sub"}));

    // The mode is set exactly on the new directory; intermediates get the umask default.
    EXPECT_EQ(helper.createDirectory(dir / "a/b", 0777, false), ENOENT);
    EXPECT_EQ(helper.createDirectory(dir / "a/b", 0777, true), 0);
    EXPECT_EQ(modeOf(dir / "a/b"), 0777u);
    EXPECT_EQ(modeOf(dir / "a"), 0777u & ~0022u);
    EXPECT_EQ(helper.createDirectory(dir / "a/b", 0700, true), 0);
    EXPECT_EQ(helper.createDirectory(dir / "a/b", 0700, false), EEXIST);
    EXPECT_NE(helper.createDirectory(dir / "d/one", 0755, true), 0);

    // Links inside a removed tree go, their targets stay.
    fs::create_directory_symlink(dir / "a", dir / "d/link");
    EXPECT_TRUE(helper.fileExists(dir / "d/link/b"));
    EXPECT_EQ(removeItemTree(dir / "d"), 0);
    EXPECT_FALSE(helper.fileExists(dir / "d"));
    EXPECT_TRUE(fs::is_directory(dir / "a/b"));
    EXPECT_EQ(removeItemTree(dir / "d"), ENOENT);
}

// A tree that an unprivileged daemon extracted with a directory it may not write: removing the
// tree must still take everything, or the next bundle would be mixed into what is left.
TEST(FileSystemHelper, RemoveItemOpensUpDirectoriesWithoutWritePermission) {
    if (::geteuid() != 0) {
        GTEST_SKIP() << "needs root to act as an unprivileged owner";
    }
    TempDir dir;
    constexpr uid_t kNobody = 65534;
    ASSERT_EQ(::chown(dir.path().c_str(), kNobody, kNobody), 0);
    const std::string tree = dir / "bundle";
    pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        bool ok = ::setgid(kNobody) == 0 && ::setuid(kNobody) == 0;
        writeText(tree + "/Resources/locked/file", "x");
        ok = ok && ::chmod((tree + "/Resources/locked").c_str(), 0555) == 0 &&
             ::chmod((tree + "/Resources").c_str(), 0500) == 0;
        ok = ok && removeItemTree(tree) == 0 && !fs::exists(fs::symlink_status(tree));
        ::_exit(ok ? 0 : 1);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
}

// A full disk part way through a copy leaves nothing under the final name and no temporary
// file.
TEST(FileSystemPrimitives, ACopyThatRunsOutOfSpaceLeavesNoFileBehind) {
    TempDir dir;
    fs::create_directory(dir / "small");
    const test::TmpfsMount small(dir / "small", "size=1m");
    if (!small.mounted) {
        GTEST_SKIP() << "cannot mount a small tmpfs (needs root)";
    }
    writeText(dir / "big", std::string(3 << 20, 'b'));
    EXPECT_EQ(copyItemTree(dir / "big", dir / "small/big"), ENOSPC);
    EXPECT_TRUE(fs::is_empty(small.path));
}

}  // namespace
}  // namespace tavrix::payload
