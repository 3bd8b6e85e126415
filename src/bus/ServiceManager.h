// The service manager's side of the daemon: the count of open transactions, the keep-alive flag,
// the idle predicate, and status reports to systemd.
//
// The keep-alive flag is kept in "<runtime directory>/keep-alive" ("1" or "0"), the runtime
// directory being $RUNTIME_DIRECTORY or /run/tavrixservicesd under the platform root, so that it
// survives a restart of the daemon.
//
// The instance lock, "<runtime directory>/instance.lock", is held (flock) by one daemon process at
// a time for the rest of its life, draining included; only its holder touches bundles, staging or
// leftovers. The process's end releases it, whatever way it ends.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <mutex>
#include <string>

#include "base/Result.h"
#include "io/UniqueFd.h"
#include "io/WakeEvent.h"

namespace tavrix::bus {

class ServiceManager {
  public:
    // The process's service manager binding.
    static ServiceManager& shared();

    void openTransaction();
    void closeTransaction();
    int openTransactionCount() const { return openTransactions_.load(); }

    // The keep-alive flag (0 when never written), or why it cannot be read.
    Result<std::int64_t> readKeepAlive() const;
    // Writes the keep-alive flag atomically. False when it cannot be written.
    bool writeKeepAlive(std::int64_t value);

    // True when nothing keeps the daemon running: no open transaction and keep-alive clear.
    bool isIdle() const;

    // Marks activity (a call, a transaction begun or ended, the keep-alive flag written); idle
    // time counts from the last one.
    void noteActivity();
    std::chrono::steady_clock::time_point lastActivity() const;

    // Readable (an eventfd) whenever a transaction closed or the keep-alive flag was written since
    // the last wake was consumed, from whatever thread: the run loop watches it so that it
    // re-checks for idleness at once instead of at the end of its pass. -1 when it could not be
    // made (the loop then notices at the end of its pass).
    int wakeFd() const { return wake_.fd(); }
    void consumeWake() const { wake_.consume(); }

    // How long the daemon stays after becoming idle: $TAVRIX_IDLE_EXIT_SEC or 30 s.
    std::chrono::milliseconds idleGrace() const { return idleGrace_; }

    // Reports to systemd (no-ops when not started by it).
    void notifyReady(const std::string& status);
    void notifyStatus(const std::string& status);
    void notifyStopping();

    enum class InstanceLock { Held, HeldByAnother, Unusable };
    // Takes the instance lock without waiting; once Held, every later call answers Held.
    // Unusable (logged) when the lock file cannot be opened or is not a regular file of the
    // daemon's own user: that is never waited out. Main thread only.
    InstanceLock tryLockInstance();

  private:
    ServiceManager();
    void wake() const { wake_.raise(); }

    std::string runtimeDirectory_;
    std::string keepAlivePath_;
    std::chrono::milliseconds idleGrace_;
    std::atomic<int> openTransactions_{0};
    std::atomic<std::int64_t> lastActivityTicks_;
    mutable std::mutex keepAliveMutex_;
    io::WakeEvent wake_;
    io::UniqueFd instanceLockFd_;  // kept open, and so locked, until the process ends
    bool instanceLockHeld_ = false;
    bool instanceLockFailureLogged_ = false;
};

// One service-manager transaction, open while the object lives: work the process must finish
// before it may leave for idleness.
class ScopedServiceTransaction {
  public:
    ScopedServiceTransaction() { ServiceManager::shared().openTransaction(); }
    ~ScopedServiceTransaction() { ServiceManager::shared().closeTransaction(); }
    ScopedServiceTransaction(const ScopedServiceTransaction&) = delete;
    ScopedServiceTransaction& operator=(const ScopedServiceTransaction&) = delete;
};

}  // namespace tavrix::bus
