// A property-list file whose parsed value is kept until the file changes. Reading opens the file
// (following symbolic links, unless the owner gives an opener of its own), checks the identity
// and modification time of what it opened and parses only when they differ from the cached
// ones. Safe to use from several threads.
#pragma once

#include <sys/types.h>

#include <ctime>
#include <functional>
#include <memory>
#include <mutex>
#include <string>

#include "io/UniqueFd.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::plist {

class CachedPropertyListFile {
  public:
    enum class State { Missing, Damaged, Valid };

    struct Snapshot {
        State state = State::Missing;
        // The file's value when Valid, else null.
        std::shared_ptr<const Value> value;
        // True when this read parsed the file (the first read of a new version of it).
        bool freshlyRead = false;
        // Why the file is Damaged.
        Failure refusal;
    };

    // Opens the file for reading; an empty descriptor means there is none.
    using Opener = std::function<io::UniqueFd()>;

    explicit CachedPropertyListFile(std::string path, Opener opener = {});

    const std::string& path() const { return path_; }

    // The file's current value, parsed again only when the file changed since the last read.
    Snapshot read();

    // Forgets the cached value so that the next read parses the file.
    void invalidate();

  private:
    struct Identity {
        dev_t device = 0;
        ino_t inode = 0;
        off_t size = -1;
        timespec modified{};
        bool operator==(const Identity& other) const;
    };

    std::string path_;
    Opener opener_;
    std::mutex mutex_;
    bool cached_ = false;
    Identity identity_;
    State state_ = State::Missing;
    std::shared_ptr<const Value> value_;
    Failure refusal_;
};

}  // namespace tavrix::plist
