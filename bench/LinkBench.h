// What the benchmarks that go through the library's links share: waiting for a callback, and
// asking the link manager for its figures.
#pragma once

#include <memory>
#include <utility>

#include "platform/Rpc.h"
#include "platform/Sync.h"
#include "tidelink/core/ConnectionStatus.h"
#include "tidelink/core/LinkManager.h"

namespace tidelink::bench {

// The first result handed to Callback(); Get() moves it out (a project keeps its open callback,
// so the result must not keep the project).
template <class T>
struct Await {
    std::shared_ptr<platform::Gate> gate = std::make_shared<platform::Gate>();
    std::shared_ptr<std::pair<ConnectionStatus, T>> result =
        std::make_shared<std::pair<ConnectionStatus, T>>(ConnectionStatus::Failed, T{});
    auto Callback() {
        auto g = gate;
        auto r = result;
        return [g, r](ConnectionStatus s, T v) {
            if (g->IsOpen()) return;
            *r = {s, std::move(v)};
            g->Open();
        };
    }
    // T{} on failure or after |seconds|.
    T Get(double seconds = 60) {
        if (!gate->Wait(static_cast<int>(seconds * 1000)) || result->first != ConnectionStatus::Connected) return T{};
        return std::move(result->second);
    }
};

// The "value" of the link manager's status answer (an empty object when it cannot be had).
inline platform::Value ManagerInfo(double seconds = 60) {
    Await<platform::Value> info;
    auto cb = info.Callback();
    LaunchTidelinkManagerRPC()->SendRequest(
        platform::BuildCall(kManagerInfoMessage),
        [cb](const platform::Value& v, platform::RequestId) { cb(ConnectionStatus::Connected, v); },
        [cb](int32_t, const platform::WString&, platform::RequestId) { cb(ConnectionStatus::Failed, platform::Value()); });
    const platform::Value reply = info.Get(seconds);
    return reply.is_object() ? reply.value("value", platform::Value::object()) : platform::Value::object();
}

}  // namespace tidelink::bench
