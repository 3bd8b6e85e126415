// The one way an operation that can fail says so: a Result<T> holds the value, or the Failure
// with its reason, a sentence fit for a log line or a client's error. Result<> is an operation
// with nothing to answer. Results cannot be dropped unread.
#pragma once

#include <optional>
#include <string>
#include <utility>

namespace tavrix {

struct Failure {
    std::string reason;
};

template <typename T = void>
class [[nodiscard]] Result {
  public:
    Result(const T& value) : value_(value) {}
    Result(T&& value) : value_(std::move(value)) {}
    Result(Failure failure) : failure_(std::move(failure)) {}

    bool ok() const { return value_.has_value(); }
    explicit operator bool() const { return ok(); }

    // Only when ok().
    T& operator*() { return value_.value(); }
    const T& operator*() const { return value_.value(); }
    T* operator->() { return &value_.value(); }
    const T* operator->() const { return &value_.value(); }

    // Only when !ok().
    const std::string& reason() const { return failure_.reason; }
    Failure failure() const { return failure_; }

  private:
    std::optional<T> value_;
    Failure failure_;
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
