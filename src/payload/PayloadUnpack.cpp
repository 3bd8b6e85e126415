#include "payload/PayloadUnpack.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "io/Paths.h"
#include "util/Log.h"

namespace tavrix {
namespace payload {
namespace {

// Only the daemon reads the staged payload.
constexpr mode_t kStagedFileMode = 0600;
// A device root made for tests or the demo may lack /tmp; it gets the usual one.
constexpr mode_t kTemporaryDirectoryMode = 01777;

Result<io::Directory> openStagingDirectory(const std::string& path) {
    int error = 0;
    auto directory = io::Directory::open(path, io::Directory::LastLink::Follow, &error);
    if (!directory && error == ENOENT && ::mkdir(path.c_str(), kTemporaryDirectoryMode) == 0) {
        ::chmod(path.c_str(), kTemporaryDirectoryMode);
        directory = io::Directory::open(path, io::Directory::LastLink::Follow, &error);
    }
    if (!directory) {
        return Failure{path + " cannot be opened: " + std::strerror(error)};
    }
    // In a directory where others may rename what the daemon writes, nothing written is safe.
    if (Result<> protectedDirectory = io::checkProtected(directory->status());
        !protectedDirectory) {
        return Failure{path + " is unsafe: " + protectedDirectory.reason()};
    }
    return std::move(*directory);
}

Result<StagedPayload> stageIn(io::Directory directory, const std::string& name,
                              const plist::Data& data) {
    if (auto existing = directory.entryStatus(name)) {
        if (existing->st_uid != ::geteuid()) {
            return Failure{"a file of user " + std::to_string(existing->st_uid) + " is in the way"};
        }
        if (int error = directory.removeEntry(name); error != 0 && error != ENOENT) {
            return Failure{std::string("the previous one cannot be removed: ") +
                           std::strerror(error)};
        }
    }
    const std::string_view bytes(reinterpret_cast<const char*>(data.data()), data.size());
    if (int error = directory.writeFile(name, kStagedFileMode, /*replace=*/false, bytes);
        error != 0) {
        return Failure{error == EEXIST ? std::string("something else appeared there")
                                       : std::string(std::strerror(error))};
    }
    int error = 0;
    io::UniqueFd file = directory.openOwnFile(name, &error);
    if (!file) {
        return Failure{std::string("it cannot be opened again: ") + std::strerror(error)};
    }
    return StagedPayload(std::move(directory), name, std::move(file));
}

}  // namespace

std::string extractionStagingPathFor(const std::string& bundleDirectory) {
    std::size_t slash = bundleDirectory.rfind('/');
    return bundleDirectory.substr(0, slash + 1) + "." + bundleDirectory.substr(slash + 1) +
           ".incoming";
}

StagedPayload::StagedPayload(io::Directory directory, std::string name, io::UniqueFd file)
    : directory_(std::move(directory)), name_(std::move(name)), file_(std::move(file)) {}

StagedPayload::~StagedPayload() {
    struct stat mine {};
    if (!file_ || ::fstat(file_.get(), &mine) != 0) {
        return;
    }
    auto there = directory_.entryStatus(name_);
    if (there && there->st_dev == mine.st_dev && there->st_ino == mine.st_ino) {
        directory_.removeEntry(name_);
    }
}

Result<StagedPayload> stagePayload(const plist::Data& data, const std::string& path) {
    Result<io::Directory> directory = openStagingDirectory(io::parentDirectory(path));
    Result<StagedPayload> staged =
        directory ? stageIn(std::move(*directory), io::lastPathComponent(path), data)
                  : Result<StagedPayload>(directory.failure());
    if (staged) {
        logCFormat("Successfully wrote the KW Data to file: %s\n", path.c_str());
        return staged;
    }
    logCFormat(LogPriority::Warning, "Failed to write the zipped file: %s\n", path.c_str());
    return Failure{"the payload could not be staged at " + path + ": " + staged.reason()};
}

}  // namespace payload
}  // namespace tavrix
