// Where the one instance of a long-lived object lives. The daemon's root object owns a slot for
// each such type (SharedInstance<T> members, installed while it lives); T::sharedInstance() answers
// the instance in the installed slot, made there on first use, and the root destroys it, after
// joining every thread, when it ends. A process without a root (a tool) gets a slot of its own
// on first use, which lasts until the process exits.
#pragma once

#include <atomic>
#include <cstdlib>
#include <memory>
#include <mutex>
#include <utility>

namespace tavrix {

template <typename T>
class SharedInstance {
  public:
    // Installs this slot for T; the previous one (there is none in the daemon) comes back when it
    // goes.
    SharedInstance() : previous_(installed().exchange(this)) {}
    ~SharedInstance() {
        destroy();
        installed().store(previous_);
    }
    SharedInstance(const SharedInstance&) = delete;
    SharedInstance& operator=(const SharedInstance&) = delete;

    // The instance, made by make() the first time any thread asks.
    template <typename Make>
    T& instance(Make&& make) {
        std::call_once(made_, [&] { store(std::forward<Make>(make)()); });
        return *current_.load();
    }

    // The instance if it was made, else null: stopping must not make what never ran.
    T* ifMade() const { return current_.load(); }

    // Destroys the instance (its destructor joins its threads). Nothing may use it afterwards.
    void destroy() {
        current_.store(nullptr);
        owned_.reset();
    }

    // The slot T::sharedInstance() uses: the installed one, or the process's own.
    static SharedInstance& current() {
        if (SharedInstance* slot = installed().load()) {
            return *slot;
        }
        // Without a root: made once and never destroyed, as threads may use it until exit.
        static SharedInstance* own = new SharedInstance(Unlisted{});
        return *own;
    }

  private:
    struct Unlisted {};
    explicit SharedInstance(Unlisted) : previous_(nullptr) {}

    void store(std::unique_ptr<T> made) {
        owned_ = std::move(made);
        current_.store(owned_.get());
    }

    static std::atomic<SharedInstance*>& installed() {
        static std::atomic<SharedInstance*> slot{nullptr};
        return slot;
    }

    SharedInstance* previous_;
    std::once_flag made_;
    std::unique_ptr<T> owned_;
    std::atomic<T*> current_{nullptr};
};

}  // namespace tavrix
