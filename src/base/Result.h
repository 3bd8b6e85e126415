// The one way an operation that can fail says so: a Result<T> holds the value, or the Failure
// with its reason, a sentence fit for a log line or a client's error. Result<> is an operation
// with nothing to answer. Results cannot be dropped unread.
#pragma once

#include <string>
#include <utility>
#include <variant>

namespace tavrix {

struct Failure {
    std::string reason;
};

template <typename T = void>
class [[nodiscard]] Result {
  public:
    Result(T value) : state_(std::in_place_index<0>, std::move(value)) {}
    Result(Failure failure) : state_(std::in_place_index<1>, std::move(failure)) {}

    bool ok() const { return state_.index() == 0; }
    explicit operator bool() const { return ok(); }

    // Only when ok().
    T& operator*() { return std::get<0>(state_); }
    const T& operator*() const { return std::get<0>(state_); }
    T* operator->() { return &std::get<0>(state_); }
    const T* operator->() const { return &std::get<0>(state_); }

    // Only when !ok().
    const std::string& reason() const { return std::get<1>(state_).reason; }
    Failure failure() const { return std::get<1>(state_); }

  private:
    std::variant<T, Failure> state_;
};

template <>
class [[nodiscard]] Result<void> {
  public:
    Result() = default;
    Result(Failure failure) : failed_(true), failure_(std::move(failure)) {}

    bool ok() const { return !failed_; }
    explicit operator bool() const { return ok(); }

    // Only when !ok().
    const std::string& reason() const { return failure_.reason; }
    Failure failure() const { return failure_; }

  private:
    bool failed_ = false;
    Failure failure_;
};

}  // namespace tavrix
