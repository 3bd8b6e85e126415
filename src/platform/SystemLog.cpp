#include "platform/SystemLog.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace tavrix::platform {
namespace {

constexpr const char* kIdent = "tavrixservicesd";

// JOURNAL_STREAM is "device:inode" of the stream the journal handed us; it only counts while
// stderr is still that stream.
bool stderrIsJournal() {
    const char* stream = std::getenv("JOURNAL_STREAM");
    if (stream == nullptr) {
        return false;
    }
    unsigned long long device = 0;
    unsigned long long inode = 0;
    if (std::sscanf(stream, "%llu:%llu", &device, &inode) != 2) {
        return false;
    }
    struct stat info {};
    return ::fstat(STDERR_FILENO, &info) == 0 && info.st_dev == device && info.st_ino == inode;
}

void writeAll(int fd, std::string_view bytes) {
    while (!bytes.empty()) {
        ssize_t put = ::write(fd, bytes.data(), bytes.size());
        if (put <= 0) {
            return;
        }
        bytes.remove_prefix(static_cast<std::size_t>(put));
    }
}

class StderrSink : public LogSink {
  public:
    explicit StderrSink(bool withPriorityPrefix) : withPriorityPrefix_(withPriorityPrefix) {}

    void write(int priority, std::string_view message) override {
        std::string line;
        if (withPriorityPrefix_) {
            // The journal takes "<N>" as the line's priority and strips it.
            line = "<" + std::to_string(LOG_PRI(priority)) + ">";
        }
        line += message;
        if (line.empty() || line.back() != '\n') {
            line += '\n';
        }
        writeAll(STDERR_FILENO, line);  // one write per line keeps lines whole across threads
    }

  private:
    bool withPriorityPrefix_;
};

class SyslogSink : public LogSink {
  public:
    SyslogSink() { ::openlog(kIdent, LOG_PID, LOG_DAEMON); }
    void write(int priority, std::string_view message) override {
        ::syslog(priority, "%.*s", static_cast<int>(message.size()), message.data());
    }
};

// Never destroyed: other threads may still log while the process exits.
LogSink& defaultSink() {
    static LogSink* sink = []() -> LogSink* {
        if (stderrIsJournal()) {
            return new StderrSink(true);
        }
        const char* forced = std::getenv("TAVRIX_LOG_STDERR");
        if ((forced != nullptr && std::strcmp(forced, "1") == 0) || ::isatty(STDERR_FILENO)) {
            return new StderrSink(false);
        }
        return new SyslogSink();
    }();
    return *sink;
}

std::atomic<LogSink*> overridingSink{nullptr};

}  // namespace

void writeSystemLog(int priority, std::string_view message) {
    LogSink* sink = overridingSink.load(std::memory_order_acquire);
    (sink != nullptr ? *sink : defaultSink()).write(priority, message);
}

ScopedLogSink::ScopedLogSink(LogSink& sink)
    : previous_(overridingSink.exchange(&sink, std::memory_order_acq_rel)) {}

ScopedLogSink::~ScopedLogSink() {
    overridingSink.store(previous_, std::memory_order_release);
}

void CapturingLogSink::write(int, std::string_view message) {
    std::lock_guard lock(mutex_);
    messages_.emplace_back(message);
}

std::vector<std::string> CapturingLogSink::messages() const {
    std::lock_guard lock(mutex_);
    return messages_;
}

bool CapturingLogSink::contains(std::string_view message) const {
    std::lock_guard lock(mutex_);
    return std::find(messages_.begin(), messages_.end(), message) != messages_.end();
}

void CapturingLogSink::clear() {
    std::lock_guard lock(mutex_);
    messages_.clear();
}

}  // namespace tavrix::platform
