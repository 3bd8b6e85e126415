// Optional libraries loaded at first use rather than at start: an idle daemon maps only what it
// serves with, and a library that is missing fails the one operation that needs it, not the start.
#pragma once

#include <dlfcn.h>

#include <memory>
#include <string>

#include "base/Result.h"

namespace tavrix {

class SharedLibrary {
  public:
    // Opens the library by its run-time name ("libcurl.so.4").
    static Result<std::unique_ptr<SharedLibrary>> open(const char* name);

    // Points function at the library's symbol, or leaves it null and remembers the first symbol
    // that was missing, for allBound().
    template <typename Function>
    void bind(Function*& function, const char* symbol) {
        void* address = ::dlsym(handle_.get(), symbol);
        if (address == nullptr && missing_.empty()) {
            missing_ = symbol;
        }
        function = reinterpret_cast<Function*>(address);
    }

    // Fails, naming the first missing symbol, unless every bind found its symbol.
    Result<> allBound() const {
        if (!missing_.empty()) {
            return Failure{name_ + " has no " + missing_};
        }
        return {};
    }

    SharedLibrary(const SharedLibrary&) = delete;
    SharedLibrary& operator=(const SharedLibrary&) = delete;

  private:
    struct Close {
        void operator()(void* handle) const { ::dlclose(handle); }
    };
    SharedLibrary(std::string name, void* handle) : name_(std::move(name)), handle_(handle) {}

    std::string name_;
    std::unique_ptr<void, Close> handle_;
    std::string missing_;
};

// Logs, at err, that a library cannot be used and what is unavailable without it.
void logUnusableLibrary(const std::string& line);

// A library's functions, bound once and kept for the rest of the process (libraries with global
// state clean up at exit, not at dlclose). bind(library, functions) fills the struct of function
// pointers and answers library.allBound(), after running the library's own set-up where it has
// one. A library that cannot be used is logged once, "<unavailable>: <reason>", and every use
// answers that failure. Made in a function-local static, it loads on the first use, once.
template <typename Functions>
class LoadedLibrary {
  public:
    template <typename Bind>
    LoadedLibrary(const char* name, const std::string& unavailable, Bind bind) {
        Result<std::unique_ptr<SharedLibrary>> library = SharedLibrary::open(name);
        const Result<> ready = library ? bind(**library, functions_) : Result<>(library.failure());
        if (!ready) {
            failure_ = unavailable + ": " + ready.reason();
            logUnusableLibrary(failure_);
            return;
        }
        library_ = std::move(*library);
    }

    Result<const Functions*> functions() const {
        if (!library_) {
            return Failure{failure_};
        }
        return &functions_;
    }

  private:
    std::unique_ptr<SharedLibrary> library_;
    Functions functions_{};
    std::string failure_;
};

}  // namespace tavrix
