// Everything that lives as long as the agent hangs off one Lifetime, which the process creates and ends.
// There is one at a time; tests and simulations have many, one after the other.
//
// A room reaches its state through one function of its own,
//
//     RoomState& state() { return platform::Lifetime::current().state<RoomState>(); }
//
// which makes the state on first use. A state may have two more operations: `void lifetimeEnds()` wakes what
// waits for something that will not come any more, and `void runDry()` is for the work queues alone.
//
// Ending: states hear lifetimeEnds; the work queues run what is queued until nothing is left, while delayed
// tasks are dropped and timed waits end early; then states are destroyed. Both the calls and the destruction
// go in the reverse order of creation, on the thread that ends the lifetime.
#pragma once

#include <algorithm>
#include <array>
#include <atomic>
#include <memory>
#include <mutex>
#include <vector>

#include "Platform/runtime/ProductNames.h"

namespace platform {

class Lifetime {
    struct Entry {
        size_t slot = 0;
        std::shared_ptr<void> object;
        void (*lifetimeEnds)(void*) = nullptr;
        void (*runDry)(void*) = nullptr;
    };

  public:
    /// What stands in for the real implementations of some of the platform's interfaces.
    class Parts {
      public:
        /// The caller keeps the part alive until the lifetime has ended. The first one given stays.
        template <class Interface>
        Parts& with(Interface& part) {
            if (!has<Interface>())
                entries_.push_back(entryFor<Interface>(std::shared_ptr<Interface>(&part, [](Interface*) {})));
            return *this;
        }

        template <class Interface>
        void without() {
            std::erase_if(entries_, [](const Entry& entry) { return entry.slot == slotOf<Interface>(); });
        }

        template <class Interface>
        bool has() const {
            return std::any_of(entries_.begin(), entries_.end(),
                               [](const Entry& entry) { return entry.slot == slotOf<Interface>(); });
        }

      private:
        friend class Lifetime;
        std::vector<Entry> entries_;
    };

    /// Aborts when there is one already.
    explicit Lifetime(const Product& product, Parts parts = {});
    ~Lifetime();

    /// Any thread; aborts when there is none.
    static Lifetime& current() {
        if (Lifetime* lifetime = current_.load(std::memory_order_acquire)) return *lifetime;
        abortWithout();
    }

    const Product& product() const { return product_; }

    /// Whether the end has begun: what is still under way comes to its own end soon.
    bool isEnding() const { return isEnding_.load(); }

    /// The one T of this lifetime. Any thread.
    template <class T>
    T& state() {
        return part<T, T>();
    }

    /// The part that was given for the interface, else the one Real of this lifetime. Any thread.
    template <class Interface, class Real>
    Interface& part() {
        const size_t slot = slotOf<Interface>();
        void* known = slots_[slot].load(std::memory_order_acquire);
        if (known == nullptr)
            known = create(slot, [] { return entryFor<Interface>(std::make_shared<Real>()); });
        return *static_cast<Interface*>(known);
    }

  private:
    static constexpr size_t kMaxStates = 64;

    static size_t nextSlot();

    template <class T>
    static size_t slotOf() {
        static const size_t slot = nextSlot();
        return slot;
    }

    template <class T>
    static Entry entryFor(std::shared_ptr<T> object) {
        Entry entry{slotOf<T>(), std::move(object)};
        if constexpr (requires(T & state) { state.lifetimeEnds(); })
            entry.lifetimeEnds = [](void* state) { static_cast<T*>(state)->lifetimeEnds(); };
        if constexpr (requires(T & state) { state.runDry(); })
            entry.runDry = [](void* state) { static_cast<T*>(state)->runDry(); };
        return entry;
    }

    void* create(size_t slot, Entry (*make)());
    void add(Entry entry);
    void callAll(void (*Entry::*operation)(void*));
    [[noreturn]] static void abortWithout();

    static inline std::atomic<Lifetime*> current_{nullptr};

    const Product product_;
    std::array<std::atomic<void*>, kMaxStates> slots_{};
    std::atomic<bool> isEnding_ = false;
    /// Making a state may need other states. Guards what follows.
    std::recursive_mutex mutex_;
    bool isOver_ = false;
    /// In the order of creation.
    std::vector<Entry> entries_;
};

}  // namespace platform
