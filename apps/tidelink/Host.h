// The command-line host's way of using the library: each step waits for its callback, so the
// commands read as plain sequences. Errors carry the reason a person can act on.
#pragma once

#include <chrono>
#include <memory>
#include <optional>
#include <string>

#include "platform/Sync.h"
#include "tidelink/core/ConnectionStatus.h"
#include "tidelink/core/Server.h"
#include "tidelink/peers/Project.h"

namespace tidelink::cli {

struct HostError {
    std::string message;
};

// A result handed from a callback thread to the waiting command.
template <class T>
class Await {
public:
    Await() : mState(std::make_shared<State>()) {}

    // The callback to give the library: keeps the first result, opens the gate.
    auto Callback() {
        auto state = mState;
        return [state](ConnectionStatus status, T value) {
            std::lock_guard lock(state->mutex);
            if (state->done) return;
            state->done = true;
            state->status = status;
            state->value = std::move(value);
            state->gate.Open();
        };
    }

    // Waits up to |seconds|; nullopt on timeout.
    std::optional<std::pair<ConnectionStatus, T>> Wait(double seconds) {
        if (!mState->gate.Wait(static_cast<int>(seconds * 1000))) return std::nullopt;
        std::lock_guard lock(mState->mutex);
        // Moved out: the callback may live as long as the object it delivered (a project keeps
        // its open callback), and must not keep that object alive.
        return std::make_pair(mState->status, std::move(mState->value));
    }

private:
    struct State {
        std::mutex mutex;
        platform::Gate gate;
        bool done = false;
        ConnectionStatus status = ConnectionStatus::Failed;
        T value{};
    };
    std::shared_ptr<State> mState;
};

// Which application serves a project file, by its extension.
enum class Application { Kestrel, Osprey, Puffin };
std::optional<Application> ApplicationForFile(const std::string& path);
const char* ApplicationName(Application app);

// The trace level the user asked for (-1 quiet); the host's own trace sink honours it.
void SetTraceLevel(int level);

struct OpenOptions {
    // Progress lines on stderr.
    bool verbose = false;
};

// Reaches the application that serves |path| and opens the project in it.
// Throws HostError with a message for the user.
ProjectPtr OpenProjectFile(const std::string& path, const OpenOptions& options, ServerPtr* server = nullptr);

}  // namespace tidelink::cli
