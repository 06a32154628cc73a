// The per-user session secret: 32 random bytes in <runtime dir>/session-secret (mode 0600), made
// by whichever process of the user needs it first. Every session proves knowledge of it in its
// hello, so processes of other users can neither call our servers nor inject notifications.
#pragma once

#include <optional>

#include "platform/Export.h"
#include "platform/Wire.h"

namespace tidelink::platform {

// Loaded once per process; empty when the runtime folder or the file is unusable (then no
// session can be opened or accepted, and a level-0 trace line says why).
TIDELINK_EXPORT std::optional<wire::Secret> GetSessionSecret();

}  // namespace tidelink::platform
