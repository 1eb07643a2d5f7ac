#include "Values/SecurityObject.h"

namespace veltoid {

Value Value::object(SecurityObject object) { return boxed(Kind::Object, std::move(object)); }

const SecurityObject* Value::asObject() const { return unboxed<SecurityObject>(Kind::Object); }

}  // namespace veltoid
