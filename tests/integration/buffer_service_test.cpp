// The link manager's buffer service, driven with plain requests over separate connections, as
// producers and consumers in other processes would.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdlib>
#include <cstring>
#include <mutex>

#include "Harness.h"
#include "platform/Rpc.h"
#include "platform/SharedMemory.h"
#include "platform/Sync.h"
#include "processcoordination/Protocol.h"
#include "tidelink/core/LinkManager.h"

using namespace tidelink;
using namespace tidelink::platform;
using namespace tidelink::test;
using namespace tidelinkmanager::processcoordinationprotocol;

namespace {

// One connection to the manager: sends requests and notifications and collects the data-arrived
// notifications it receives.
class Connection : public MessageDispatcher, public std::enable_shared_from_this<Connection> {
    struct Forwarder : MessageDispatcher {
        explicit Forwarder(const std::shared_ptr<Connection>& c) : target(c) {}
        void OnRequest(const SessionPtr& s, RequestId id, const std::string& n, const Value& a) override {
            if (auto t = target.lock()) t->OnRequest(s, id, n, a);
        }
        void OnNotification(const SessionPtr& s, const std::string& n, const Value& a) override {
            if (auto t = target.lock()) t->OnNotification(s, n, a);
        }
        std::weak_ptr<Connection> target;
    };

public:
    static std::shared_ptr<Connection> Open() {
        auto c = std::make_shared<Connection>();
        c->mSession = GetSharedTransport()->ClientStart("127.0.0.1", GetPortForTideLinkManager());
        EXPECT_TRUE(c->mSession);
        // The session holds its dispatcher; a weak forwarder keeps it from holding us.
        if (c->mSession) c->mSession->SetDispatcher(std::make_shared<Forwarder>(c));
        return c;
    }
    ~Connection() override { Close(); }
    void Close() {
        if (mSession) mSession->Close();
    }

    // Sends a request and waits for its reply ("value" of it); a failure gives null.
    Value Request(const std::string& name, Value args = Value::array()) {
        struct State {
            Gate gate;
            Value reply;
        };
        auto state = std::make_shared<State>();
        mSession->SendRequest(
            BuildCall(name, std::move(args)),
            [state](const Value& reply, RequestId) {
                state->reply = reply.value("value", Value());
                state->gate.Open();
            },
            [state](int32_t, const WString&, RequestId) { state->gate.Open(); });
        EXPECT_TRUE(state->gate.Wait(10000));
        return state->reply;
    }
    void Notify(const std::string& name, Value args) { mSession->SendNotification(BuildCall(name, std::move(args))); }

    BinaryReferenceDescription Allocate(uint64_t size) {
        return Request(kAllocateBinaryData, Value::array({size})).get<BinaryReferenceDescription>();
    }
    BinaryReferenceDescription IfAvailable(const Guid& id) {
        return Request(kGetBinaryDataIfAvailable, Value::array({id.ToString()})).get<BinaryReferenceDescription>();
    }
    bool WhenAvailable(const Guid& id) {
        return Request(kGetBinaryDataWhenAvailable, Value::array({id.ToString()})) == Value(true);
    }
    // Also a round trip: notifications sent before it have been handled when it returns.
    bool Wanted(const Guid& id) {
        return ReadBoolean(Request(kIsBinaryDataCurrentlyWanted, Value::array({id.ToString()})));
    }
    void Publish(const std::string& file, const Guid& id, bool handOver) {
        Notify(kPublishBinaryData, Value::array({file, id.ToString(), handOver}));
    }
    void Drop(const std::string& file, std::vector<Guid> ids) {
        Value list = Value::array();
        for (const auto& id : ids) list.push_back(id.ToString());
        Notify(kDropReferenceToBinaryData, Value::array({file, list}));
    }
    void Sync() { Wanted(Guid::New()); }

    // The arrivals received so far for |id|.
    std::vector<BinaryReferenceDescription> Arrived(const Guid& id) {
        std::lock_guard lock(mMutex);
        std::vector<BinaryReferenceDescription> out;
        for (const auto& a : mArrived) {
            if (a.identifier == id) out.push_back(a.reference);
        }
        return out;
    }
    bool WaitArrived(const Guid& id, size_t count = 1) {
        return WaitFor([&] { return Arrived(id).size() >= count; }, 10);
    }

    void OnRequest(const SessionPtr& s, RequestId id, const std::string&, const Value&) override {
        s->SendErrorReply(id, kErrorRequestRefused, "no requests here");
    }
    void OnNotification(const SessionPtr&, const std::string& name, const Value& args) override {
        if (name != kBinaryDataArrived) return;
        auto list = args.at(0).get<BinaryReferencesAvailable>();
        std::lock_guard lock(mMutex);
        for (auto& a : list) mArrived.push_back(a);
    }

private:
    SessionPtr mSession;
    std::mutex mMutex;
    BinaryReferencesAvailable mArrived;
};

Value Buffers() {
    auto c = Connection::Open();
    return c->Request(kManagerInfoMessage).value("buffers", Value::object());
}

uint64_t Live() { return Buffers().value("buffers_live", uint64_t{99}); }

class BufferServiceTest : public ::testing::Test {
protected:
    void TearDown() override {
        StopOurManagers();
        EXPECT_TRUE(OurSharedMemory().empty()) << "the manager left shared memory behind";
    }
};

void Fill(const BinaryReferenceDescription& d, uint8_t seed) {
    MemoryMappedFile m;
    ASSERT_TRUE(m.Open(d.filename, d.size, kMMFWritable));
    auto* p = static_cast<uint8_t*>(m.GetAddress());
    for (uint64_t i = 0; i < d.size; ++i) p[i] = static_cast<uint8_t>(seed + i);
}

bool Holds(const BinaryReferenceDescription& d, uint8_t seed) {
    MemoryMappedFile m;
    if (!m.Open(d.filename, d.size, kMMFReadOnly)) return false;
    auto* p = static_cast<const uint8_t*>(m.GetAddress());
    for (uint64_t i = 0; i < d.size; ++i) {
        if (p[i] != static_cast<uint8_t>(seed + i)) return false;
    }
    return true;
}

TEST_F(BufferServiceTest, HandOverReachesTheWaiterAndTheBufferComesBackUnderItsName) {
    auto producer = Connection::Open();
    auto consumer = Connection::Open();
    const Guid frame = Guid::New();

    const auto a = producer->Allocate(1 << 20);
    ASSERT_EQ(a.result, 0);
    EXPECT_EQ(a.size, 1u << 20);
    EXPECT_EQ(a.filename.rfind("tlmbuf-", 0), 0u);
    EXPECT_TRUE(a.filename.ends_with("-" + CSVersionPortNumberString())) << a.filename;
    struct stat st {};
    ASSERT_EQ(::stat(("/dev/shm/" + a.filename).c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
    EXPECT_EQ(static_cast<uint64_t>(st.st_size), a.size);
    EXPECT_GE(static_cast<uint64_t>(st.st_blocks) * 512, a.size) << "pages reserved at allocation";
    Fill(a, 7);

    EXPECT_FALSE(consumer->Wanted(frame));
    ASSERT_TRUE(consumer->WhenAvailable(frame));
    EXPECT_TRUE(producer->Wanted(frame));
    EXPECT_EQ(consumer->IfAvailable(frame).result, -1);

    producer->Publish(a.filename, frame, true);
    ASSERT_TRUE(consumer->WaitArrived(frame));
    const auto got = consumer->Arrived(frame)[0];
    EXPECT_EQ(got.result, 0);
    EXPECT_EQ(got.filename, a.filename);
    EXPECT_EQ(got.size, a.size);
    EXPECT_TRUE(Holds(got, 7));
    EXPECT_FALSE(consumer->Wanted(frame));
    EXPECT_EQ(Live(), 1u);

    // The consumer was the last holder: the buffer goes to the pool and its identifier is
    // forgotten.
    consumer->Drop(got.filename, {frame});
    consumer->Sync();
    const Value figures = Buffers();
    EXPECT_EQ(figures["buffers_live"], 0);
    EXPECT_EQ(figures["buffers_pooled"], 1);
    EXPECT_EQ(figures["bytes_pooled"], 1 << 20);
    EXPECT_EQ(consumer->IfAvailable(frame).result, -1);

    // The same size comes back under the same name, without a new object; another size does not.
    const auto again = producer->Allocate(1 << 20);
    EXPECT_EQ(again.filename, a.filename);
    const auto other = producer->Allocate(1 << 19);
    EXPECT_NE(other.filename, a.filename);
    EXPECT_EQ(Buffers()["objects_created"], 2);
}

TEST_F(BufferServiceTest, TwoWaitersBothReceiveAndTheBufferLivesUntilBothDrop) {
    auto producer = Connection::Open();
    auto first = Connection::Open();
    auto second = Connection::Open();
    const Guid frame = Guid::New();
    ASSERT_TRUE(first->WhenAvailable(frame));
    ASSERT_TRUE(second->WhenAvailable(frame));
    ASSERT_TRUE(second->WhenAvailable(frame));  // a repeated wait is one wait

    const auto a = producer->Allocate(200000);
    Fill(a, 3);
    producer->Publish(a.filename, frame, true);
    ASSERT_TRUE(first->WaitArrived(frame));
    ASSERT_TRUE(second->WaitArrived(frame));
    second->Sync();
    EXPECT_EQ(second->Arrived(frame).size(), 1u);

    first->Drop(a.filename, {frame});
    first->Sync();
    EXPECT_EQ(Live(), 1u);
    EXPECT_TRUE(Holds(second->Arrived(frame)[0], 3));
    second->Drop(a.filename, {frame});
    second->Sync();
    EXPECT_EQ(Live(), 0u);
}

TEST_F(BufferServiceTest, LateWaitersErrorsAndAliases) {
    auto producer = Connection::Open();
    auto consumer = Connection::Open();
    const Guid frame = Guid::New(), alias = Guid::New(), failed = Guid::New(), zero = Guid::New();

    // Kept by the producer (no hand-over): a late wait is answered at once.
    const auto a = producer->Allocate(150000);
    producer->Publish(a.filename, frame, false);
    ASSERT_TRUE(consumer->WhenAvailable(frame));
    ASSERT_TRUE(consumer->WaitArrived(frame));
    EXPECT_EQ(consumer->Arrived(frame)[0].filename, a.filename);

    // An alias made by a holder reaches those who wait for it.
    ASSERT_TRUE(consumer->WhenAvailable(alias));
    consumer->Notify(kCreateBinaryDataAlias, Value::array({frame.ToString(), a.filename, alias.ToString()}));
    ASSERT_TRUE(consumer->WaitArrived(alias));
    EXPECT_EQ(consumer->Arrived(alias)[0].filename, a.filename);

    // Errors reach waiters with their code; a "success" error is no data and reads -1.
    ASSERT_TRUE(consumer->WhenAvailable(failed));
    ASSERT_TRUE(consumer->WhenAvailable(zero));
    producer->Notify(kPublishBinaryDataGenerationError, Value::array({failed.ToString(), -6}));
    producer->Notify(kPublishBinaryDataGenerationError, Value::array({zero.ToString(), 0}));
    ASSERT_TRUE(consumer->WaitArrived(failed));
    ASSERT_TRUE(consumer->WaitArrived(zero));
    EXPECT_EQ(consumer->Arrived(failed)[0].result, -6);
    EXPECT_TRUE(consumer->Arrived(failed)[0].filename.empty());
    EXPECT_EQ(consumer->Arrived(zero)[0].result, -1);
    EXPECT_EQ(consumer->IfAvailable(failed).result, -6);

    // One drop listing both identifiers lets the consumer go; the producer still holds it.
    consumer->Drop(a.filename, {frame, alias});
    producer->Drop(a.filename, {frame});
    producer->Sync();
    consumer->Sync();
    EXPECT_EQ(Live(), 0u);
    EXPECT_EQ(consumer->IfAvailable(alias).result, -1);
}

TEST_F(BufferServiceTest, ClientsCannotTouchWhatTheyDoNotHold) {
    auto owner = Connection::Open();
    auto stranger = Connection::Open();
    const Guid frame = Guid::New(), stolen = Guid::New();
    const auto a = owner->Allocate(100000);
    ASSERT_EQ(a.result, 0);

    stranger->Drop(a.filename, {});
    stranger->Publish(a.filename, stolen, true);
    stranger->Notify(kCreateBinaryDataAlias, Value::array({frame.ToString(), a.filename, stolen.ToString()}));
    stranger->Publish("../../etc/passwd", stolen, true);
    stranger->Drop("tlmbuf-nothing", {frame});
    stranger->Notify(kDropReferenceToBinaryData, Value::array({42, "x"}));
    stranger->Sync();
    EXPECT_EQ(Live(), 1u);
    EXPECT_EQ(stranger->IfAvailable(stolen).result, -1);
    // Sizes that make no sense are refused.
    EXPECT_NE(stranger->Allocate(0).result, 0);
    EXPECT_NE(stranger->Request(kAllocateBinaryData, Value::array({-5})).value("result", 0), 0);
    EXPECT_NE(stranger->Request(kAllocateBinaryData, Value::array({"big"})).value("result", 0), 0);

    owner->Publish(a.filename, frame, false);
    owner->Sync();  // the publication travels on another connection
    EXPECT_EQ(stranger->IfAvailable(frame).result, 0);
}

TEST_F(BufferServiceTest, PerClientCapRefusesAndPublishingFreesRoom) {
    ::setenv("TIDELINK_BUFFER_CLIENT_CAP", "3000000", 1);
    auto producer = Connection::Open();
    auto other = Connection::Open();
    const auto a = producer->Allocate(2000000);
    ASSERT_EQ(a.result, 0);
    EXPECT_EQ(producer->Allocate(2000000).result, -1);
    EXPECT_EQ(producer->Allocate(uint64_t{1} << 62).result, -1);
    EXPECT_EQ(other->Allocate(2000000).result, 0) << "the cap is per client";
    producer->Publish(a.filename, Guid::New(), false);
    EXPECT_EQ(producer->Allocate(2000000).result, 0);
    ::unsetenv("TIDELINK_BUFFER_CLIENT_CAP");
}

TEST_F(BufferServiceTest, ClosingAConnectionReleasesWhatItHeldAndForgetsItsWaits) {
    auto producer = Connection::Open();
    auto consumer = Connection::Open();
    const Guid frame = Guid::New(), pending = Guid::New();
    const auto kept = producer->Allocate(100000);
    const auto unpublished = producer->Allocate(100000);
    ASSERT_EQ(unpublished.result, 0);
    ASSERT_TRUE(consumer->WhenAvailable(frame));
    ASSERT_TRUE(consumer->WhenAvailable(pending));
    producer->Publish(kept.filename, frame, false);
    ASSERT_TRUE(consumer->WaitArrived(frame));
    EXPECT_EQ(Buffers()["clients"], 2);

    producer->Close();
    ASSERT_TRUE(WaitFor([] { return Live() == 1; }, 10)) << "the consumer still holds one";
    consumer->Close();
    ASSERT_TRUE(WaitFor([] { return Live() == 0; }, 10));
    auto observer = Connection::Open();
    EXPECT_FALSE(observer->Wanted(pending));
    EXPECT_EQ(Buffers()["clients"], 0);
}

TEST_F(BufferServiceTest, UnclaimedHandOversGoAfterTheirRetentionTime) {
    ::setenv("TIDELINK_BUFFER_RETENTION", "1", 1);
    auto producer = Connection::Open();
    const auto a = producer->Allocate(100000);
    const Guid frame = Guid::New();
    producer->Publish(a.filename, frame, true);
    producer->Sync();
    EXPECT_EQ(producer->IfAvailable(frame).result, 0);
    producer->Drop(a.filename, {frame});
    EXPECT_EQ(Live(), 1u) << "held by the manager";
    EXPECT_TRUE(WaitFor([] { return Live() == 0; }, 10));
    EXPECT_EQ(producer->IfAvailable(frame).result, -1);
    ::unsetenv("TIDELINK_BUFFER_RETENTION");
}

}  // namespace
