#include "processcoordination/LocalServer.h"

#include <map>
#include <set>

#include "platform/Rpc.h"
#include "platform/Sync.h"
#include "platform/Trace.h"
#include "processcoordination/Protocol.h"
#include "tidelink/core/LinkManager.h"

namespace processcoordination {

using namespace tidelink::platform;
namespace proto = tidelinkmanager::processcoordinationprotocol;

namespace {

constexpr const char* kCat = "processcoordination";

// Failure codes that mean the connection to the link manager is gone.
bool IsConnectionFailure(int32_t code) {
    return code == kErrorConnectFailed || code == kErrorSessionClosed || code == kErrorTransportShutdown;
}

// Ownership: the server belongs to the coordination client and outlives every reference it made
// (hosts release references before the last UninitializeClient). Transport handlers hold only a
// weak reference to the server's state, so one that runs after the server has gone does nothing.
class LocalServer final : public ILocalServer {
public:
    template <class Interface, class Pointer, int N>
    class LocalReference;
    using ReadReference = LocalReference<BinaryReference, const void*, 1>;
    using WriteReference = LocalReference<WritableBinaryReference, void*, 1>;

    explicit LocalServer(IAsyncCompletionClient* client, RPCClientPtr rpc);
    ~LocalServer() override;

    bool ProperlyInitialized();

    int IsBinaryDataCurrentlyAvailable(const Guid& identifier) override;
    int IsBinaryDataCurrentlyWanted(const Guid& identifier) override;
    int GetBinaryDataIfAvailable(const Guid& identifier, BinaryReferencePtr& out) override;
    int GetBinaryDataWhenAvailableAsync(const Guid& identifier, RegistrationCallback registered) override;
    int CreateBinaryAlias(const Guid& identifier, BinaryReferencePtr reference, const Guid& alias) override;
    int GetWritableBinaryData(uint64_t size, WritableBinaryReferencePtr& out) override;
    int PutCompletedBinaryData(WritableBinaryReferencePtr reference, const Guid& identifier,
                               bool handOver) override;
    int PutBinaryDataGenerationError(const Guid& identifier, int error) override;

    RecursiveMutex& Mutex() { return mMutex; }
    void ReferenceGoingAway(const std::string& name);
    void WritableReferenceGoingAway(const std::string& name);

private:
    // What transport handlers may reach: alive while the server is.
    struct Link {
        std::mutex mutex;
        LocalServer* server = nullptr;
    };

    void BinaryDataArrived(const proto::BinaryReferencesAvailable& list);
    void ConnectionLost();
    // Sends |call| and waits for its answer; |decode| reads the reply. Returns after the reply
    // or the failure has been handled.
    void SyncRequest(const Call& call, const char* what, const std::function<void(const Value&)>& decode);
    void Send(const Call& call);

    int LocalLookup(const Guid& identifier, BinaryReferencePtr& out);
    int LookupByName(const Guid& identifier, const std::string& name, BinaryReferencePtr& out);
    BinaryReferencePtr CreateReadReference(const Guid& identifier, const std::string& name, uint64_t size);
    void Associate(const Guid& identifier, const std::string& name);
    Call TakeDrop(const std::string& name);

    RecursiveMutex mMutex;
    IAsyncCompletionClient* mClient;
    SessionPtr mSession;
    RPCClientPtr mRpcClient;
    std::shared_ptr<Link> mLink;
    Guid mCloseHandler;
    std::set<std::string> mHeldFiles;
    std::map<Guid, std::string> mIdentifierToFile;
    std::multimap<std::string, Guid> mFileToIdentifiers;
    std::map<std::string, boost::weak_ptr<ReadReference>> mReadOnlyReferences;
    std::map<std::string, boost::weak_ptr<WriteReference>> mWritableReferences;
};

template <class Interface, class Pointer, int N>
class LocalServer::LocalReference final : public Interface {
public:
    LocalReference(LocalServer* owner, std::string name, uint64_t size)
        : mOwner(owner), mName(std::move(name)), mSize(size), mMapSize(size) {}

    ~LocalReference() override {
        if (mName.empty()) return;
        {
            RecursiveMutex::Guard guard(mOwner->Mutex(), "LocalReference::~LocalReference");
            if (mMemoryMappedFile) ReturnCachedMemoryMappedFile(mName, std::move(mMemoryMappedFile));
        }
        if constexpr (std::is_same_v<Interface, BinaryReference>) {
            mOwner->ReferenceGoingAway(mName);
        } else {
            mOwner->WritableReferenceGoingAway(mName);
        }
    }

    uint64_t GetSize() override { return mSize; }

    Pointer MapIntoCurrentProcess() override {
        RecursiveMutex::Guard guard(mOwner->Mutex(), "LocalReference::MapIntoCurrentProcess");
        if (mName.empty()) return nullptr;  // handed over: the data are no longer ours
        if (++mMapCount == 1) {
            if (mMemoryMappedFile) throw ContractViolation();
            mMemoryMappedFile = GetCachedMemoryMappedFile(mName, mMapSize, true);
            if (!mMemoryMappedFile) {
                --mMapCount;
                return nullptr;
            }
        }
        return static_cast<Pointer>(mMemoryMappedFile->GetAddress());
    }

    void UnmapFromCurrentProcess(Pointer inData) override {
        RecursiveMutex::Guard guard(mOwner->Mutex(), "LocalReference::UnmapFromCurrentProcess");
        // Handed over: its mapping went back then, and the producer's unmap has nothing to undo.
        if (mName.empty()) return;
        if (!mMemoryMappedFile || mMemoryMappedFile->GetAddress() != inData) throw ContractViolation();
        if (--mMapCount == 0) ReturnCachedMemoryMappedFile(mName, std::move(mMemoryMappedFile));
    }

    const std::string& Name() const { return mName; }

    // Hand-over: the mapping goes back and the reference leaves every table.
    void Detach() {
        if (mMemoryMappedFile) ReturnCachedMemoryMappedFile(mName, std::move(mMemoryMappedFile));
        mMapCount = 0;
        mName.clear();
    }

private:
    LocalServer* mOwner;
    std::string mName;
    uint64_t mSize;
    uint64_t mMapSize;
    std::unique_ptr<MemoryMappedFile> mMemoryMappedFile;
    uint32_t mMapCount = 0;
};

LocalServer::LocalServer(IAsyncCompletionClient* client, RPCClientPtr rpc)
    : mClient(client), mSession(rpc ? rpc->GetSession() : nullptr), mRpcClient(std::move(rpc)),
      mLink(std::make_shared<Link>()) {
    mLink->server = this;
    std::weak_ptr<Link> weak = mLink;
    MessageRegistrar::Instance()->Register(
        proto::kBinaryDataArrived, std::make_shared<FunctionNotificationHandler>([weak](const Value& args) {
            auto link = weak.lock();
            if (!link) return;
            const auto list = args.at(0).get<proto::BinaryReferencesAvailable>();
            std::lock_guard lock(link->mutex);
            if (link->server) link->server->BinaryDataArrived(list);
        }));
    if (mSession) {
        mSession->SetDispatcher(MessageRegistrar::Instance());
        // A lost connection completes every pending wait; the manager has forgotten them.
        mCloseHandler = mSession->AddCloseHandler([weak](const SessionPtr&, TransportError) {
            auto link = weak.lock();
            if (!link) return;
            std::lock_guard lock(link->mutex);
            if (link->server) link->server->ConnectionLost();
        });
    }
}

LocalServer::~LocalServer() {
    {
        std::lock_guard lock(mLink->mutex);
        mLink->server = nullptr;
    }
    MessageRegistrar::Instance()->UnRegister(proto::kBinaryDataArrived);
    if (mSession) {
        mSession->RemoveCloseHandler(mCloseHandler);
        mSession->Close();
    }
}

bool LocalServer::ProperlyInitialized() {
    RecursiveMutex::Guard guard(mMutex, "LocalServer::ProperlyInitialized");
    return mClient != nullptr && mSession != nullptr;
}

void LocalServer::ConnectionLost() { mClient->NotifyLostConnection(); }

void LocalServer::Send(const Call& call) {
    if (mRpcClient) mRpcClient->SendNotification(call);
}

void LocalServer::SyncRequest(const Call& call, const char* what, const std::function<void(const Value&)>& decode) {
    auto rendezvous = std::make_shared<SyncPoint>(2);
    std::weak_ptr<Link> weak = mLink;
    SessionPtr session = mSession;
    mRpcClient->SendRequest(
        call,
        [rendezvous, &decode](const Value& reply, RequestId) {
            try {
                decode(reply);
            } catch (const std::exception& e) {
                TL_TRACE(kCat, 1) << "Unreadable reply: " << e.what();
            }
            rendezvous->Arrive();
        },
        [rendezvous, weak, session, what](int32_t code, const WString& message, RequestId) {
            TL_TRACE(kCat, 3) << what << " failed: " << code << " " << ToUTF8(message);
            if (session && (!session->IsOpen() || IsConnectionFailure(code))) {
                if (auto link = weak.lock()) {
                    std::lock_guard lock(link->mutex);
                    if (link->server) link->server->ConnectionLost();
                }
            }
            rendezvous->Arrive();
        });
    rendezvous->Arrive();
}

// ---- tables (under mMutex) ----

void LocalServer::Associate(const Guid& identifier, const std::string& name) {
    mIdentifierToFile[identifier] = name;
    mFileToIdentifiers.emplace(name, identifier);
}

BinaryReferencePtr LocalServer::CreateReadReference(const Guid& identifier, const std::string& name,
                                                    uint64_t size) {
    boost::shared_ptr<ReadReference> ref(new ReadReference(this, name, size));
    mReadOnlyReferences[name] = ref;
    Associate(identifier, name);
    return ref;
}

int LocalServer::LookupByName(const Guid& identifier, const std::string& name, BinaryReferencePtr& out) {
    if (auto it = mReadOnlyReferences.find(name); it != mReadOnlyReferences.end()) {
        if (auto live = it->second.lock()) {
            out = live;
            Associate(identifier, name);
            return 0;
        }
    }
    if (auto it = mWritableReferences.find(name); it != mWritableReferences.end()) {
        if (auto live = it->second.lock()) {
            out = CreateReadReference(identifier, name, live->GetSize());
            return 0;
        }
    }
    return -1;
}

int LocalServer::LocalLookup(const Guid& identifier, BinaryReferencePtr& out) {
    auto it = mIdentifierToFile.find(identifier);
    if (it == mIdentifierToFile.end()) return -1;
    const std::string name = it->second;
    return LookupByName(identifier, name, out);
}

Call LocalServer::TakeDrop(const std::string& name) {
    std::set<Guid> ids;
    auto range = mFileToIdentifiers.equal_range(name);
    for (auto it = range.first; it != range.second; ++it) ids.insert(it->second);
    mFileToIdentifiers.erase(range.first, range.second);
    Value list = Value::array();
    for (const Guid& id : ids) list.push_back(id.ToString());
    return BuildCall(proto::kDropReferenceToBinaryData, Value::array({name, list}));
}

void LocalServer::ReferenceGoingAway(const std::string& name) {
    Call drop;
    {
        RecursiveMutex::Guard guard(mMutex, "LocalServer::ReferenceGoingAway");
        auto it = mReadOnlyReferences.find(name);
        if (it == mReadOnlyReferences.end() || !it->second.expired()) return;
        mReadOnlyReferences.erase(it);
        auto range = mFileToIdentifiers.equal_range(name);
        for (auto i = range.first; i != range.second; ++i) {
            auto f = mIdentifierToFile.find(i->second);
            if (f != mIdentifierToFile.end() && f->second == name) mIdentifierToFile.erase(f);
        }
        if (auto w = mWritableReferences.find(name); w != mWritableReferences.end() && !w->second.expired()) return;
        mHeldFiles.erase(name);
        drop = TakeDrop(name);
    }
    Send(drop);
}

void LocalServer::WritableReferenceGoingAway(const std::string& name) {
    Call drop;
    {
        RecursiveMutex::Guard guard(mMutex, "LocalServer::WritableReferenceGoingAway");
        if (auto w = mWritableReferences.find(name); w != mWritableReferences.end() && w->second.expired()) {
            mWritableReferences.erase(w);
        }
        if (auto r = mReadOnlyReferences.find(name); r != mReadOnlyReferences.end() && !r->second.expired()) return;
        mHeldFiles.erase(name);
        drop = TakeDrop(name);
    }
    Send(drop);
}

// ---- operations ----

int LocalServer::IsBinaryDataCurrentlyAvailable(const Guid& identifier) {
    BinaryReferencePtr temporary;
    {
        RecursiveMutex::Guard guard(mMutex, "LocalServer::IsBinaryDataCurrentlyAvailable");
        if (LocalLookup(identifier, temporary) == 0) return 0;
    }
    const int result = GetBinaryDataIfAvailable(identifier, temporary);
    temporary.reset();
    return result;
}

int LocalServer::IsBinaryDataCurrentlyWanted(const Guid& identifier) {
    bool wanted = false;
    SyncRequest(BuildCall(proto::kIsBinaryDataCurrentlyWanted, Value::array({identifier.ToString()})),
                "IsBinaryDataCurrentlyWanted",
                [&](const Value& reply) { wanted = proto::ReadBoolean(reply.value("value", Value())); });
    return wanted ? 0 : -1;
}

int LocalServer::GetBinaryDataIfAvailable(const Guid& identifier, BinaryReferencePtr& out) {
    {
        RecursiveMutex::Guard guard(mMutex, "LocalServer::GetBinaryDataIfAvailable");
        if (LocalLookup(identifier, out) == 0) return 0;
    }
    proto::BinaryReferenceDescription answer;
    SyncRequest(BuildCall(proto::kGetBinaryDataIfAvailable, Value::array({identifier.ToString()})),
                "GetBinaryDataIfAvailable", [&](const Value& reply) {
                    answer = ReplyValue<proto::BinaryReferenceDescription>(reply);
                });
    if (answer.result == 0) {
        RecursiveMutex::Guard guard(mMutex, "LocalServer::GetBinaryDataIfAvailable2");
        if (LocalLookup(identifier, out) != 0 && LookupByName(identifier, answer.filename, out) != 0) {
            out = CreateReadReference(identifier, answer.filename, answer.size);
        }
        mHeldFiles.insert(answer.filename);
    }
    return answer.result;
}

int LocalServer::GetBinaryDataWhenAvailableAsync(const Guid& identifier, RegistrationCallback registered) {
    TL_TRACE(kCat, 10) << "Request binary ID: " << identifier.ToString();
    {
        BinaryReferencePtr found;
        RecursiveMutex::Guard guard(mMutex, "LocalServer::GetBinaryDataWhenAvailableAsync");
        if (LocalLookup(identifier, found) == 0) {
            mClient->NotifyBinaryAvailability(identifier, found, 0);
            return 0;
        }
    }
    std::shared_ptr<Gate> gate;
    if (!registered) gate = std::make_shared<Gate>(false);
    std::weak_ptr<Link> weak = mLink;
    SessionPtr session = mSession;
    mRpcClient->SendRequest(
        BuildCall(proto::kGetBinaryDataWhenAvailable, Value::array({identifier.ToString()})),
        [registered, gate, session](const Value&, RequestId) {
            if (registered && !(session && !session->IsOpen())) registered();
            if (gate) gate->Open();
        },
        [weak, gate, session, identifier](int32_t code, const WString&, RequestId) {
            if (auto link = weak.lock()) {
                std::lock_guard lock(link->mutex);
                if (link->server) {
                    // On a lost connection every pending wait completes with -4; a refusal on a
                    // live one completes this identifier's with -1.
                    if (!session || !session->IsOpen() || IsConnectionFailure(code)) {
                        link->server->ConnectionLost();
                    } else {
                        link->server->mClient->NotifyBinaryAvailability(identifier, nullptr, -1);
                    }
                }
            }
            if (gate) gate->Open();
        });
    if (gate) gate->Wait(24 * 3600 * 1000);
    return 0;
}

void LocalServer::BinaryDataArrived(const proto::BinaryReferencesAvailable& list) {
    for (const auto& item : list) {
        BinaryReferencePtr reference;
        if (item.reference.result == 0) {
            if (item.reference.filename.empty()) continue;  // not data: nothing could map it
            RecursiveMutex::Guard guard(mMutex, "LocalServer::ReferenceGoingAway");
            if (LocalLookup(item.identifier, reference) != 0 &&
                LookupByName(item.identifier, item.reference.filename, reference) != 0) {
                reference = CreateReadReference(item.identifier, item.reference.filename, item.reference.size);
            }
            mHeldFiles.insert(item.reference.filename);
        }
        mClient->NotifyBinaryAvailability(item.identifier, reference, item.reference.result);
    }
}

int LocalServer::CreateBinaryAlias(const Guid& identifier, BinaryReferencePtr reference, const Guid& alias) {
    auto* local = dynamic_cast<ReadReference*>(reference.get());
    if (local == nullptr) return -3;
    std::string name;
    {
        RecursiveMutex::Guard guard(mMutex, "LocalServer::CreateBinaryAlias");
        name = local->Name();
        Associate(alias, name);
    }
    Send(BuildCall(proto::kCreateBinaryDataAlias, Value::array({identifier.ToString(), name, alias.ToString()})));
    return 0;
}

int LocalServer::GetWritableBinaryData(uint64_t size, WritableBinaryReferencePtr& out) {
    proto::BinaryReferenceDescription answer;
    SyncRequest(BuildCall(proto::kAllocateBinaryData, Value::array({size})), "GetWritableBinaryData",
                [&](const Value& reply) { answer = ReplyValue<proto::BinaryReferenceDescription>(reply); });
    if (answer.result == 0) {
        RecursiveMutex::Guard guard(mMutex, "LocalServer::GetWritableBinaryData");
        boost::shared_ptr<WriteReference> ref(new WriteReference(this, answer.filename, answer.size));
        mWritableReferences[answer.filename] = ref;
        out = ref;
        mHeldFiles.insert(answer.filename);
    }
    return answer.result;
}

int LocalServer::PutCompletedBinaryData(WritableBinaryReferencePtr reference, const Guid& identifier,
                                        bool handOver) {
    auto* local = dynamic_cast<WriteReference*>(reference.get());
    if (local == nullptr) return -3;
    std::string name;
    if (handOver) {
        RecursiveMutex::Guard guard(mMutex, "LocalReference::DropLocalReference");
        name = local->Name();
        if (name.empty()) return -3;  // handed over already
        local->Detach();
        mReadOnlyReferences.erase(name);
        mWritableReferences.erase(name);
        mHeldFiles.erase(name);
    } else {
        RecursiveMutex::Guard guard(mMutex, "LocalServer::AssociateWritableBinaryWithIdentifier");
        name = local->Name();
        if (name.empty()) return -3;
        Associate(identifier, name);
    }
    TL_TRACE(kCat, 10) << "Publishing binary ID: " << identifier.ToString();
    Send(BuildCall(proto::kPublishBinaryData, Value::array({name, identifier.ToString(), handOver})));
    return 0;
}

int LocalServer::PutBinaryDataGenerationError(const Guid& identifier, int error) {
    TL_TRACE(kCat, 10) << "Binary data generation error for binary ID: " << identifier.ToString()
                       << " GenerationError: " << error;
    Send(BuildCall(proto::kPublishBinaryDataGenerationError, Value::array({identifier.ToString(), error})));
    return 0;
}

}  // namespace

std::unique_ptr<ILocalServer> CreateLocalServer(ILocalServer::IAsyncCompletionClient* client) {
    RPCClientPtr rpc;
    try {
        rpc = tidelink::LaunchTidelinkManagerRPC();
    } catch (const std::exception& e) {
        TL_TRACE(kCat, 0) << "processcoordination::CreateLocalServer: " << e.what();
        return nullptr;
    }
    if (!rpc) return nullptr;
    auto server = std::make_unique<LocalServer>(client, rpc);
    if (!server->ProperlyInitialized()) return nullptr;
    return server;
}

bool DescribeWritableBinaryData(const WritableBinaryReferencePtr& reference, std::string& name, uint64_t& size) {
    auto* local = dynamic_cast<LocalServer::WriteReference*>(reference.get());
    if (!local || local->Name().empty()) return false;
    name = local->Name();
    size = local->GetSize();
    return true;
}

}  // namespace processcoordination
