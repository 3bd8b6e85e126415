#include "payload/ArchiveEntryPolicy.h"

#include <cstdint>

#include "payload/ArchiveLibrary.h"

namespace tavrix::payload {
namespace {

// Calls visit(component) for every non-empty component of path other than ".".
template <typename Visit>
void forEachComponent(std::string_view path, Visit visit) {
    while (!path.empty()) {
        std::size_t slash = path.find('/');
        std::string_view component = path.substr(0, slash);
        if (!component.empty() && component != ".") {
            visit(component);
        }
        if (slash == std::string_view::npos) {
            break;
        }
        path.remove_prefix(slash + 1);
    }
}

}  // namespace

bool leavesDestination(std::string_view path) {
    if (!path.empty() && path.front() == '/') {
        return true;
    }
    bool climbs = false;
    forEachComponent(path, [&](std::string_view component) { climbs |= component == ".."; });
    return climbs;
}

bool linkTargetStaysInside(std::string_view linkPath, std::string_view target) {
    if (target.empty() || target.front() == '/') {
        return false;
    }
    std::int64_t depth = -1;  // the link's own name is no directory to climb out of
    forEachComponent(linkPath, [&](std::string_view) { ++depth; });
    std::int64_t climbs = 0;
    bool descended = false;
    bool climbsAfterName = false;
    forEachComponent(target, [&](std::string_view component) {
        if (component != "..") {
            descended = true;
        } else if (descended) {
            climbsAfterName = true;
        } else {
            ++climbs;
        }
    });
    return !climbsAfterName && climbs <= depth;
}

Result<> checkEntryIsSafe(archive_entry* entry) {
    const char* name = libarchive().archive_entry_pathname(entry);
    if (name == nullptr || name[0] == '\0') {
        return Failure{"it has no usable name"};
    }
    if (leavesDestination(name)) {
        return Failure{"its path leads outside the destination"};
    }
    if (libarchive().archive_entry_hardlink(entry) != nullptr) {
        return Failure{"hard links are not accepted"};
    }
    // The disk writer makes a symbolic link whenever a target is set, whatever the entry's type.
    const char* linkTarget = libarchive().archive_entry_symlink(entry);
    switch (libarchive().archive_entry_filetype(entry)) {
        case AE_IFREG:
        case AE_IFDIR:
            if (linkTarget != nullptr) {
                return Failure{"it is a file that carries a link target"};
            }
            return {};
        case AE_IFLNK:
            if (linkTarget == nullptr || !linkTargetStaysInside(name, linkTarget)) {
                return Failure{std::string("its link target ") +
                               (linkTarget ? linkTarget : "(none)") +
                               " leads outside the destination"};
            }
            return {};
        default:
            return Failure{"only regular files, directories and symbolic links are accepted"};
    }
}

}  // namespace tavrix::payload
