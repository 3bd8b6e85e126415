#include "util/SystemLog.h"

#include <sys/stat.h>
#include <sys/uio.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "io/FileIO.h"

namespace tavrix {
namespace {

constexpr const char* kIdent = "tavrixservicesd";

// The fields of the ScopedLogFields alive on this thread, innermost last.
thread_local std::vector<std::pair<std::string, std::string>> scopedFields;

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
        io::writeAll(STDERR_FILENO, line);  // one write per line keeps lines whole across threads
    }

  private:
    bool withPriorityPrefix_;
};

// One entry per message, whatever it contains: a line break inside a message cannot split it.
class JournalSink : public LogSink {
  public:
    void write(int priority, std::string_view message) override {
        std::vector<std::string> fields = journalFields(priority, message);
        std::vector<iovec> vectors;
        vectors.reserve(fields.size());
        for (std::string& field : fields) {
            vectors.push_back({field.data(), field.size()});
        }
        if (sd_journal_sendv(vectors.data(), static_cast<int>(vectors.size())) < 0) {
            fallback_.write(priority, message);  // the journal's socket is gone: keep the line
        }
    }

  private:
    StderrSink fallback_{true};
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
            return new JournalSink();
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

ScopedLogField::ScopedLogField(std::string name, std::string value) {
    scopedFields.emplace_back(std::move(name), std::move(value));
}

ScopedLogField::~ScopedLogField() {
    scopedFields.pop_back();
}

std::vector<std::string> journalFields(int priority, std::string_view message) {
    if (!message.empty() && message.back() == '\n') {
        message.remove_suffix(1);  // the journal ends every entry itself
    }
    std::vector<std::string> fields;
    fields.push_back("MESSAGE=" + std::string(message));
    fields.push_back("PRIORITY=" + std::to_string(LOG_PRI(priority)));
    fields.push_back(std::string("SYSLOG_IDENTIFIER=") + kIdent);
    for (auto field = scopedFields.rbegin(); field != scopedFields.rend(); ++field) {
        const std::string prefix = field->first + "=";
        bool shadowed = std::any_of(fields.begin() + 3, fields.end(), [&](const std::string& f) {
            return f.compare(0, prefix.size(), prefix) == 0;
        });
        if (!shadowed) {
            fields.push_back(prefix + field->second);
        }
    }
    return fields;
}

void writeSystemLog(int priority, std::string_view message) {
    LogSink* sink = overridingSink.load(std::memory_order_acquire);
    (sink != nullptr ? *sink : defaultSink()).write(priority, message);
}

ScopedLogSink::ScopedLogSink(LogSink& sink)
    : previous_(overridingSink.exchange(&sink, std::memory_order_acq_rel)) {}

ScopedLogSink::~ScopedLogSink() {
    overridingSink.store(previous_, std::memory_order_release);
}

}  // namespace tavrix
