// The system log: where every log line of the daemon goes.
// A line goes to stderr when stderr is the journal, a terminal, or TAVRIX_LOG_STDERR=1 is set;
// otherwise to syslog(3) with the ident "tavrixservicesd". Messages are written unchanged.
#pragma once

#include <syslog.h>

#include <mutex>
#include <string>
#include <string_view>
#include <vector>

namespace tavrix::platform {

class LogSink {
  public:
    virtual ~LogSink() = default;
    // Receives one message with its syslog priority; called from any thread.
    virtual void write(int priority, std::string_view message) = 0;
};

// Writes one message to the current sink.
void writeSystemLog(int priority, std::string_view message);

// Sends every message to the given sink while the guard lives (tests). Guards nest.
class ScopedLogSink {
  public:
    explicit ScopedLogSink(LogSink& sink);
    ~ScopedLogSink();
    ScopedLogSink(const ScopedLogSink&) = delete;
    ScopedLogSink& operator=(const ScopedLogSink&) = delete;

  private:
    LogSink* previous_;
};

// A sink that keeps every message, for tests that assert exact lines.
class CapturingLogSink : public LogSink {
  public:
    void write(int priority, std::string_view message) override;
    std::vector<std::string> messages() const;
    bool contains(std::string_view message) const;
    void clear();

  private:
    mutable std::mutex mutex_;
    std::vector<std::string> messages_;
};

}  // namespace tavrix::platform
