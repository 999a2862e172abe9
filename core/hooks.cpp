// The hooks through which the core reaches the other subsystems; each
// subsystem fills its own at start-up.
#include "core/hooks.h"

namespace velmor {

SuiteHooks hooks;

}  // namespace velmor
