#include "FileSystemTrace.h"

#include <map>
#include <set>
#include <sstream>
#include <string_view>

namespace tavrix::integration {
namespace {

struct Call {
    std::string thread;
    std::string name;
    std::vector<std::string> arguments;
    std::string result;
    std::string line;
};

// The arguments of a call, split at the commas outside strings, brackets and fd decorations.
std::vector<std::string> splitArguments(std::string_view text) {
    std::vector<std::string> arguments;
    std::string current;
    int depth = 0;
    bool inString = false;
    bool inDecoration = false;
    for (std::size_t i = 0; i < text.size(); ++i) {
        const char c = text[i];
        if (inString) {
            current += c;
            if (c == '\\' && i + 1 < text.size()) {
                current += text[++i];
            } else if (c == '"') {
                inString = false;
            }
            continue;
        }
        if (inDecoration) {
            current += c;
            inDecoration = c != '>';
            continue;
        }
        if (c == '"') {
            inString = true;
        } else if (c == '<') {
            inDecoration = true;
        } else if (c == '(' || c == '[' || c == '{') {
            ++depth;
        } else if (c == ')' || c == ']' || c == '}') {
            --depth;
        } else if (c == ',' && depth == 0) {
            arguments.push_back(current);
            current.clear();
            continue;
        } else if (c == ' ' && current.empty()) {
            continue;
        }
        current += c;
    }
    if (!current.empty()) {
        arguments.push_back(current);
    }
    return arguments;
}

// The calls of the trace in the order they completed; a call another thread interrupted is
// joined with its resumption.
std::vector<Call> parseTrace(const std::string& trace) {
    std::vector<Call> calls;
    std::map<std::string, std::string> unfinished;
    std::istringstream in(trace);
    for (std::string line; std::getline(in, line);) {
        const std::size_t space = line.find(' ');
        if (space == std::string::npos) {
            continue;
        }
        const std::string thread = line.substr(0, space);
        std::string text = line.substr(line.find_first_not_of(' ', space));
        constexpr std::string_view kUnfinished = " <unfinished ...>";
        if (text.ends_with(kUnfinished)) {
            unfinished[thread] = text.substr(0, text.size() - kUnfinished.size());
            continue;
        }
        if (text.starts_with("<... ")) {
            const std::size_t resumed = text.find(" resumed>");
            if (resumed == std::string::npos) {
                continue;
            }
            text = unfinished[thread] + text.substr(resumed + 9);
            unfinished.erase(thread);
        }
        // A resumed call pads its result: ")     = 0".
        if (const std::size_t close = text.rfind(')'); close != std::string::npos) {
            const std::size_t equals = text.find_first_not_of(' ', close + 1);
            if (equals != std::string::npos && text.compare(equals, 2, "= ") == 0) {
                text.replace(close + 1, equals - close - 1, " ");
            }
        }
        const std::size_t open = text.find('(');
        const std::size_t equals = text.rfind(") = ");
        if (open == std::string::npos || equals == std::string::npos || equals < open) {
            continue;
        }
        Call call{thread, text.substr(0, open),
                  splitArguments(std::string_view(text).substr(open + 1, equals - open - 1)),
                  text.substr(equals + 4), line};
        if (!call.result.starts_with("-1") && !call.result.starts_with("?")) {
            calls.push_back(std::move(call));
        }
    }
    return calls;
}

// "5</a/b>" to "/a/b"; "" when the argument carries no path.
std::string decoratedPath(const std::string& argument) {
    const std::size_t open = argument.find('<');
    if (open == std::string::npos || argument.back() != '>') {
        return {};
    }
    std::string path = argument.substr(open + 1, argument.size() - open - 2);
    return path.starts_with("/") ? path : std::string();
}

std::string quotedText(const std::string& argument) {
    std::string text;
    for (std::size_t i = 1; i + 1 < argument.size(); ++i) {
        if (argument[i] == '\\' && i + 2 < argument.size()) {
            ++i;
        }
        text += argument[i];
    }
    return text;
}

std::string joinPath(const std::string& directory, const std::string& name) {
    return name.starts_with("/") ? name : directory + "/" + name;
}

std::string parentOf(const std::string& path) {
    return path.substr(0, path.rfind('/'));
}

std::string lastComponentOf(const std::string& path) {
    return path.substr(path.rfind('/') + 1);
}

bool isUnder(const std::string& path, const std::string& directory) {
    return path.size() > directory.size() && path.starts_with(directory) &&
           path[directory.size()] == '/';
}

// A path the call names through a directory descriptor and a name (dirfd at index).
std::string pathAt(const Call& call, std::size_t index) {
    if (index + 1 >= call.arguments.size()) {
        return {};
    }
    return joinPath(decoratedPath(call.arguments[index]), quotedText(call.arguments[index + 1]));
}

class Checker {
  public:
    explicit Checker(std::string temporaryPrefix) : temporaryPrefix_(std::move(temporaryPrefix)) {}

    void check(const Call& call) {
        const std::string& name = call.name;
        if (name == "open" || name == "creat") {
            opened(call, decoratedPath(call.result),
                   name == "creat" ? "O_WRONLY|O_CREAT|O_TRUNC" : argument(call, 1));
        } else if (name == "openat") {
            opened(call, decoratedPath(call.result), argument(call, 2));
        } else if (name == "write" || name == "pwrite64" || name == "writev" || name == "pwritev" ||
                   name == "pwritev2" || name == "ftruncate" || name == "sendfile") {
            // The daemon's own output (the log) is no file it keeps.
            if (argument(call, 0).starts_with("1<") || argument(call, 0).starts_with("2<")) {
                return;
            }
            written(call, decoratedPath(argument(call, 0)));
        } else if (name == "truncate") {
            written(call, quotedText(argument(call, 0)));
        } else if (name == "copy_file_range") {
            written(call, decoratedPath(argument(call, 2)));
        } else if (name == "fsync" || name == "fdatasync") {
            flushed(call, decoratedPath(argument(call, 0)));
        } else if (name == "sync" || name == "syncfs") {
            dirtyFiles_.clear();
            dirtyDirectories_.clear();
            ++report_.flushes;
        } else if (name == "rename") {
            renamed(call, quotedText(argument(call, 0)), quotedText(argument(call, 1)));
        } else if (name == "renameat" || name == "renameat2") {
            renamed(call, pathAt(call, 0), pathAt(call, 2));
        } else if (name == "symlink") {
            linked(call, quotedText(argument(call, 1)));
        } else if (name == "symlinkat") {
            linked(call, pathAt(call, 1));
        } else if (name == "link") {
            changedEntry(call, quotedText(argument(call, 1)));
        } else if (name == "linkat") {
            changedEntry(call, pathAt(call, 2));
        } else if (name == "mkdir") {
            changedEntry(call, quotedText(argument(call, 0)));
        } else if (name == "mkdirat") {
            changedEntry(call, pathAt(call, 0));
        } else if (name == "unlink") {
            removed(call, quotedText(argument(call, 0)));
        } else if (name == "unlinkat") {
            removed(call, pathAt(call, 0));
        }
    }

    DurabilityReport finish() {
        for (const auto& [thread, pending] : awaitingDirectoryFlush_) {
            violation("directory not flushed after a rename into it", pending.line);
        }
        for (const InPlaceWrite& write : inPlaceWrites_) {
            if (!write.staged) {
                violation("written in place under its final name", write.line);
            }
        }
        return report_;
    }

  private:
    struct Pending {
        std::string directory;
        std::string line;
    };
    struct InPlaceWrite {
        std::string path;  // where the file is now
        std::string line;
        bool staged = false;  // renamed since, itself or with a tree
    };

    static std::string argument(const Call& call, std::size_t index) {
        return index < call.arguments.size() ? call.arguments[index] : std::string();
    }

    bool isTemporary(const std::string& path) const {
        return lastComponentOf(path).starts_with(temporaryPrefix_);
    }

    void violation(const std::string& rule, const std::string& line) {
        report_.violations.push_back(rule + ": " + line);
    }

    // A thread that renamed into a directory must flush it before it changes anything else.
    void beforeEntryChange(const Call& call) {
        auto pending = awaitingDirectoryFlush_.find(call.thread);
        if (pending != awaitingDirectoryFlush_.end()) {
            violation("directory not flushed after a rename into it", pending->second.line);
            awaitingDirectoryFlush_.erase(pending);
        }
    }

    void opened(const Call& call, const std::string& path, const std::string& flags) {
        if (path.empty() || path.starts_with("/dev/") || path.starts_with("/proc/")) {
            return;
        }
        const bool writing = flags.find("O_WRONLY") != std::string::npos ||
                             flags.find("O_RDWR") != std::string::npos;
        if (flags.find("O_CREAT") != std::string::npos) {
            dirtyDirectories_.insert(parentOf(path));
        }
        if (writing && flags.find("O_TRUNC") != std::string::npos) {
            written(call, path);
        }
    }

    void written(const Call& call, const std::string& path) {
        if (path.empty() || path.starts_with("/dev/") || path.starts_with("/proc/")) {
            return;
        }
        dirtyFiles_.insert(path);
        if (!isTemporary(path)) {
            inPlaceWrites_.push_back({path, call.line});
        }
    }

    void flushed(const Call& call, const std::string& path) {
        ++report_.flushes;
        dirtyFiles_.erase(path);
        dirtyDirectories_.erase(path);
        auto pending = awaitingDirectoryFlush_.find(call.thread);
        if (pending != awaitingDirectoryFlush_.end() && pending->second.directory == path) {
            awaitingDirectoryFlush_.erase(pending);
        }
    }

    void changedEntry(const Call& call, const std::string& path) {
        beforeEntryChange(call);
        dirtyDirectories_.insert(parentOf(path));
    }

    // A file written and removed again was scratch (a download before its extraction).
    void removed(const Call& call, const std::string& path) {
        changedEntry(call, path);
        dirtyFiles_.erase(path);
        for (InPlaceWrite& write : inPlaceWrites_) {
            write.staged = write.staged || write.path == path;
        }
    }

    void linked(const Call& call, const std::string& path) {
        changedEntry(call, path);
        if (!isTemporary(path)) {
            violation("link made under its final name, not renamed into place", call.line);
        }
        temporaryLinks_.insert(path);
    }

    void renamed(const Call& call, const std::string& from, const std::string& to) {
        beforeEntryChange(call);
        if (!isTemporary(to)) {
            ++report_.renamesIntoPlace;
            report_.linksReplaced += temporaryLinks_.erase(from) > 0 ? 1 : 0;
            for (const std::string& file : dirtyFiles_) {
                if (file == from || isUnder(file, from)) {
                    violation("renamed into place before " + file + " was flushed", call.line);
                }
            }
            for (const std::string& directory : dirtyDirectories_) {
                if (directory == from || isUnder(directory, from)) {
                    violation(
                        "renamed into place before the directory " + directory + " was flushed",
                        call.line);
                }
            }
            awaitingDirectoryFlush_[call.thread] = {parentOf(to), call.line};
        }
        for (InPlaceWrite& write : inPlaceWrites_) {
            if (write.path == from || isUnder(write.path, from)) {
                write.staged = true;
                write.path = to + write.path.substr(from.size());
            }
        }
        moveUnder(dirtyFiles_, from, to);
        moveUnder(dirtyDirectories_, from, to);
        dirtyDirectories_.insert(parentOf(from));
        dirtyDirectories_.insert(parentOf(to));
    }

    static void moveUnder(std::set<std::string>& paths, const std::string& from,
                          const std::string& to) {
        std::set<std::string> moved;
        for (auto it = paths.begin(); it != paths.end();) {
            if (*it == from || isUnder(*it, from)) {
                moved.insert(to + it->substr(from.size()));
                it = paths.erase(it);
            } else {
                ++it;
            }
        }
        paths.insert(moved.begin(), moved.end());
    }

    std::string temporaryPrefix_;
    std::set<std::string> dirtyFiles_;
    std::set<std::string> temporaryLinks_;
    std::set<std::string> dirtyDirectories_;
    std::map<std::string, Pending> awaitingDirectoryFlush_;
    std::vector<InPlaceWrite> inPlaceWrites_;
    DurabilityReport report_;
};

}  // namespace

DurabilityReport checkDurability(const std::string& trace, const std::string& temporaryPrefix) {
    Checker checker(temporaryPrefix);
    for (const Call& call : parseTrace(trace)) {
        checker.check(call);
    }
    return checker.finish();
}

}  // namespace tavrix::integration
