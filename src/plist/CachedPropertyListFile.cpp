#include "plist/CachedPropertyListFile.h"

#include <fcntl.h>
#include <sys/stat.h>

#include "plist/PropertyListFormat.h"

namespace tavrix::plist {

bool CachedPropertyListFile::Identity::operator==(const Identity& other) const {
    return device == other.device && inode == other.inode && size == other.size &&
           modified.tv_sec == other.modified.tv_sec && modified.tv_nsec == other.modified.tv_nsec;
}

CachedPropertyListFile::CachedPropertyListFile(std::string path, Opener opener)
    : path_(std::move(path)), opener_(std::move(opener)) {
    if (!opener_) {
        opener_ = [this] {
            // Without O_NONBLOCK, opening a FIFO would wait for a writer for ever.
            return io::UniqueFd(
                ::open(path_.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
        };
    }
}

CachedPropertyListFile::Snapshot CachedPropertyListFile::read() {
    io::UniqueFd file = opener_();
    struct stat info {};
    Identity current;
    if (file && ::fstat(file.get(), &info) == 0) {
        current = {info.st_dev, info.st_ino, info.st_size, info.st_mtim};
    }
    std::lock_guard lock(mutex_);
    if (cached_ && current == identity_) {
        return {state_, value_, false, refusal_};
    }
    cached_ = true;
    identity_ = current;
    value_.reset();
    refusal_ = {};
    if (current.size < 0) {
        state_ = State::Missing;
        return {state_, nullptr, true, refusal_};
    }
    Result<Value> parsed = readOpenFile(file.get());
    state_ = parsed ? State::Valid : State::Damaged;
    if (parsed) {
        value_ = std::make_shared<const Value>(std::move(*parsed));
    } else {
        refusal_ = parsed.failure();
    }
    return {state_, value_, true, refusal_};
}

void CachedPropertyListFile::invalidate() {
    std::lock_guard lock(mutex_);
    cached_ = false;
    value_.reset();
}

}  // namespace tavrix::plist
