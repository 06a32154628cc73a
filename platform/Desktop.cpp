#include "platform/Desktop.h"

namespace tidelink::platform {

void AllowAnyProcessToTakeForeground() {}

}  // namespace tidelink::platform
