// The lifetime in which a test runs (TestMain.cpp begins and ends it), and how fakes get into it.
#pragma once

#include <optional>

#include "Platform/runtime/Lifetime.h"
#include "Protocol/Product.h"

namespace platform {

/// Main thread.
class TestLifetime {
  public:
    static void begin() { lifetime_.emplace(veltoid::kProduct, parts_); }
    static void end() { lifetime_.reset(); }

    /// As the end and the next start of a process are: nothing but files stays.
    static void restart() {
        end();
        begin();
    }

    template <class Interface>
    static void restartWith(Interface& part) {
        end();
        parts_.without<Interface>();
        parts_.with(part);
        begin();
    }

    template <class Interface>
    static void restartWithout() {
        end();
        parts_.without<Interface>();
        begin();
    }

  private:
    static inline Lifetime::Parts parts_;
    static inline std::optional<Lifetime> lifetime_;
};

/// The last member of a fake: the test's lifetime begins anew with it, and without it when the fake goes.
template <class Interface>
class InTestLifetime {
  public:
    explicit InTestLifetime(Interface& part) { TestLifetime::restartWith(part); }
    ~InTestLifetime() { TestLifetime::restartWithout<Interface>(); }
    InTestLifetime(const InTestLifetime&) = delete;
    InTestLifetime& operator=(const InTestLifetime&) = delete;
};

}  // namespace platform
