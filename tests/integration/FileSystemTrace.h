// The file-system calls of a process as `strace -f -y` recorded them, checked for the order that
// makes a write survive a power cut: a file is flushed before it is renamed into place (a tree
// renamed into place has every file and directory in it flushed), the directory it lands in is
// flushed after the rename before the thread changes anything else, links are made under a
// temporary name and renamed, and nothing is written under a final name.
#pragma once

#include <string>
#include <vector>

namespace tavrix::integration {

// What strace must record for checkDurability (its -e trace= list).
inline constexpr const char* kTracedFileSystemCalls =
    "trace=open,openat,creat,write,pwrite64,writev,pwritev,pwritev2,ftruncate,truncate,"
    "copy_file_range,sendfile,fsync,fdatasync,sync,syncfs,rename,renameat,renameat2,symlink,"
    "symlinkat,link,linkat,mkdir,mkdirat,unlink,unlinkat";

struct DurabilityReport {
    // One line per violation, naming its rule and quoting the call.
    std::vector<std::string> violations;
    // How much was checked.
    int renamesIntoPlace = 0;
    int linksReplaced = 0;
    int flushes = 0;
};

// The trace checked; temporary names start with temporaryPrefix.
DurabilityReport checkDurability(const std::string& trace, const std::string& temporaryPrefix);

}  // namespace tavrix::integration
