// The process-wide coordination client: pending availability callbacks and their delivery.
#include <atomic>
#include <map>
#include <mutex>
#include <vector>

#include "platform/Sync.h"
#include "platform/Trace.h"
#include "processcoordination/LocalServer.h"
#include "tidelink/core/LinkManager.h"

namespace processcoordination {

using namespace tidelink::platform;

namespace {

constexpr const char* kCat = "processcoordination";

// Threading: any thread may call it; the mutex guards only the pending table and is never held
// while a callback runs or a message is sent.
class ClientImpl final : public ILocalServer::IAsyncCompletionClient {
public:
    ClientImpl() : mDeliveryExecutor(tidelink::GetSharedExecutor()), mLocalServer(CreateLocalServer(this)) {}

    ~ClientImpl() {
        if (mDeliveryExecutor) mDeliveryExecutor->WaitUntilIdle();
        mLocalServer.reset();
        // Deliveries posted while the server went away.
        if (mDeliveryExecutor) mDeliveryExecutor->WaitUntilIdle();
    }

    bool HasLocalServer() const { return mLocalServer != nullptr; }
    ILocalServer& Server() { return *mLocalServer; }
    ExecutorPtr GetDeliveryExecutor() const { return mDeliveryExecutor; }

    int GetBinaryDataWithAsyncNotification(const Guid& identifier, AvailabilityCallback callback,
                                           RegistrationCallback registered) {
        if (!callback) return -3;
        {
            RecursiveMutex::Guard guard(mMutex, "ClientImpl::GetBinaryDataWithAsyncNotification");
            mPending.emplace(identifier, std::move(callback));  // after any equal keys
        }
        const int result = mLocalServer->GetBinaryDataWhenAvailableAsync(identifier, std::move(registered));
        if (result != 0) {
            NotifyBinaryAvailability(identifier, nullptr, -1);
            return result;
        }
        return 0;
    }

    void NotifyBinaryAvailability(Guid identifier, BinaryReferencePtr reference, int result) override {
        mDeliveryExecutor->Post([this, identifier, reference, result] {
            DoNotifyBinaryAvailability(identifier, reference, result);
        });
    }

    void NotifyLostConnection() override {
        mDeliveryExecutor->Post([this] { DoNotifyLostConnection(); });
    }

    void FlushAllNotifications() { mDeliveryExecutor->WaitUntilIdle(); }

private:
    void DoNotifyBinaryAvailability(const Guid& identifier, const BinaryReferencePtr& reference, int result) {
        TL_TRACE(kCat, 10) << "Async ID: " << identifier.ToString() << " CoordinationResult: " << result;
        std::vector<AvailabilityCallback> calls;
        {
            RecursiveMutex::Guard guard(mMutex, "ClientImpl::DoNotifyBinaryAvailability");
            auto range = mPending.equal_range(identifier);
            for (auto it = range.first; it != range.second; ++it) calls.push_back(std::move(it->second));
            mPending.erase(range.first, range.second);
        }
        for (auto& call : calls) call(identifier, result == 0 ? reference : nullptr, result);
    }

    void DoNotifyLostConnection() {
        std::multimap<Guid, AvailabilityCallback> pending;
        {
            RecursiveMutex::Guard guard(mMutex, "ClientImpl::DoNotifyLostConnection");
            pending.swap(mPending);
        }
        for (auto& [identifier, callback] : pending) {
            TL_TRACE(kCat, 10) << "Async ID: " << identifier.ToString() << " - Remote object is gone.";
            mDeliveryExecutor->Post([identifier = identifier, callback = std::move(callback)] {
                callback(identifier, nullptr, -4);
            });
        }
    }

    RecursiveMutex mMutex;
    ExecutorPtr mDeliveryExecutor;
    std::unique_ptr<ILocalServer> mLocalServer;
    std::multimap<Guid, AvailabilityCallback> mPending;
};

struct Process {
    std::atomic<int> users{0};
    std::once_flag once;
    ExecutorPtr startup;
    std::mutex mutex;  // guards |client| and |delivery|
    std::shared_ptr<ClientImpl> client;
    ExecutorPtr delivery;
};

Process& TheProcess() {
    static auto* p = new Process();
    return *p;
}

void WaitForStartup() {
    Process& p = TheProcess();
    if (p.startup) p.startup->WaitUntilIdle();
}

// The client after start-up, or null.
std::shared_ptr<ClientImpl> Client() {
    WaitForStartup();
    Process& p = TheProcess();
    std::lock_guard lock(p.mutex);
    return p.client;
}

}  // namespace

bool InitializeClient() {
    Process& p = TheProcess();
    ++p.users;
    std::call_once(p.once, [&p] {
        p.startup = CreateSubExecutor(CreateCPUBoundExecutor(), 1);
        auto task = [&p] {
            auto delivery = tidelink::GetSharedExecutor();
            auto client = std::make_shared<ClientImpl>();
            std::lock_guard lock(p.mutex);
            p.delivery = delivery;
            if (client->HasLocalServer()) p.client = std::move(client);
        };
        if (p.startup) {
            p.startup->Post(task);
        } else {
            task();
        }
    });
    return true;
}

void UninitializeClient() {
    Process& p = TheProcess();
    if (--p.users > 0) return;
    WaitForStartup();
    std::shared_ptr<ClientImpl> client;
    {
        std::lock_guard lock(p.mutex);
        client.swap(p.client);
        p.delivery.reset();
    }
    client.reset();
}

int IsBinaryDataCurrentlyAvailable(const Guid& identifier) {
    auto c = Client();
    return c ? c->Server().IsBinaryDataCurrentlyAvailable(identifier) : -5;
}

int IsBinaryDataCurrentlyWanted(const Guid& identifier) {
    auto c = Client();
    return c ? c->Server().IsBinaryDataCurrentlyWanted(identifier) : -5;
}

int GetBinaryDataIfAvailable(const Guid& identifier, BinaryReferencePtr& out) {
    out.reset();
    auto c = Client();
    return c ? c->Server().GetBinaryDataIfAvailable(identifier, out) : -5;
}

int GetBinaryDataWithAsyncNotification(const Guid& identifier, AvailabilityCallback callback,
                                       RegistrationCallback registered) {
    auto c = Client();
    return c ? c->GetBinaryDataWithAsyncNotification(identifier, std::move(callback), std::move(registered)) : -5;
}

int GetBinaryDataOrRegisterNotification(const Guid& identifier, AvailabilityCallback callback, BinaryReferencePtr& out,
                                        RegistrationCallback registered) {
    out.reset();
    auto c = Client();
    if (!c) return -5;
    if (c->Server().GetBinaryDataIfAvailable(identifier, out) == 0) return 0;
    out.reset();
    return c->GetBinaryDataWithAsyncNotification(identifier, std::move(callback), std::move(registered));
}

void CancelAllOutstandingNotifications(const Guid& identifier, int code) {
    if (auto c = Client()) c->NotifyBinaryAvailability(identifier, nullptr, code);
}

void FlushAllNotifications() {
    if (auto c = Client()) c->FlushAllNotifications();
}

ExecutorPtr GetDeliveryExecutor() {
    auto c = Client();
    return c ? c->GetDeliveryExecutor() : nullptr;
}

int GetWritableBinaryData(uint64_t size, WritableBinaryReferencePtr& out) {
    auto c = Client();
    return c ? c->Server().GetWritableBinaryData(size, out) : -5;
}

int PutCompletedBinaryData(const Guid& identifier, WritableBinaryReferencePtr reference, bool handOver) {
    auto c = Client();
    return c ? c->Server().PutCompletedBinaryData(std::move(reference), identifier, handOver) : -5;
}

int PutBinaryDataGenerationError(const Guid& identifier, int error) {
    if (error != -6) TL_TRACE(kCat, 0) << "Error: " << error;
    auto c = Client();
    return c ? c->Server().PutBinaryDataGenerationError(identifier, error) : -5;
}

int MakeBinaryDataAlias(const Guid& identifier, BinaryReferencePtr reference, const Guid& alias) {
    auto c = Client();
    return c ? c->Server().CreateBinaryAlias(identifier, std::move(reference), alias) : -5;
}

int BeginBinaryDataGeneration(const Guid&, bool) { return Client() ? -2 : -5; }

}  // namespace processcoordination
