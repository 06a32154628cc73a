// The reference peer run in this process on a registrar of its own, reached over a real
// connection: its project messages arrive there too, and its rendering sessions end with the host
// connection that made them.
#include <gtest/gtest.h>

#include <future>

#include "Harness.h"
#include "PeerRole.h"
#include "PeerRuntime.h"
#include "platform/Rpc.h"
#include "tidelink/core/LinkManager.h"
#include "tidelink/peers/ProjectProtocol.h"
#include "tidelink/render/RenderOptions.h"

using namespace tidelink;
using namespace tidelink::platform;
using namespace tidelink::test;

namespace {

struct Reply {
    bool ok = false;
    Value value;
    std::string error;
};

Reply Ask(RPCClient& client, const std::string& name, Value args) {
    auto promise = std::make_shared<std::promise<Reply>>();
    auto future = promise->get_future();
    client.SendRequest(
        BuildCall("com.quenlo.tidelink." + name, std::move(args)),
        [promise](const Value& reply, RequestId) { promise->set_value({true, reply.value("value", Value()), {}}); },
        [promise](int32_t code, const WString& message, RequestId) {
            promise->set_value({false, Value(), std::to_string(code) + " " + ToUTF8(message)});
        });
    if (future.wait_for(std::chrono::seconds(20)) != std::future_status::ready) return {false, Value(), "no answer"};
    return future.get();
}

}  // namespace

TEST(PeerSessionsTest, RenderSessionsEndWithTheHostConnectionThatMadeThem) {
    peer::PeerRuntimeOptions options;
    options.role = *peer::RoleByName("kestrel");
    options.announce = false;
    options.registrar = MessageRegistrar::Create();
    peer::PeerRuntime runtime(options);
    std::string error;
    ASSERT_TRUE(runtime.Start(error)) << error;

    auto session = ClientStart(GetSharedTransport(), runtime.Address(), runtime.Port());
    ASSERT_TRUE(session);
    RPCClient host(session, "PeerSessionsTest");
    const std::string demo = std::string(TIDELINK_SOURCE_DIR) + "/examples/projects/demo.kstproj";
    const Reply opened = Ask(host, "OpenProject", Value::array({demo}));
    ASSERT_TRUE(opened.ok) << opened.error;
    const std::string file = opened.value.at("file").get<std::string>();

    // A project message of the library's server::Project, on the peer's own registrar.
    const Reply root = Ask(host, "GetContainer", Value::array({file, Guid().ToString()}));
    ASSERT_TRUE(root.ok) << root.error;
    const auto bins = root.value.at("containeditems").get<std::vector<ItemInfo>>();
    ASSERT_EQ(bins.size(), 2u);
    const Reply comps = Ask(host, "GetContainer", Value::array({file, bins[0].mID.ToString()}));
    ASSERT_TRUE(comps.ok) << comps.error;
    const auto comp = comps.value.at("containeditems").get<std::vector<ItemInfo>>().at(0);

    const Reply video = Ask(host, "CreateVideoRenderingSession",
                            Value::array({file, comp.mID.ToString(), Value(VideoRenderOptions())}));
    ASSERT_TRUE(video.ok) << video.error;
    const Reply audio = Ask(host, "CreateAudioRenderingSession",
                            Value::array({file, comp.mID.ToString(), Value(AudioRenderOptions()),
                                          Value({{"value", 0}, {"scale", 1}}), 1024}));
    ASSERT_TRUE(audio.ok) << audio.error;
    EXPECT_EQ(runtime.Renders()->VideoSessionCount(), 1u);
    EXPECT_EQ(runtime.Renders()->AudioSessionCount(), 1u);

    // The host goes away without disposing them.
    session->Close();
    EXPECT_TRUE(WaitFor([&] { return runtime.Renders()->VideoSessionCount() == 0; }, 10));
    EXPECT_TRUE(WaitFor([&] { return runtime.Renders()->AudioSessionCount() == 0; }, 10));
    runtime.Stop();
}
