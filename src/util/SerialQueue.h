// A serial task queue: one named worker thread that runs tasks one at a time, in the order they
// were dispatched.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <thread>

namespace tavrix {

class SerialQueue {
  public:
    // Starts the worker thread. Its system name is the label cut to 15 characters (the kernel's
    // limit); log lines give the whole of it.
    explicit SerialQueue(std::string label);
    // Stops accepting tasks, runs those already queued and joins the worker. Called from a task
    // on this queue, it cannot wait for itself: the worker is then detached and finishes the
    // queue on its own.
    ~SerialQueue();
    SerialQueue(const SerialQueue&) = delete;
    SerialQueue& operator=(const SerialQueue&) = delete;

    // What the destructor does, ahead of it: refuses new tasks, lets the queued ones run and joins
    // the worker. Called from the queue's own task, detaches the worker instead.
    void shutdown();

    // Queues task and returns at once. False (and logged) once the queue is shutting down.
    bool dispatchAsync(std::function<void()> task);

    // Queues task and waits until it has run. On the queue's own thread the task runs at once,
    // since waiting for it there would never end. False (and logged) once the queue is shutting
    // down and the call comes from another thread.
    bool dispatchSync(std::function<void()> task);

    // True on the queue's worker thread.
    bool isCurrent() const;

  private:
    struct State;
    static void runWorker(const std::shared_ptr<State>& state);

    std::shared_ptr<State> state_;
    std::thread worker_;
};

}  // namespace tavrix
