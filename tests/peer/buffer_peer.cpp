// A producer or consumer of shared buffers in its own process, driven by the integration tests.
//   buffer_peer produce GUID SIZE SEED HANDOVER [hold]   publish SIZE bytes under GUID
//   buffer_peer consume GUID [hold]                       wait for GUID, check and print it
//   buffer_peer allocate SIZE                              allocate without end
// Prints one line per step; "hold" keeps the process (and its references) until it is killed.
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "platform/Sync.h"
#include "processcoordination/ProcessCoordination.h"

using namespace processcoordination;

namespace {

void HoldForever() {
    for (;;) ::pause();
}

}  // namespace

int main(int argc, char** argv) {
    if (argc < 3) return 2;
    const std::string mode = argv[1];
    InitializeClient();
    if (mode == "allocate") {
        const uint64_t size = std::strtoull(argv[2], nullptr, 10);
        std::vector<WritableBinaryReferencePtr> kept;
        for (;;) {
            WritableBinaryReferencePtr ref;
            if (GetWritableBinaryData(size, ref) == 0) kept.push_back(ref);
            if (kept.size() == 1) {
                std::printf("allocating\n");
                std::fflush(stdout);
            }
        }
    }
    const auto id = Guid::Parse(std::string(argv[2]));
    if (!id) return 2;
    if (mode == "produce" && argc >= 6) {
        const uint64_t size = std::strtoull(argv[3], nullptr, 10);
        const int seed = std::atoi(argv[4]);
        const bool handOver = std::string(argv[5]) == "1";
        WritableBinaryReferencePtr ref;
        if (GetWritableBinaryData(size, ref) != 0) return 3;
        auto* p = static_cast<uint8_t*>(ref->MapIntoCurrentProcess());
        for (uint64_t i = 0; i < size; ++i) p[i] = static_cast<uint8_t>(seed + i);
        ref->UnmapFromCurrentProcess(p);
        PutCompletedBinaryData(*id, ref, handOver);
        std::printf("published\n");
        std::fflush(stdout);
        if (argc > 6) HoldForever();
        ref.reset();
        IsBinaryDataCurrentlyWanted(*id);  // a round trip: everything above has been sent
        UninitializeClient();
        return 0;
    }
    if (mode == "consume") {
        tidelink::platform::Gate done;
        BinaryReferencePtr kept;
        int code = 1;
        GetBinaryDataWithAsyncNotification(*id, [&](const Guid&, BinaryReferencePtr ref, int result) {
            code = result;
            kept = ref;
            done.Open();
        });
        if (!done.Wait(20000)) return 4;
        uint64_t sum = 0;
        if (kept) {
            const auto* p = static_cast<const uint8_t*>(kept->MapIntoCurrentProcess());
            for (uint64_t i = 0; p != nullptr && i < kept->GetSize(); ++i) sum += p[i];
            if (p) kept->UnmapFromCurrentProcess(p);
        }
        std::printf("result %d size %llu sum %llu\n", code, kept ? static_cast<unsigned long long>(kept->GetSize()) : 0ull,
                    static_cast<unsigned long long>(sum));
        std::fflush(stdout);
        if (argc > 3) HoldForever();
        kept.reset();
        IsBinaryDataCurrentlyWanted(*id);
        UninitializeClient();
        return 0;
    }
    return 2;
}
