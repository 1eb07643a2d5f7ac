// How an operation fails.
#pragma once

#include "Values/Error.h"

namespace veltoid {

/// Hands out the error; false.
inline bool failWith(ErrorOut out, Error error) {
    fillError(out, std::move(error));
    return false;
}

}  // namespace veltoid
