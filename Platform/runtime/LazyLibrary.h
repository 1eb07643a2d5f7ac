// Shared libraries that are loaded with the first call of one of their functions. The agent is started for
// every message that finds it away, and most starts need neither storage nor cryptography: having the dynamic
// linker map and relocate those libraries before main would add two fifths to the time up to the first
// answer.
//
//     LazyLibrary library("libexample.so.1");
//     VELTOID_LAZY_FUNCTIONS(library, example_open, example_close);
//
// Below these lines, in the same namespace, example_open(...) is written as if the library had been linked.
// It is not: a function that is missing from such a list is an error of the linker.
#pragma once

#include <atomic>
#include <initializer_list>
#include <memory>

namespace platform {

/// The library by its fixed soname, kept for the life of the process.
class LazyLibrary {
  public:
    /// `prepare` is called before each address is given out, hence before any function is called.
    explicit constexpr LazyLibrary(const char* soname, void (*prepare)() = nullptr)
        : soname_(soname), prepare_(prepare) {}

    /// The address of a function; ends the process with a log line when the library or the function is
    /// missing, like the dynamic linker with a library that is linked. Any thread.
    void* addressOf(const char* function) const;

    /// Whether the library and all of these functions are there: for a program that can do without it. Loads
    /// the library; what is missing is logged. Any thread.
    bool provides(std::initializer_list<const char*> functions) const;

  private:
    const char* soname_;
    void (*prepare_)();
};

/// A function of a library, called like the function itself.
template <typename Function>
class LazyFunction {
  public:
    constexpr LazyFunction(const LazyLibrary& library, const char* name) : library_(library), name_(name) {}

    constexpr const char* name() const { return name_; }

    operator Function*() const {  // NOLINT(google-explicit-constructor): this is what makes it callable
        void* address = address_.load(std::memory_order_acquire);
        if (address == nullptr) {
            // Threads that meet here find the same address.
            address = library_.addressOf(name_);
            address_.store(address, std::memory_order_release);
        }
        return reinterpret_cast<Function*>(address);
    }

  private:
    const LazyLibrary& library_;
    const char* name_;
    mutable std::atomic<void*> address_{nullptr};
};

/// Owns an object of the library, which one of its functions frees.
template <const auto& Free>
struct LazyDeleter {
    template <typename Object>
    void operator()(Object* object) const {
        Free(object);
    }
};
template <typename Object, const auto& Free>
using LazyOwner = std::unique_ptr<Object, LazyDeleter<Free>>;

}  // namespace platform

// Each name is the library's own, so that it hides the declaration of its header. A macro may name itself
// only by way of another one that the preprocessor is made to look at again, here often enough for 85
// functions.
#define VELTOID_LAZY_FUNCTIONS(library, ...) VELTOID_LAZY_SCAN(VELTOID_LAZY_FUNCTION(library, __VA_ARGS__))
#define VELTOID_LAZY_FUNCTION(library, function, ...)                                           \
    constinit const ::platform::LazyFunction<decltype(::function)> function(library, #function) \
        __VA_OPT__(; VELTOID_LAZY_AGAIN VELTOID_LAZY_PARENTHESES(library, __VA_ARGS__))
#define VELTOID_LAZY_AGAIN() VELTOID_LAZY_FUNCTION
#define VELTOID_LAZY_PARENTHESES ()
#define VELTOID_LAZY_SCAN(...) \
    VELTOID_LAZY_SCAN_21(VELTOID_LAZY_SCAN_21(VELTOID_LAZY_SCAN_21(VELTOID_LAZY_SCAN_21(__VA_ARGS__))))
#define VELTOID_LAZY_SCAN_21(...) \
    VELTOID_LAZY_SCAN_5(VELTOID_LAZY_SCAN_5(VELTOID_LAZY_SCAN_5(VELTOID_LAZY_SCAN_5(__VA_ARGS__))))
#define VELTOID_LAZY_SCAN_5(...) \
    VELTOID_LAZY_SCAN_1(VELTOID_LAZY_SCAN_1(VELTOID_LAZY_SCAN_1(VELTOID_LAZY_SCAN_1(__VA_ARGS__))))
#define VELTOID_LAZY_SCAN_1(...) __VA_ARGS__
