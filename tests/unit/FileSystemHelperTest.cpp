#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cmath>
#include <cstdint>
#include <functional>
#include <sstream>
#include <tuple>

#include "TestSupport.h"
#include "plist/PropertyListFormat.h"
#include "util/FileSystemHelper.h"
#include "util/FileSystemUtilities.h"

namespace tavrix::payload {
namespace {

namespace fs = std::filesystem;
using test::readText;
using test::snapshotTree;
using test::TempDir;
using test::Tree;
using test::writeText;

mode_t modeOf(const std::string& path) {
    struct stat info {};
    EXPECT_EQ(::lstat(path.c_str(), &info), 0) << path;
    return info.st_mode & 07777;
}

// A tree as one line, sorted: "dir/", "file=content", "link->target".
std::string treeLine(const fs::path& root) {
    std::string line;
    for (const auto& [path, content] : snapshotTree(root)) {
        line += (line.empty() ? "" : " ") + path +
                (content == "/"               ? "/"
                 : content.starts_with("-> ") ? content.substr(1)
                                              : "=" + content);
    }
    return line;
}

// Makes the files (with their parents) and directories of a tree line.
void makeTree(const fs::path& root, const std::string& line) {
    std::istringstream entries(line);
    for (std::string entry; entries >> entry;) {
        auto equals = entry.find('=');
        if (equals == std::string::npos) {
            fs::create_directories(root / entry);
        } else {
            writeText((root / entry.substr(0, equals)).string(), entry.substr(equals + 1));
        }
    }
}

// Every transfer operation on "payload" (the source) and "installed" (the destination): the
// answer, and the whole directory afterwards.
TEST(FileSystemHelperTransfer, AnswersAndResultingTreesFollowWhatLiesAtBothEnds) {
    using Operation = std::function<int(FileSystemHelper&, const std::string&, const std::string&)>;
    const Operation copy = [](FileSystemHelper& h, auto& s, auto& d) { return h.copyItem(s, d); };
    const Operation move = [](FileSystemHelper& h, auto& s, auto& d) { return h.moveItem(s, d); };
    const std::string overlapping =
        "payload/a.txt=new payload/sub/b.txt=b payload/sub/deep/c.txt=c "
        "installed/payload/a.txt=old "
        "installed/payload/keep.txt=keep installed/payload/sub/other.txt=other";
    const std::string merged =
        "installed/ installed/payload/ installed/payload/a.txt=new installed/payload/keep.txt=keep "
        "installed/payload/sub/ installed/payload/sub/b.txt=b installed/payload/sub/deep/ "
        "installed/payload/sub/deep/c.txt=c installed/payload/sub/other.txt=other";
    const std::vector<std::tuple<const char*, std::string, Operation, int, std::string>> cases{
        // Moved entry by entry: emptied directories below the source stay, and so does it.
        {"move merges into the directory of the source's name", overlapping, move, 0,
         merged + " payload/ payload/sub/"},
        {"copy merges and keeps the source", overlapping, copy, 0,
         merged + " payload/ payload/a.txt=new payload/sub/ payload/sub/b.txt=b "
                  "payload/sub/deep/ payload/sub/deep/c.txt=c"},
        {"a file where the source's directory belongs is replaced",
         "payload/x=x installed/payload=file",
         [](FileSystemHelper& h, auto& s, auto& d) {
             return h.moveItemWithOwner(s, d, ::getuid(), ::getgid());
         },
         0, "installed/ installed/payload/ installed/payload/x=x"},
        {"a directory onto a file", "installed=file payload/ payload/x=x", copy, 17,
         "installed=file payload/ payload/x=x"},
        {"missing source", "", move, -1, ""},
        {"plain copy passes errno through", "payload=s",
         [](FileSystemHelper& h, auto& s, auto& d) { return h.copyItem(s, d + "/no/parent"); },
         ENOENT, "payload=s"},
        {"copy between directories creates the destination", "payload/name=n",
         [](FileSystemHelper& h, auto& s, auto& d) {
             return h.copyFileBetweenDirectories(s, d + "/deeper", "name");
         },
         0, "installed/ installed/deeper/ installed/deeper/name=n payload/ payload/name=n"},
        {"copy between directories below a file", "payload/name=n installed=file",
         [](FileSystemHelper& h, auto& s, auto& d) {
             return h.copyFileBetweenDirectories(s, d + "/sub", "name");
         },
         -1, "installed=file payload/ payload/name=n"},
    };
    for (const auto& [name, before, operation, answer, after] : cases) {
        SCOPED_TRACE(name);
        TempDir dir;
        makeTree(dir.path(), before);
        FileSystemHelper helper;
        EXPECT_EQ(operation(helper, dir / "payload", dir / "installed"), answer);
        EXPECT_EQ(treeLine(dir.path()), after);
    }
}

// The primitives keep modes and links, never replace, and across file systems a move copies and
// removes.
TEST(FileSystemPrimitives, CopyKeepsModesAndLinksAndNeitherReplacesAndMoveCrossesFileSystems) {
    TempDir dir;
    writeText(dir / "tree/script", "#!/bin/sh\n");
    ::chmod((dir / "tree/script").c_str(), 0750);
    ::chmod((dir / "tree").c_str(), 0705);
    fs::create_symlink("script", dir / "tree/l");
    EXPECT_EQ(copyItemTree(dir / "tree", dir / "copy"), 0);
    EXPECT_EQ(snapshotTree(dir / "copy"), (Tree{{"script", "#!/bin/sh\n"}, {"l", "-> script"}}));
    EXPECT_EQ(modeOf(dir / "copy/script"), 0750u);
    EXPECT_EQ(modeOf(dir / "copy"), 0705u);

    writeText(dir / "a", "a");
    writeText(dir / "b", "b");
    fs::create_symlink("nowhere", dir / "dangling");
    EXPECT_EQ(copyItemTree(dir / "a", dir / "b"), EEXIST);
    EXPECT_EQ(moveItemTree(dir / "a", dir / "b"), EEXIST);
    EXPECT_EQ(moveItemTree(dir / "a", dir / "dangling"), EEXIST);
    EXPECT_EQ(readText(dir / "b"), "b");
    EXPECT_EQ(readText(dir / "a"), "a");

    struct stat here {
    }, shm{};
    if (::stat(dir.path().c_str(), &here) != 0 || ::stat("/dev/shm", &shm) != 0 ||
        here.st_dev == shm.st_dev || ::access("/dev/shm", W_OK) != 0) {
        GTEST_SKIP() << "no second writable file system";
    }
    std::string target = "/dev/shm/tavrix-move-" + std::to_string(::getpid());
    ASSERT_EQ(moveItemTree(dir / "tree", target), 0);
    EXPECT_EQ(snapshotTree(target), snapshotTree(dir / "copy"));
    EXPECT_FALSE(fs::exists(dir / "tree"));
    fs::remove_all(target);
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
    EXPECT_EQ(helper.removeItem(dir / "d"), 0);
    EXPECT_FALSE(helper.fileExists(dir / "d"));
    EXPECT_TRUE(fs::is_directory(dir / "a/b"));
    EXPECT_EQ(helper.removeItem(dir / "d"), ENOENT);
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

// Attributes reach the whole tree but not through links; a missing path answers 5 recursively
// and -1 otherwise.
TEST(FileSystemAttributes, RecursiveAttributesStayInsideTheTree) {
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

    EXPECT_EQ(setAttributesRecursively(dir / "missing", Permissions{0755}), 5);
    EXPECT_EQ(helper.setOwner(dir / "missing", ::getuid(), ::getgid(), true), 5);
    EXPECT_EQ(helper.setPermissions(dir / "missing", 0755, false), -1);
}

// Only prefixes that end in a slash are made, and nothing past 1022 characters.
TEST(FileSystemUtilities, MakeDirectoryPath) {
    TempDir dir;
    EXPECT_EQ(makeDirectoryPath(dir / "a/b/c", ::getuid(), ::getgid(), 0750), 0);
    EXPECT_EQ(modeOf(dir / "a/b"), 0750u);
    EXPECT_FALSE(fs::exists(dir / "a/b/c"));
    EXPECT_EQ(makeDirectoryPath(dir / "a/b/c/", ::getuid(), ::getgid(), 0750), 0);
    EXPECT_TRUE(fs::is_directory(dir / "a/b/c"));
    writeText(dir / "file", "");
    // "file/" cannot be examined, so it is made, which fails because the file is there.
    EXPECT_EQ(makeDirectoryPath(dir / "file/x/", ::getuid(), ::getgid(), 0750), EEXIST);

    std::string path = dir.path().string() + "/";
    while (path.size() < 1000) {
        path += std::string(std::min<std::size_t>(100, 1000 - path.size()), 'x') + "/";
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
    EXPECT_EQ(compareNumbersNullsFirst(&one, &alsoOne), 0);
    EXPECT_EQ(compareNumbersNullsFirst(&half, &one), -1);
    EXPECT_EQ(compareNumbersNullsFirst(&huge, &one), 1);
    EXPECT_EQ(compareNumbersNullsFirst(&nan, &half), -1);
    EXPECT_EQ(compareNumbersNullsFirst(&text, &one), -1);
    // Exact at the edges of both integer widths, with the real's fraction deciding a tie.
    const std::int64_t twoTo53 = std::int64_t{1} << 53;
    for (auto [integer, real, expected] :
         {std::tuple{plist::Integer::fromUnsigned(UINT64_MAX), 0x1p64, -1},
          std::tuple{plist::Integer::fromUnsigned(std::uint64_t{1} << 63), 0x1p63, 0},
          std::tuple{plist::Integer::fromUnsigned(std::uint64_t{1} << 63), -1.0, 1},
          std::tuple{plist::Integer(INT64_MAX), 0x1p63, -1},
          std::tuple{plist::Integer(INT64_MIN), -0x1p63, 0},
          std::tuple{plist::Integer(twoTo53 + 1), 0x1p53, 1},
          std::tuple{plist::Integer(-1), -0.5, -1}, std::tuple{plist::Integer(0), -0.5, 1},
          std::tuple{plist::Integer(2), 2.25, -1}}) {
        plist::Value a(integer), b(real);
        EXPECT_EQ(compareNumbersNullsFirst(&a, &b), expected) << a.description() << " " << real;
        EXPECT_EQ(compareNumbersNullsFirst(&b, &a), -expected) << a.description() << " " << real;
    }
}

TEST(FileSystemUtilities, ProcessNamesAndDictionaryFiles) {
    // The kernel keeps the first 15 bytes of the executable's name.
    std::string ownName = std::string(program_invocation_short_name).substr(0, 15);
    EXPECT_EQ(copyProcessNameForPID(::getpid()), std::optional<std::string>(ownName));
    EXPECT_EQ(copyProcessNameForPID(INT_MAX), std::nullopt);

    TempDir dir;
    plist::Dictionary dictionary{{"key", plist::Value("value")}};
    ASSERT_TRUE(plist::writeFile(dir / "d.plist", dictionary));
    ASSERT_TRUE(plist::writeFile(dir / "a.plist", plist::Array{plist::Value(1)}));
    EXPECT_EQ(loadDictionaryAtPath(dir / "d.plist"), std::optional<plist::Value>(dictionary));
    EXPECT_EQ(loadDictionaryAtPath(dir / "a.plist"), std::nullopt);
    EXPECT_EQ(loadDictionaryAtPath(dir / "missing.plist"), std::nullopt);
}

int allocations = 0;
void* countingAllocate(std::size_t size) {
    ++allocations;
    return std::malloc(size);
}
void* failingAllocate(std::size_t) {
    return nullptr;
}

// The caller's buffer is used only when the string and its NUL fit; a failed allocation answers
// the buffer emptied, or nothing, with length 0.
TEST(FileSystemUtilities, CopyCStringFromString) {
    allocations = 0;
    CStringAllocator allocator{countingAllocate, std::free};
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

    CStringAllocator failing{failingAllocate, std::free};
    length = 4;
    EXPECT_EQ(copyCStringFromString(failing, "too long", buffer, &length), buffer);
    EXPECT_EQ(buffer[0], '\0');
    EXPECT_EQ(length, 0u);
    length = 99;
    EXPECT_EQ(copyCStringFromString(failing, "x", nullptr, &length), nullptr);
    EXPECT_EQ(length, 0u);
}

}  // namespace
}  // namespace tavrix::payload
