#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cmath>
#include <map>

#include "TestSupport.h"
#include "util/FileSystemHelper.h"
#include "util/FileSystemUtilities.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::payload {
namespace {

namespace fs = std::filesystem;
using test::readText;
using test::TempDir;
using test::Tree;
using test::writeText;

using test::snapshotTree;

mode_t modeOf(const std::string& path) {
    struct stat info {};
    EXPECT_EQ(::lstat(path.c_str(), &info), 0) << path;
    return info.st_mode & 07777;
}

class FileSystemHelperTransfer : public testing::Test {
  protected:
    TempDir dir;
    FileSystemHelper helper;
    std::string source = dir / "payload";
    std::string destination = dir / "installed";

    // A source tree and a destination that already holds a directory of the source's name.
    void makeOverlappingTrees() {
        writeText(source + "/a.txt", "new a");
        writeText(source + "/sub/b.txt", "b");
        writeText(source + "/sub/deep/c.txt", "c");
        writeText(destination + "/payload/a.txt", "old a");
        writeText(destination + "/payload/keep.txt", "keep");
        writeText(destination + "/payload/sub/other.txt", "other");
    }

    const Tree mergedTree{{"a.txt", "new a"},        {"keep.txt", "keep"}, {"sub", "/"},
                          {"sub/b.txt", "b"},        {"sub/deep", "/"},    {"sub/deep/c.txt", "c"},
                          {"sub/other.txt", "other"}};
};

TEST_F(FileSystemHelperTransfer, MoveIntoExistingDirectoryMergesAndRemovesTheSource) {
    makeOverlappingTrees();
    EXPECT_EQ(helper.moveItem(source, destination), 0);
    EXPECT_EQ(snapshotTree(destination + "/payload"), mergedTree);
    EXPECT_FALSE(fs::exists(source));
}

TEST_F(FileSystemHelperTransfer, CopyIntoExistingDirectoryMergesAndKeepsTheSource) {
    makeOverlappingTrees();
    Tree before = snapshotTree(source);
    EXPECT_EQ(helper.copyItem(source, destination), 0);
    EXPECT_EQ(snapshotTree(destination + "/payload"), mergedTree);
    EXPECT_EQ(snapshotTree(source), before);
}

TEST_F(FileSystemHelperTransfer, CopyKeepsModesAndLinksAndPlacesTheSourceInsideADirectory) {
    writeText(source + "/script", "#!/bin/sh\n");
    ::chmod((source + "/script").c_str(), 0750);
    ::chmod(source.c_str(), 0705);
    fs::create_directory_symlink("../elsewhere", source + "/link");
    fs::create_directories(destination);
    EXPECT_EQ(helper.copyItem(source, destination + "/"), 0);
    EXPECT_EQ(snapshotTree(destination + "/payload"),
              (Tree{{"script", "#!/bin/sh\n"}, {"link", "-> ../elsewhere"}}));
    EXPECT_EQ(modeOf(destination + "/payload/script"), 0750u);
    EXPECT_EQ(modeOf(destination + "/payload"), 0705u);
}

TEST_F(FileSystemHelperTransfer, NonDirectoryInsideTheDestinationIsReplaced) {
    writeText(source + "/x", "x");
    writeText(destination + "/payload", "a file in the way");
    EXPECT_EQ(helper.moveItemWithOwner(source, destination, ::getuid(), ::getgid()), 0);
    EXPECT_EQ(snapshotTree(destination), (Tree{{"payload", "/"}, {"payload/x", "x"}}));
}

TEST_F(FileSystemHelperTransfer, DirectoryOntoRegularFileAnswers17AndChangesNothing) {
    writeText(source + "/x", "x");
    writeText(destination, "file");
    Tree before = snapshotTree(dir.path());
    EXPECT_EQ(helper.moveItem(source, destination), 17);
    EXPECT_EQ(helper.copyItem(source, destination), 17);
    EXPECT_EQ(snapshotTree(dir.path()), before);
}

TEST_F(FileSystemHelperTransfer, FileOntoRegularFileReplacesIt) {
    writeText(source, "new");
    writeText(destination, "old");
    EXPECT_EQ(helper.moveItem(source, destination), 0);
    EXPECT_EQ(readText(destination), "new");
    EXPECT_FALSE(fs::exists(source));
}

TEST_F(FileSystemHelperTransfer, MissingSourceAnswersMinusOne) {
    EXPECT_EQ(helper.copyItem(source, destination), -1);
    EXPECT_EQ(helper.moveItem(source, destination), -1);
    EXPECT_FALSE(fs::exists(destination));
}

TEST_F(FileSystemHelperTransfer, PlainTransferPassesErrnoThrough) {
    writeText(source, "s");
    EXPECT_EQ(helper.copyItem(source, dir / "missing/parent/x"), ENOENT);
    EXPECT_EQ(helper.moveItem(source, destination), 0);
    EXPECT_EQ(readText(destination), "s");
}

TEST_F(FileSystemHelperTransfer, CopyFileBetweenDirectoriesCreatesTheDestination) {
    writeText(source + "/name", "content");
    EXPECT_EQ(helper.copyFileBetweenDirectories(source, destination + "/deeper", "name"), 0);
    EXPECT_EQ(readText(destination + "/deeper/name"), "content");
    EXPECT_EQ(modeOf(destination + "/deeper"), 0755u);
    EXPECT_TRUE(fs::exists(source + "/name"));
    writeText(dir / "blocker", "");
    EXPECT_EQ(helper.copyFileBetweenDirectories(source, dir / "blocker/sub", "name"), -1);
}

TEST(FileSystemPrimitives, MoveAcrossFileSystemsCopiesAndRemoves) {
    TempDir local;
    struct stat here {
    }, shm{};
    if (::stat(local.path().c_str(), &here) != 0 || ::stat("/dev/shm", &shm) != 0 ||
        here.st_dev == shm.st_dev || ::access("/dev/shm", W_OK) != 0) {
        GTEST_SKIP() << "no second writable file system";
    }
    std::string target = "/dev/shm/tavrix-move-" + std::to_string(::getpid());
    writeText(local / "tree/f", "f");
    fs::create_symlink("f", local / "tree/l");
    ASSERT_EQ(moveItemTree(local / "tree", target), 0);
    EXPECT_EQ(snapshotTree(target), (Tree{{"f", "f"}, {"l", "-> f"}}));
    EXPECT_FALSE(fs::exists(local / "tree"));
    EXPECT_EQ(moveItemTree(target, target), EEXIST);
    fs::remove_all(target);
}

TEST(FileSystemPrimitives, CopyAndMoveRefuseAnExistingDestination) {
    TempDir dir;
    writeText(dir / "a", "a");
    writeText(dir / "b", "b");
    fs::create_symlink("nowhere", dir / "dangling");
    EXPECT_EQ(copyItemTree(dir / "a", dir / "b"), EEXIST);
    EXPECT_EQ(moveItemTree(dir / "a", dir / "b"), EEXIST);
    EXPECT_EQ(moveItemTree(dir / "a", dir / "dangling"), EEXIST);
    EXPECT_EQ(readText(dir / "b"), "b");
    EXPECT_EQ(readText(dir / "a"), "a");
}

TEST(FileSystemHelper, ListDirectoryReplacesTheListOrLeavesItOnFailure) {
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
}

TEST(FileSystemHelper, CreateDirectorySetsTheExactModeAndHonoursIntermediates) {
    TempDir dir;
    FileSystemHelper helper;
    EXPECT_EQ(helper.createDirectory(dir / "a/b", 0777, false), ENOENT);
    EXPECT_EQ(helper.createDirectory(dir / "a/b", 0777, true), 0);
    EXPECT_EQ(modeOf(dir / "a/b"), 0777u);
    EXPECT_EQ(modeOf(dir / "a"), 0777u & ~0022u);
    EXPECT_EQ(helper.createDirectory(dir / "a/b", 0700, true), 0);
    EXPECT_EQ(helper.createDirectory(dir / "a/b", 0700, false), EEXIST);
    writeText(dir / "file", "");
    EXPECT_NE(helper.createDirectory(dir / "file", 0755, true), 0);
}

TEST(FileSystemHelper, RemoveItemRemovesTreesAndLinksButNotLinkTargets) {
    TempDir dir;
    FileSystemHelper helper;
    writeText(dir / "tree/x/y", "");
    writeText(dir / "kept/z", "z");
    fs::create_directory_symlink(dir / "kept", dir / "tree/link");
    EXPECT_TRUE(helper.fileExists(dir / "tree/link/z"));
    EXPECT_EQ(helper.removeItem(dir / "tree"), 0);
    EXPECT_FALSE(helper.fileExists(dir / "tree"));
    EXPECT_EQ(readText(dir / "kept/z"), "z");
    EXPECT_EQ(helper.removeItem(dir / "tree"), ENOENT);
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
// file; a copy that fits keeps the source's mode.
TEST(FileSystemPrimitives, ACopyThatRunsOutOfSpaceLeavesNoFileBehind) {
    TempDir dir;
    const std::string small = dir / "small";
    fs::create_directory(small);
    if (::geteuid() != 0 || ::mount("tmpfs", small.c_str(), "tmpfs", 0, "size=1m") != 0) {
        GTEST_SKIP() << "cannot mount a small tmpfs (needs root)";
    }
    struct Unmount {
        std::string path;
        ~Unmount() { ::umount2(path.c_str(), MNT_DETACH); }
    } unmount{small};
    writeText(dir / "big", std::string(3 << 20, 'b'));
    writeText(dir / "fits", "fits");
    ASSERT_EQ(::chmod((dir / "fits").c_str(), 0604), 0);

    EXPECT_EQ(copyItemTree(dir / "big", small + "/big"), ENOSPC);
    EXPECT_TRUE(fs::is_empty(small));
    EXPECT_EQ(copyItemTree(dir / "fits", small + "/fits"), 0);
    EXPECT_EQ(readText(small + "/fits"), "fits");
    EXPECT_EQ(modeOf(small + "/fits"), 0604u);
    EXPECT_EQ(snapshotTree(small).size(), 1u);
}

TEST(FileSystemAttributes, PermissionsApplyToTheWholeTreeButNotThroughLinks) {
    TempDir dir;
    FileSystemHelper helper;
    writeText(dir / "tree/f", "");
    writeText(dir / "tree/sub/g", "");
    writeText(dir / "outside", "");
    ::chmod((dir / "outside").c_str(), 0600);
    fs::create_symlink(dir / "outside", dir / "tree/sub/link");
    EXPECT_EQ(helper.setPermissions(dir / "tree", 0750, true), 0);
    for (const char* path : {"tree", "tree/f", "tree/sub", "tree/sub/g"}) {
        EXPECT_EQ(modeOf(dir / path), 0750u) << path;
    }
    EXPECT_EQ(modeOf(dir / "outside"), 0600u);
    EXPECT_EQ(helper.setPermissions(dir / "tree/f", 0644, false), 0);
    EXPECT_EQ(modeOf(dir / "tree/f"), 0644u);
    EXPECT_EQ(helper.setOwner(dir / "tree", ::getuid(), ::getgid(), true), 0);
}

TEST(FileSystemAttributes, MissingPathAnswers5RecursivelyAndMinusOneOtherwise) {
    TempDir dir;
    FileSystemHelper helper;
    EXPECT_EQ(setAttributesRecursively(dir / "missing", Permissions{0755}), 5);
    EXPECT_EQ(helper.setOwner(dir / "missing", ::getuid(), ::getgid(), true), 5);
    EXPECT_EQ(helper.setPermissions(dir / "missing", 0755, false), -1);
}

TEST(FileSystemUtilities, MakeDirectoryPathCreatesOnlyPrefixesEndingInASlash) {
    TempDir dir;
    EXPECT_EQ(makeDirectoryPath(dir / "a/b/c", ::getuid(), ::getgid(), 0750), 0);
    EXPECT_TRUE(fs::is_directory(dir / "a/b"));
    EXPECT_EQ(modeOf(dir / "a/b"), 0750u);
    EXPECT_FALSE(fs::exists(dir / "a/b/c"));
    EXPECT_EQ(makeDirectoryPath(dir / "a/b/c/", ::getuid(), ::getgid(), 0750), 0);
    EXPECT_TRUE(fs::is_directory(dir / "a/b/c"));
    writeText(dir / "file", "");
    // "file/" cannot be examined, so it is made, which fails because the file is there.
    EXPECT_EQ(makeDirectoryPath(dir / "file/x/", ::getuid(), ::getgid(), 0750), EEXIST);
}

TEST(FileSystemUtilities, MakeDirectoryPathStopsSilentlyAfter1022Characters) {
    TempDir dir;
    std::string path = dir.path().string() + "/";
    std::string component(100, 'x');
    while (path.size() < 1000) {
        path += component.substr(0, std::min<std::size_t>(100, 1000 - path.size())) + "/";
    }
    std::string beyond = path + std::string(50, 'y') + "/";
    EXPECT_EQ(makeDirectoryPath(beyond, ::getuid(), ::getgid(), 0755), 0);
    EXPECT_TRUE(fs::is_directory(path));
    EXPECT_FALSE(fs::exists(beyond));
}

TEST(FileSystemUtilities, CompareNumbersNullsFirst) {
    plist::Value one(1), two(2.0), alsoOne(1.0), half(0.5), nan(std::nan(""));
    plist::Value huge(plist::Integer::fromUnsigned(UINT64_MAX)), text("1");
    EXPECT_EQ(compareNumbersNullsFirst(nullptr, nullptr), 0);
    EXPECT_EQ(compareNumbersNullsFirst(&one, &one), 0);
    EXPECT_EQ(compareNumbersNullsFirst(nullptr, &one), -1);
    EXPECT_EQ(compareNumbersNullsFirst(&one, nullptr), 1);
    EXPECT_EQ(compareNumbersNullsFirst(&one, &two), -1);
    EXPECT_EQ(compareNumbersNullsFirst(&two, &one), 1);
    EXPECT_EQ(compareNumbersNullsFirst(&one, &alsoOne), 0);
    EXPECT_EQ(compareNumbersNullsFirst(&half, &one), -1);
    EXPECT_EQ(compareNumbersNullsFirst(&huge, &one), 1);
    EXPECT_EQ(compareNumbersNullsFirst(&nan, &half), -1);
    EXPECT_EQ(compareNumbersNullsFirst(&text, &one), -1);
}

TEST(FileSystemUtilities, CopyProcessNameForPID) {
    // The kernel keeps the first 15 bytes of the executable's name.
    std::string ownName = std::string(program_invocation_short_name).substr(0, 15);
    EXPECT_EQ(copyProcessNameForPID(::getpid()), std::optional<std::string>(ownName));
    EXPECT_EQ(copyProcessNameForPID(INT_MAX), std::nullopt);
}

int allocations = 0;
void* countingAllocate(std::size_t size) {
    ++allocations;
    return std::malloc(size);
}
void* failingAllocate(std::size_t) {
    return nullptr;
}

TEST(FileSystemUtilities, CopyCStringFromStringUsesTheBufferOnlyWhenTheStringAndNulFit) {
    CStringAllocator allocator{countingAllocate, std::free};
    allocations = 0;
    char buffer[6];
    std::size_t length = sizeof buffer;
    EXPECT_EQ(copyCStringFromString(allocator, "hello", buffer, &length), buffer);
    EXPECT_STREQ(buffer, "hello");
    EXPECT_EQ(length, 5u);
    EXPECT_EQ(allocations, 0);

    length = sizeof buffer;
    char* copy = copyCStringFromString(allocator, "h\xc3\xa9llo", buffer, &length);
    ASSERT_NE(copy, buffer);
    EXPECT_STREQ(copy, "h\xc3\xa9llo");
    EXPECT_EQ(length, 6u);
    EXPECT_EQ(allocations, 1);
    allocator.deallocate(copy);

    copy = copyCStringFromString(CStringAllocator{}, "/var/mobile", nullptr, nullptr);
    EXPECT_STREQ(copy, "/var/mobile");
    std::free(copy);
}

TEST(FileSystemUtilities, CopyCStringFromStringWhenAllocationFails) {
    CStringAllocator failing{failingAllocate, std::free};
    char buffer[4] = "abc";
    std::size_t length = sizeof buffer;
    EXPECT_EQ(copyCStringFromString(failing, "too long", buffer, &length), buffer);
    EXPECT_EQ(buffer[0], '\0');
    EXPECT_EQ(length, 0u);
    length = 99;
    EXPECT_EQ(copyCStringFromString(failing, "x", nullptr, &length), nullptr);
    EXPECT_EQ(length, 0u);
}

TEST(FileSystemUtilities, LoadDictionaryAtPathAnswersDictionariesOnly) {
    TempDir dir;
    plist::Dictionary dictionary{{"key", plist::Value("value")}};
    ASSERT_TRUE(plist::writeFile(dir / "d.plist", dictionary));
    ASSERT_TRUE(plist::writeFile(dir / "a.plist", plist::Array{plist::Value(1)}));
    EXPECT_EQ(loadDictionaryAtPath(dir / "d.plist"), std::optional<plist::Value>(dictionary));
    EXPECT_EQ(loadDictionaryAtPath(dir / "a.plist"), std::nullopt);
    EXPECT_EQ(loadDictionaryAtPath(dir / "missing.plist"), std::nullopt);
}

}  // namespace
}  // namespace tavrix::payload
