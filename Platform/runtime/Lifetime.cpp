#include "Platform/runtime/Lifetime.h"

#include <cstdio>
#include <cstdlib>
#include <utility>

namespace platform {
namespace {

[[noreturn]] void fail(const char* reason) {
    // NOLINTNEXTLINE(cert-err33-c): the process ends in any case
    std::fprintf(stderr, "lifetime: %s\n", reason);
    std::abort();
}

}  // namespace

size_t Lifetime::nextSlot() {
    // Of the program, not of a lifetime: a type keeps its number.
    static std::atomic<size_t> next{0};
    const size_t slot = next++;
    if (slot >= kMaxStates) fail("too many kinds of state");
    return slot;
}

void Lifetime::abortWithout() { fail("something is used that exists during a lifetime only"); }

Lifetime::Lifetime(const Product& product, Parts parts) : product_(product) {
    for (Entry& part : parts.entries_) add(std::move(part));
    Lifetime* none = nullptr;
    if (!current_.compare_exchange_strong(none, this)) fail("begun before the one before has ended");
}

Lifetime::~Lifetime() {
    isEnding_ = true;
    callAll(&Entry::lifetimeEnds);
    callAll(&Entry::runDry);
    const std::lock_guard lock(mutex_);
    isOver_ = true;
    while (!entries_.empty()) {
        Entry last = std::move(entries_.back());
        entries_.pop_back();
        last.object.reset();
        slots_[last.slot] = nullptr;
    }
    current_ = nullptr;
}

void* Lifetime::create(size_t slot, Entry (*make)()) {
    const std::lock_guard lock(mutex_);
    if (void* known = slots_[slot].load(std::memory_order_relaxed)) return known;
    if (isOver_) fail("a state is used after its end");
    Entry made = make();
    void* object = made.object.get();
    add(std::move(made));
    return object;
}

void Lifetime::add(Entry entry) {
    slots_[entry.slot].store(entry.object.get(), std::memory_order_release);
    entries_.push_back(std::move(entry));
}

void Lifetime::callAll(void (*Entry::*operation)(void*)) {
    std::unique_lock lock(mutex_);
    const std::vector<Entry> entries(entries_.rbegin(), entries_.rend());
    lock.unlock();
    for (const Entry& entry : entries)
        if (entry.*operation != nullptr) (entry.*operation)(entry.object.get());
}

}  // namespace platform
