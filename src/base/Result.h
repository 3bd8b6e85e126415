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
    // The errno behind it when a system call failed (ENOENT: there is nothing there), else 0.
    int error = 0;
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
    // The value, or fallback when the operation failed and its reason does not matter.
    T value_or(T fallback) && { return ok() ? std::move(*value_) : std::move(fallback); }

    // Only when !ok().
    const std::string& reason() const { return failure_.reason; }
    Failure failure() const { return failure_; }

    // Equal to a value when it holds one equal to it.
    friend bool operator==(const Result& result, const T& value) {
        return result.ok() && *result == value;
    }

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
