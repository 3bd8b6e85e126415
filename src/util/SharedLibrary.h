// Optional libraries loaded at first use rather than at start: an idle daemon maps only what it
// serves with, and a library that is missing fails the one operation that needs it, not the start.
#pragma once

#include <dlfcn.h>

#include <memory>
#include <string>

namespace tavrix {

class SharedLibrary {
  public:
    // Opens the library by its run-time name ("libcurl.so.4"); on failure error says why.
    static std::unique_ptr<SharedLibrary> open(const char* name, std::string& error);

    // Points function at the library's symbol; false with error set when it has none.
    template <typename Function>
    bool bind(Function*& function, const char* symbol, std::string& error) const {
        void* address = ::dlsym(handle_.get(), symbol);
        if (address == nullptr) {
            error = name_ + " has no " + symbol;
            return false;
        }
        function = reinterpret_cast<Function*>(address);
        return true;
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
};

}  // namespace tavrix
