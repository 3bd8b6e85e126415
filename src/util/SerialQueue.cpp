#include "util/SerialQueue.h"

#include <pthread.h>

#include <condition_variable>
#include <deque>
#include <mutex>

#include "util/ContainExceptions.h"
#include "util/Log.h"

namespace tavrix {

// Shared with the worker, so that a worker detached by its own queue's destructor keeps what
// it still needs.
struct SerialQueue::State {
    explicit State(std::string queueLabel)
        : label(std::move(queueLabel)), taskDescription("Task on queue " + label) {}

    const std::string label;
    // Made up front, so that reporting a failed task never needs memory.
    const std::string taskDescription;
    std::mutex mutex;
    std::condition_variable wake;
    std::deque<std::function<void()>> tasks;
    bool stopping = false;
    std::thread::id workerId;
};

namespace {

// The kernel keeps 15 characters of a thread's name plus the terminating NUL.
constexpr std::size_t kMaxThreadNameLength = 15;

// A throwing task is reported and dropped; the queue goes on with the next one.
void runGuarded(const std::string& taskDescription, const std::function<void()>& task) {
    containExceptions(taskDescription.c_str(), task);
}

}  // namespace

void SerialQueue::runWorker(const std::shared_ptr<State>& state) {
    std::string name = state->label.substr(0, kMaxThreadNameLength);
    ::pthread_setname_np(::pthread_self(), name.c_str());
    for (;;) {
        std::function<void()> task;
        {
            std::unique_lock lock(state->mutex);
            state->wake.wait(lock, [&] { return state->stopping || !state->tasks.empty(); });
            if (state->tasks.empty()) {
                // Stopping, and everything queued has run.
                return;
            }
            task = std::move(state->tasks.front());
            state->tasks.pop_front();
        }
        runGuarded(state->taskDescription, task);
    }
}

SerialQueue::SerialQueue(std::string label) : state_(std::make_shared<State>(std::move(label))) {
    // The worker's id is set under the lock before any task can run, so isCurrent() is right
    // from the first task on.
    std::lock_guard lock(state_->mutex);
    worker_ = std::thread([state = state_] { runWorker(state); });
    state_->workerId = worker_.get_id();
}

SerialQueue::~SerialQueue() {
    shutdown();
}

void SerialQueue::shutdown() {
    std::unique_lock lock(state_->mutex);
    state_->stopping = true;
    state_->wake.notify_all();
    if (!worker_.joinable()) {
        return;
    }
    if (state_->workerId == std::this_thread::get_id()) {
        worker_.detach();
        return;
    }
    lock.unlock();
    worker_.join();
}

bool SerialQueue::isCurrent() const {
    std::lock_guard lock(state_->mutex);
    return state_->workerId == std::this_thread::get_id();
}

bool SerialQueue::dispatchAsync(std::function<void()> task) {
    {
        std::lock_guard lock(state_->mutex);
        if (!state_->stopping) {
            state_->tasks.push_back(std::move(task));
            state_->wake.notify_one();
            return true;
        }
    }
    logCFormat("Queue %s is shutting down; dropping a task", state_->label.c_str());
    return false;
}

bool SerialQueue::dispatchSync(std::function<void()> task) {
    if (isCurrent()) {
        runGuarded(state_->taskDescription, task);
        return true;
    }
    // Shared with the queued task, so that neither side outlives what it touches.
    struct Completion {
        std::mutex mutex;
        std::condition_variable changed;
        bool done = false;
    };
    auto completion = std::make_shared<Completion>();
    bool queued = dispatchAsync([&task, completion] {
        // Signalled even when the task throws (the worker reports that), so the caller never
        // waits forever.
        struct Signal {
            Completion& completion;
            ~Signal() {
                std::lock_guard lock(completion.mutex);
                completion.done = true;
                completion.changed.notify_all();
            }
        } signal{*completion};
        task();
    });
    if (queued) {
        std::unique_lock lock(completion->mutex);
        completion->changed.wait(lock, [&] { return completion->done; });
    }
    return queued;
}

}  // namespace tavrix
