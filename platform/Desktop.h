// The desktop: letting another process bring its window to the front.
#pragma once

#include "platform/Export.h"

namespace tidelink::platform {

// Allows any process to take the foreground before a peer is asked to show something. Linux
// desktops have no such right to grant (the window manager decides), so this does nothing here.
TIDELINK_EXPORT void AllowAnyProcessToTakeForeground();

}  // namespace tidelink::platform
