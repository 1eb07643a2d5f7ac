// What every form of a property list has to keep to: limits, and values where values belong. Internal to the
// PropertyList sources.
#pragma once

#include <cstdint>
#include <vector>

#include "Platform/propertylist/PropertyList.h"

namespace platform::propertylist {

/// Counts what passes through the sink, on either side.
class Budget {
  public:
    bool spend(size_t payload) {
        if (objects_ == 0 || payload > payload_) return false;
        --objects_;
        payload_ -= payload;
        return true;
    }

  private:
    size_t objects_ = kMaxPropertyListObjects;
    size_t payload_ = kMaxPropertyListPayload;
};

enum class Container : uint8_t { Array, Dictionary };

/// Checks the order of one value's events. Each operation returns whether its event is allowed here; after
/// the first one that is not, none is.
class Shape {
  public:
    bool value(size_t payload) { return settle(mayTakeValue() && budget_.spend(payload)) && takeValue(); }

    bool key(size_t payload) {
        const bool expected =
            !open_.empty() && open_.back().container == Container::Dictionary && !open_.back().hasKey;
        return settle(expected && budget_.spend(payload)) && (open_.back().hasKey = true);
    }

    bool begin(Container container) {
        if (!settle(open_.size() < kMaxPropertyListDepth && mayTakeValue() && budget_.spend(0))) return false;
        takeValue();
        open_.push_back({container});
        return true;
    }

    bool end(Container container) {
        if (!settle(!open_.empty() && open_.back().container == container && !open_.back().hasKey))
            return false;
        open_.pop_back();
        return true;
    }

    /// For what the form cannot hold.
    void fail() { failed_ = true; }

    bool isComplete() const { return !failed_ && hasTop_ && open_.empty(); }

  private:
    struct Level {
        Container container;
        bool hasKey = false;
    };

    bool settle(bool allowed) {
        failed_ |= !allowed;
        return !failed_;
    }

    bool mayTakeValue() const {
        if (open_.empty()) return !hasTop_;
        return open_.back().container == Container::Array || open_.back().hasKey;
    }

    bool takeValue() {
        if (open_.empty()) {
            hasTop_ = true;
        } else {
            open_.back().hasKey = false;
        }
        return true;
    }

    std::vector<Level> open_;
    Budget budget_;
    bool hasTop_ = false;
    bool failed_ = false;
};

}  // namespace platform::propertylist
