// Reaches the link manager (starting it when needed) and prints its port.
#include <cstdio>

#include <tidelink/core/LinkManager.h>

int main() {
    try {
        const auto port = tidelink::GetPortForTideLinkManager();
        std::printf("link manager on port %u (protocol %s)\n", port,
                    tidelink::CSVersionPortNumberString().c_str());
        return 0;
    } catch (const tidelink::LinkError& e) {
        std::fprintf(stderr, "%s\n", e.what());
        return 1;
    }
}
