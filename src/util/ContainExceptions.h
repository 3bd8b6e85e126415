// The edges an exception must not cross: bus callbacks (C code between them and the caller) and
// worker-thread entries (nothing above them to catch). There a failure becomes one log line and a
// normal answer, and the daemon goes on serving.
#pragma once

#include <exception>
#include <utility>

namespace tavrix {

namespace detail {
// Logs "<what> failed with an exception: <reason>" (or "an unknown exception"); never throws,
// even when the line itself cannot be made.
void logContainedException(const char* what, const char* reason) noexcept;
}  // namespace detail

// Runs body; true when it returned, false (logged) when it threw anything at all.
template <typename Body>
bool containExceptions(const char* what, Body&& body) noexcept {
    try {
        std::forward<Body>(body)();
        return true;
    } catch (const std::exception& error) {
        detail::logContainedException(what, error.what());
    } catch (...) {
        detail::logContainedException(what, nullptr);
    }
    return false;
}

}  // namespace tavrix
