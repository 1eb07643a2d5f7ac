// Whether a change of the database is one that others react to.
#pragma once

namespace veltoid {

/// Yes: the change marks what it changes as dirty and signals the change semaphore.
enum class Notify : bool { No, Yes };

}  // namespace veltoid
