// The RPC layer over real loopback sockets inside one process.
#include <gtest/gtest.h>

#include <atomic>
#include <map>
#include <mutex>
#include <thread>

#include "Harness.h"
#include "platform/Rpc.h"
#include "platform/Sync.h"

using namespace tidelink::platform;
using tidelink::test::RawClient;
using tidelink::test::WaitFor;

namespace {

class RpcTest : public ::testing::Test {
protected:
    void SetUp() override {
        transport = SocketTransport::Create(CreateSubExecutor(CreateCPUBoundExecutor(), -1));
        server = transport->ServerStart(0, true);
        ASSERT_TRUE(server);
        registrar = MessageRegistrar::Create();
        rpcServer = std::make_shared<RPCServer>(server, "test", registrar);
        registrar->Register("test.echo", std::make_shared<FunctionRequestHandler>(
                                             [](const ResponderPtr& r, const Value& args) {
                                                 r->SendGeneralResult(args);
                                             }));
        session = transport->ClientStart("127.0.0.1", server->GetPort());
        ASSERT_TRUE(session);
        client = std::make_shared<RPCClient>(session, "DirectClient");
    }
    void TearDown() override {
        client.reset();
        session.reset();
        if (server) server->Stop();
    }

    // Sends and waits; returns {ok, reply or message}.
    std::pair<bool, Value> Call(const std::string& name, Value args = Value::array()) {
        Gate gate;
        std::pair<bool, Value> out;
        client->SendRequest(
            BuildCall(name, std::move(args)),
            [&](const Value& reply, RequestId) {
                out = {true, reply};
                gate.Open();
            },
            [&](int32_t code, const WString& message, RequestId) {
                out = {false, Value{{"code", code}, {"message", ToUTF8(message)}}};
                gate.Open();
            });
        EXPECT_TRUE(gate.Wait(10000));
        return out;
    }

    SocketTransportPtr transport;
    ListeningServerPtr server;
    MessageRegistrarPtr registrar;
    RPCServerPtr rpcServer;
    SessionPtr session;
    RPCClientPtr client;
};

TEST_F(RpcTest, PipelinedRequestsCompleteExactlyOnceWithTheirOwnReplies) {
    constexpr int kCount = 2000;
    std::mutex mutex;
    std::map<RequestId, int> calls;
    std::map<RequestId, int64_t> expected;
    std::atomic<int> done{0};
    std::atomic<int> mismatches{0};
    for (int i = 0; i < kCount; ++i) {
        std::lock_guard lock(mutex);  // the reply may arrive before SendRequest returns
        const RequestId id = client->SendRequest(
            BuildCall("test.echo", Value::array({i, "payload"})),
            [&, i](const Value& reply, RequestId rid) {
                std::lock_guard inner(mutex);
                ++calls[rid];
                if (reply["value"][0] != i) ++mismatches;
                ++done;
            },
            [&](int32_t, const WString&, RequestId rid) {
                std::lock_guard inner(mutex);
                ++calls[rid];
                ++mismatches;
                ++done;
            });
        expected[id] = i;
    }
    ASSERT_TRUE(WaitFor([&] { return done.load() == kCount; }, 20));
    std::this_thread::sleep_for(std::chrono::milliseconds(50));  // no late duplicates
    std::lock_guard lock(mutex);
    EXPECT_EQ(mismatches.load(), 0);
    EXPECT_EQ(calls.size(), static_cast<size_t>(kCount));
    for (const auto& [id, n] : calls) EXPECT_EQ(n, 1) << "request " << id;
}

TEST_F(RpcTest, ValuesSurviveTheWireExactly) {
    const Value args = Value::array(
        {int64_t(-9007199254740993), uint64_t(18446744073709551615ull), 0.1, true, nullptr,
         "\xe4\xb8\xad", Value{{"z", 1}, {"a", Value::array({Value::object()})}}});
    auto [ok, reply] = Call("test.echo", args);
    ASSERT_TRUE(ok);
    EXPECT_EQ(reply["value"], args);
    EXPECT_EQ(reply["value"][6].begin().key(), "z");  // member order kept
}

TEST_F(RpcTest, RefusalsCarryAClearErrorAndKeepTheSession) {
    registrar->Register("test.throws", std::make_shared<FunctionRequestHandler>(
                                           [](const ResponderPtr&, const Value& args) {
                                               (void)args.at(0).get<std::string>();
                                           }));
    registrar->Register("test.drops", std::make_shared<FunctionRequestHandler>(
                                          [](const ResponderPtr&, const Value&) {}));
    registrar->Register("test.note", std::make_shared<FunctionNotificationHandler>([](const Value&) {}));

    auto [ok1, unknown] = Call("test.nobody");
    EXPECT_FALSE(ok1);
    EXPECT_EQ(unknown["code"], kErrorRequestRefused);
    EXPECT_NE(unknown["message"].get<std::string>().find("test.nobody"), std::string::npos);

    auto [ok2, wrongType] = Call("test.throws", Value::array({42}));
    EXPECT_FALSE(ok2);
    EXPECT_EQ(wrongType["code"], kErrorRequestRefused);

    auto [ok3, dropped] = Call("test.drops");
    EXPECT_FALSE(ok3);
    EXPECT_EQ(dropped["code"], kErrorRequestRefused);

    auto [ok4, notARequest] = Call("test.note");
    EXPECT_FALSE(ok4);

    auto [ok5, still] = Call("test.echo", Value::array({1}));
    EXPECT_TRUE(ok5) << "the session survives refusals";
}

TEST_F(RpcTest, CancelledRequestNeverCallsBack) {
    ResponderPtr held;
    Gate arrived;
    registrar->Register("test.later", std::make_shared<FunctionRequestHandler>(
                                          [&](const ResponderPtr& r, const Value&) {
                                              held = r;
                                              arrived.Open();
                                          }));
    std::atomic<int> calls{0};
    const RequestId id = client->SendRequest(
        BuildCall("test.later"), [&](const Value&, RequestId) { ++calls; },
        [&](int32_t, const WString&, RequestId) { ++calls; });
    ASSERT_TRUE(arrived.Wait(10000));
    client->CancelRequest(id, true);
    held->SendGeneralResult(true);
    held.reset();
    EXPECT_TRUE(Call("test.echo").first);  // the reply to the cancelled request came before this one
    session->Close();
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    EXPECT_EQ(calls.load(), 0);
}

TEST_F(RpcTest, FallbackReportsAndCancelsUnderTheOriginalId) {
    std::atomic<RequestId> reported{0};
    Gate done;
    const RequestId original = client->SendRequest(
        BuildCall("test.newer"), [](const Value&, RequestId) {},
        [&](int32_t, const WString&, RequestId failedId) {
            client->SendRequest(
                BuildCall("test.echo", Value::array({"legacy"})),
                [&](const Value&, RequestId id) {
                    reported = id;
                    done.Open();
                },
                [&](int32_t, const WString&, RequestId) { done.Open(); }, failedId);
        });
    ASSERT_TRUE(done.Wait(10000));
    EXPECT_EQ(reported.load(), original);

    // Cancelling the original id silences its fallback too.
    ResponderPtr held;
    Gate arrived;
    registrar->Register("test.later", std::make_shared<FunctionRequestHandler>(
                                          [&](const ResponderPtr& r, const Value&) {
                                              held = r;
                                              arrived.Open();
                                          }));
    std::atomic<int> calls{0};
    Gate fellBack;
    const RequestId second = client->SendRequest(
        BuildCall("test.newer"), [](const Value&, RequestId) {},
        [&](int32_t, const WString&, RequestId failedId) {
            client->SendRequest(
                BuildCall("test.later"), [&](const Value&, RequestId) { ++calls; },
                [&](int32_t, const WString&, RequestId) { ++calls; }, failedId);
            fellBack.Open();
        });
    ASSERT_TRUE(fellBack.Wait(10000));
    ASSERT_TRUE(arrived.Wait(10000));
    client->CancelRequest(second, true);
    held->SendGeneralResult(1);
    held.reset();
    EXPECT_TRUE(Call("test.echo").first);
    EXPECT_EQ(calls.load(), 0);
}

TEST_F(RpcTest, PendingRequestsFailOnceWhenTheSessionCloses) {
    registrar->Register("test.never", std::make_shared<FunctionRequestHandler>(
                                          [keep = std::make_shared<std::vector<ResponderPtr>>()](
                                              const ResponderPtr& r, const Value&) { keep->push_back(r); }));
    std::atomic<int> failures{0};
    std::atomic<int> successes{0};
    std::atomic<int32_t> code{0};
    for (int i = 0; i < 10; ++i) {
        client->SendRequest(
            BuildCall("test.never"), [&](const Value&, RequestId) { ++successes; },
            [&](int32_t c, const WString&, RequestId) {
                code = c;
                ++failures;
            });
    }
    ASSERT_TRUE(WaitFor([&] { return server->SessionCount() == 1; }, 5));
    server->Stop();  // the far side goes away
    ASSERT_TRUE(WaitFor([&] { return failures.load() == 10; }, 10));
    EXPECT_EQ(code.load(), kErrorSessionClosed);
    EXPECT_EQ(successes.load(), 0);
    EXPECT_FALSE(session->IsOpen());

    // A request on the closed session still completes, once, on another thread.
    std::atomic<int> late{0};
    client->SendRequest(BuildCall("test.echo"), [&](const Value&, RequestId) { late += 100; },
                        [&](int32_t c, const WString&, RequestId) { late += c == kErrorConnectFailed ? 1 : 10; });
    ASSERT_TRUE(WaitFor([&] { return late.load() != 0; }, 5));
    EXPECT_EQ(late.load(), 1);
}

TEST_F(RpcTest, CloseHandlersRunOnceEvenWhenAddedLate) {
    std::atomic<int> first{0};
    std::atomic<int> removed{0};
    session->AddCloseHandler([&](const SessionPtr&, TransportError e) {
        if (e == TransportError::LocalClose) ++first;
    });
    const Guid gone = session->AddCloseHandler([&](const SessionPtr&, TransportError) { ++removed; });
    session->RemoveCloseHandler(gone);
    session->Close();
    session->Close();
    ASSERT_TRUE(WaitFor([&] { return first.load() == 1; }, 5));
    std::atomic<int> late{0};
    session->AddCloseHandler([&](const SessionPtr&, TransportError) { ++late; });
    ASSERT_TRUE(WaitFor([&] { return late.load() == 1; }, 5));
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    EXPECT_EQ(first.load(), 1);
    EXPECT_EQ(removed.load(), 0);
    EXPECT_EQ(late.load(), 1);
}

TEST_F(RpcTest, NotificationsArriveInOrder) {
    std::mutex mutex;
    std::vector<int64_t> seen;
    registrar->Register("test.note", std::make_shared<FunctionNotificationHandler>([&](const Value& args) {
                            std::lock_guard lock(mutex);
                            seen.push_back(args.at(0).get<int64_t>());
                        }));
    for (int i = 0; i < 500; ++i) client->SendNotification(BuildCall("test.note", Value::array({i})));
    ASSERT_TRUE(WaitFor([&] {
        std::lock_guard lock(mutex);
        return seen.size() == 500;
    }, 10));
    for (int i = 0; i < 500; ++i) EXPECT_EQ(seen[static_cast<size_t>(i)], i);
}

TEST_F(RpcTest, OKHandlerReportsAnUnreadableReplyAsAFailure) {
    registrar->Register("test.text", std::make_shared<FunctionRequestHandler>(
                                         [](const ResponderPtr& r, const Value&) { r->SendGeneralResult("text"); }));
    std::atomic<int> ok{0};
    std::atomic<int32_t> code{0};
    Gate gate;
    FailureFn fail = [&](int32_t c, const WString&, RequestId) {
        code = c;
        gate.Open();
    };
    client->SendRequest(BuildCall("test.text"), OKHandler<uint32_t>([&](uint32_t) { ++ok; gate.Open(); }, fail),
                        fail);
    ASSERT_TRUE(gate.Wait(10000));
    EXPECT_EQ(ok.load(), 0);
    EXPECT_EQ(code.load(), kErrorProtocol);
}

TEST_F(RpcTest, OversizedRequestIsRefusedLocally) {
    std::string big(wire::kMaxFrameSize + 1, 'x');
    auto [ok, err] = Call("test.echo", Value::array({big}));
    EXPECT_FALSE(ok);
    EXPECT_EQ(err["code"], kErrorRequestRefused);
    EXPECT_TRUE(Call("test.echo").first);
}

// Hand-made bytes: each bad input closes that connection only; nothing it sent is dispatched.
TEST_F(RpcTest, BadInputClosesOnlyTheOffendingConnection) {
    std::atomic<int> dispatched{0};
    registrar->Register("test.count", std::make_shared<FunctionNotificationHandler>(
                                          [&](const Value&) { ++dispatched; }));
    wire::Buffer note;
    wire::AppendNotification(note, "test.count", Value::array());

    auto expectClosed = [&](const std::vector<uint8_t>& bytes, bool hello, const char* what) {
        RawClient raw(server->GetPort());
        if (hello) raw.SendHello();
        raw.Send(bytes);
        EXPECT_TRUE(raw.ClosedWithin(10)) << what;
    };
    // Wrong secret, with a valid notification behind it.
    {
        auto hello = wire::MakeHello(wire::Secret{});
        hello.insert(hello.end(), note.begin(), note.end());
        expectClosed(hello, false, "wrong secret");
    }
    expectClosed({'G', 'E', 'T', ' ', '/', ' ', 'H', 'T', 'T', 'P', '/', '1', '.', '1', '\r', '\n',
                  '\r', '\n', 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0},
                 false, "not a hello");
    expectClosed({0xff, 0xff, 0xff, 0xff}, true, "length 0xFFFFFFFF");
    expectClosed({0, 0, 0, 0}, true, "length 0");
    expectClosed({3, 0, 0, 0, 0xc1, 0xc1, 0xc1}, true, "undecodable body");
    {
        std::vector<uint8_t> deep(4, 0);
        const uint32_t depth = 100000;
        for (uint32_t i = 0; i < depth; ++i) deep.push_back(0x91);
        deep.push_back(0xc0);
        const auto len = static_cast<uint32_t>(deep.size() - 4);
        for (int i = 0; i < 4; ++i) deep[static_cast<size_t>(i)] = static_cast<uint8_t>(len >> (8 * i));
        expectClosed(deep, true, "deep nesting");
    }
    {
        // Declares a 2^31-element array inside a short frame.
        std::vector<uint8_t> huge = {9, 0, 0, 0, 0x93, 0x02, 0xa1, 'x', 0xdd, 0x80, 0x00, 0x00, 0x00};
        expectClosed(huge, true, "huge declared count");
    }
    EXPECT_EQ(dispatched.load(), 0);

    // A connection that never says hello is closed by the server's handshake limit.
    {
        RawClient silent(server->GetPort());
        EXPECT_TRUE(silent.ClosedWithin(15));
    }
    // And the well-behaved client was served throughout.
    EXPECT_TRUE(Call("test.echo").first);
    client->SendNotification(BuildCall("test.count"));
    EXPECT_TRUE(WaitFor([&] { return dispatched.load() == 1; }, 5));
}

TEST(Transport, ClientStartGivesNullWhenNothingListens) {
    auto transport = SocketTransport::Create(CreateCPUBoundExecutor());
    auto server = transport->ServerStart(0, true);
    const uint16_t port = server->GetPort();
    server->Stop();
    server.reset();
    EXPECT_EQ(transport->ClientStart("127.0.0.1", port), nullptr);
    EXPECT_EQ(transport->ClientStart("127.0.0.1", 0), nullptr);
    EXPECT_EQ(transport->ClientStart("not-an-address", 80), nullptr);
}

}  // namespace

namespace {

// A callback that throws must not cost anyone else their callback, nor stop the session.
TEST_F(RpcTest, ThrowingCallbacksHarmNobodyElse) {
    std::atomic<int> later{0};
    Gate thrown;
    client->SendRequest(BuildCall("test.echo"), [&](const Value&, RequestId) {
        thrown.Open();
        throw std::runtime_error("caller bug");
    }, nullptr);
    ASSERT_TRUE(thrown.Wait(10000));
    EXPECT_TRUE(Call("test.echo").first) << "the session still reads";

    registrar->Register("test.never", std::make_shared<FunctionRequestHandler>(
                                          [keep = std::make_shared<std::vector<ResponderPtr>>()](
                                              const ResponderPtr& r, const Value&) { keep->push_back(r); }));
    for (int i = 0; i < 3; ++i) {
        client->SendRequest(BuildCall("test.never"), nullptr, [&](int32_t, const WString&, RequestId) {
            ++later;
            throw std::runtime_error("caller bug in a failure function");
        });
    }
    session->AddCloseHandler([&](const SessionPtr&, TransportError) { ++later; });
    ASSERT_TRUE(WaitFor([&] { return server->SessionCount() == 1; }, 5));
    session->Close();
    EXPECT_TRUE(WaitFor([&] { return later.load() == 4; }, 10));
}

}  // namespace
