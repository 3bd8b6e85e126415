// The system log: where every log line of the daemon goes.
// When stderr is the journal, each message is one journal entry sent with sd_journal_sendv: its
// priority, SYSLOG_IDENTIFIER "tavrixservicesd" and the fields of the ScopedLogFields alive on the
// logging thread, so an operator can filter (journalctl -p warning, TAVRIX_BEHAVIOR_ID=...). On a
// terminal, or with TAVRIX_LOG_STDERR=1, lines go to stderr; otherwise to syslog(3). Messages are
// written unchanged.
#pragma once

#include <syslog.h>

#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace tavrix {

class LogSink {
  public:
    virtual ~LogSink() = default;
    // Receives one message with its syslog priority; called from any thread.
    virtual void write(int priority, std::string_view message) = 0;
};

// Writes one message to the current sink.
void writeSystemLog(int priority, std::string_view message);

// Adds a journal field (an upper-case name such as "TAVRIX_BEHAVIOR_ID") to every message this
// thread logs while the guard lives. Guards nest; an inner field of the same name wins.
class ScopedLogField {
  public:
    ScopedLogField(std::string name, std::string value);
    ~ScopedLogField();
    ScopedLogField(const ScopedLogField&) = delete;
    ScopedLogField& operator=(const ScopedLogField&) = delete;
};

// The "NAME=value" fields of one journal entry for a message logged on this thread.
std::vector<std::string> journalFields(int priority, std::string_view message);

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

}  // namespace tavrix
