// Feeds arbitrary bytes to the payload extractor as an archive file, in the mode used for
// archives from the network and with small limits, into a fresh directory that is removed
// afterwards. Whatever the bytes, nothing may be written outside that directory, no symbolic link
// left in it may lead outside, and what it holds stays within the limits.
#include <sys/stat.h>

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <string>
#include <string_view>
#include <vector>

#include "FuzzSupport.h"
#include "TestSupport.h"
#include "payload/PayloadUnpack.h"
#include "util/FileSystemUtilities.h"

namespace {

namespace fs = std::filesystem;
using tavrix::fuzz::require;

// Small enough that bombs are cut quickly, large enough for every seed to extract.
constexpr tavrix::payload::ExtractionLimits kLimits{4u << 20, 200, 0, true};

struct Contents {
    std::uintmax_t bytes = 0;
    std::uintmax_t objects = 0;
};

// Counts what lies below destination and aborts on a symbolic link that resolves outside it.
Contents inspect(const fs::path& destination) {
    Contents contents;
    const fs::path inside = fs::canonical(destination);
    std::error_code error;
    for (fs::recursive_directory_iterator it(destination, error), end; !error && it != end;
         it.increment(error)) {
        ++contents.objects;
        struct stat info {};
        if (::lstat(it->path().c_str(), &info) != 0) {
            continue;
        }
        if (S_ISREG(info.st_mode)) {
            contents.bytes += static_cast<std::uintmax_t>(info.st_size);
        } else if (S_ISLNK(info.st_mode)) {
            std::error_code unresolved;
            fs::path target = fs::canonical(it->path(), unresolved);
            require(unresolved || *target.lexically_relative(inside).begin() != "..");
        }
    }
    return contents;
}

}  // namespace

// libarchive 3.6's cpio reader reserves a buffer as large as a header's declared name length (up
// to 4 GiB) before it knows the input is that long; only the input's own bytes are ever written
// to it. Such a reservation is the library's, not a fault of the extractor, so single allocations
// may be that large here; the limit on memory actually used still applies.
extern "C" int LLVMFuzzerInitialize(int* argc, char*** argv) {
    static std::vector<char*> arguments(*argv, *argv + *argc);
    static std::string mallocLimit = "-malloc_limit_mb=10240";
    for (char* argument : arguments) {
        if (std::string_view(argument).starts_with("-malloc_limit_mb=")) {
            return 0;
        }
    }
    arguments.push_back(mallocLimit.data());
    *argc = static_cast<int>(arguments.size());
    arguments.push_back(nullptr);
    *argv = arguments.data();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    tavrix::fuzz::silenceTheLog();
    // On a memory file system when there is one: the many small files go far faster there.
    static const tavrix::test::TempDir workDirectory(
        fs::is_directory("/dev/shm") ? fs::path("/dev/shm") : fs::temp_directory_path());
    const fs::path& work = workDirectory.path();
    const fs::path archivePath = work / "payload";
    // Two levels down, so that entries climbing out with ".." are seen in the levels above.
    const fs::path levels = work / "level";
    const fs::path destination = levels / "destination";
    // Something outside for links to find: one that resolves to it is caught below.
    const fs::path bait = work / "bait";
    static const bool baited = std::ofstream(bait).good();
    (void)baited;
    tavrix::test::writeText(archivePath, std::string(reinterpret_cast<const char*>(data), size));
    tavrix::payload::extractArchive(archivePath, destination,
                                    tavrix::payload::ExtractionSafety::PathSafe, kLimits);
    // Directories an entry left without search or write permission are opened up first, so
    // that all of it is counted and removed. (Path-safe extraction restores no file flags.)
    tavrix::makeDirectoriesWritable(destination);
    Contents contents = inspect(destination);
    require(contents.bytes <= kLimits.maxExpandedBytes && contents.objects <= kLimits.maxEntries);
    std::error_code error;
    fs::remove_all(destination, error);
    // Anything left besides the payload and the emptied level means an entry escaped.
    for (const auto& entry : fs::recursive_directory_iterator(work)) {
        require(entry.path() == archivePath || entry.path() == levels || entry.path() == bait);
    }
    return 0;
}
