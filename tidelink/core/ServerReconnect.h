// The connection to one peer server, shared by every object reached through it (the server, its
// projects, containers, sources and renderers). All their requests go through it. It holds the
// direct client to the peer and the client to the link manager, remembers what is open on the
// peer, notices when the peer goes away, re-establishes the link through the link manager, opens
// the same project or asset again, tells every dependent through status callbacks, and holds
// requests back meanwhile.
//
// Threading: every method may be called from any thread. Status callbacks run on transport or
// executor threads, never with a lock of this object held. Three locks: the status callbacks,
// the pending queue with its counters, and the server callbacks (notifications registered with
// the peer); only the queue flush sends while holding one (the pending lock), so that nothing
// overtakes the queued messages.
#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/Export.h"
#include "platform/Rpc.h"
#include "platform/Sync.h"
#include "platform/Transport.h"
#include "tidelink/core/ConnectionStatus.h"
#include "tidelink/peers/LinkRecords.h"

namespace tidelink {

class ServerReconnect;
using ServerReconnectPtr = std::shared_ptr<ServerReconnect>;

class TIDELINK_EXPORT ServerReconnect {
public:
    using GenericStatusCallback =
        std::function<void(ConnectionStatus, const WString& name, const GenericAssetInfo& asset)>;
    using StatusCallback = std::function<void(ConnectionStatus, const WString& name, const File& file)>;
    using ServerProgressFn =
        std::function<void(const std::string& message, double fraction, const std::vector<WString>& args)>;

    // |linkManager| is the client to the link manager; |hostAddress| and |port| are the link
    // manager's. The five names are the link-manager requests of this peer (connect,
    // connect-with-version, create-link, create-headed-link, create-Farland-link).
    static ServerReconnectPtr Create(platform::RPCClientPtr linkManager, std::string hostAddress,
                                     uint16_t port, std::string connectName,
                                     std::string connectWithVersionName, std::string createLinkName,
                                     std::string createHeadedLinkName,
                                     std::string createFarlandLinkName, bool supportsReconnect);
    static ServerReconnectPtr Create(platform::RPCClientPtr linkManager, std::string hostAddress,
                                     uint16_t port, std::string connectName,
                                     std::string connectWithVersionName, std::string createLinkName,
                                     std::string createHeadedLinkName, bool supportsReconnect);
    static ServerReconnectPtr Create(platform::RPCClientPtr linkManager, bool supportsReconnect);
    // Takes the clients, session, address, port, names, reconnect target and flag of |other|;
    // starts with no callbacks, no pending messages, no registered notifications and no Farland
    // production request.
    static ServerReconnectPtr Create(const ServerReconnectPtr& other);

    virtual ~ServerReconnect();
    ServerReconnect(const ServerReconnect&) = delete;
    ServerReconnect& operator=(const ServerReconnect&) = delete;

    // Sends |call| on the direct client, or holds it back while a reconnection runs (returning 0)
    // unless |force|. Exactly one of |ok| and |fail| runs later; without a direct client |fail|
    // runs with -10001 on the shared executor.
    platform::RequestId SendDirectRequest(const platform::Call& call, platform::SuccessFn ok,
                                          platform::FailureFn fail, bool force = false,
                                          uint64_t extra = 0);
    void SendDirectNotification(const platform::Call& call);

    platform::Guid AddGenericStatusCallback(GenericStatusCallback callback);
    platform::Guid AddStatusCallback(StatusCallback callback);
    void RemoveStatusCallback(const platform::Guid& id);

    void SetReconnectProject(const File& file);
    void SetReconnectFarlandAsset(const FarlandAssetRequestInfo& request);
    void SetReconnectFarlandProduction(const FarlandProductionRequestInfo& request);
    GenericAssetRequestInfo GetReconnectTarget() const;
    FarlandProductionRequestInfo GetReconnectFarlandProduction() const;

    void SetDirectSession(platform::SessionPtr session);
    void SetDirectRPCClient(platform::RPCClientPtr client);
    platform::SessionPtr GetDirectSession() const;
    platform::RPCClientPtr GetDirectRPCClient() const;

    platform::RPCClientPtr GetRPCClient() const;
    platform::SessionPtr GetSession() const;
    platform::SocketTransportPtr GetTransporter() const;
    const std::string& GetHostAddress() const { return mHostAddress; }
    uint16_t GetConnectionPort() const { return mConnectionPort; }
    const std::string& GetTLMReconnect() const { return mConnectName; }
    const std::string& GetTLMReconnectWithVersion() const { return mConnectWithVersionName; }
    const std::string& GetReconnect() const { return mCreateLinkName; }
    const std::string& GetHeadedConnect() const { return mCreateHeadedLinkName; }
    const std::string& GetFarlandReconnect() const { return mCreateFarlandLinkName; }
    bool SupportsReconnect() const { return mSupportsReconnect; }
    platform::RPCServerPtr GetRPCServer() const { return mRPCServer; }

    void SetServerProgress(ServerProgressFn fn);

    // Registers |handler| under |name| with the process's message registrar and sends
    // |registerCall| to the peer; |unregisterCall| is sent when the entry is removed (by
    // RemoveServerCallback or the destructor).
    void AddServerCallback(const std::string& name, platform::MessageHandlerPtr handler,
                           platform::Call registerCall, platform::Call unregisterCall);
    void RemoveServerCallback(const std::string& name);
    // (Re-)registers the status notification with the peer for the current reconnect target.
    virtual void RegisterNotification();
    virtual void UnRegisterNotification();

    // Name of the status notification registered with the peer (nil when none).
    platform::Guid GetNotificationID() const;
    // Closes of the direct session so far, and whether a reconnection runs (for diagnostics).
    int32_t GetSessionCloseCount() const;
    bool IsReconnecting() const;

    // The endpoint of this process's shared listening server, {"address", "port"}.
    static platform::Value SharedServerEndpoint();

protected:
    ServerReconnect(platform::RPCClientPtr linkManager, std::string hostAddress, uint16_t port,
                    std::string connectName, std::string connectWithVersionName,
                    std::string createLinkName, std::string createHeadedLinkName,
                    std::string createFarlandLinkName, bool supportsReconnect);

private:
    struct PendingMessage {
        bool mIsRequest = true;
        platform::Call mCall;
        platform::SuccessFn mOk;
        platform::FailureFn mFail;
    };
    // The direct session and its client, shared by the copies of one link; the session is
    // closed when the last of them goes.
    struct DirectLink;
    struct DirectRefs {
        platform::SessionPtr session;
        platform::RPCClientPtr client;
    };

    using WeakSelf = std::weak_ptr<ServerReconnect>;

    static ServerReconnectPtr Finish(ServerReconnect* object);
    bool Destroying() const { return mDestroying.load() != 0; }

    void OnStatusChange(int32_t value);
    void OnSessionClose();
    void ReconnectWithVersionFailed(platform::RequestId failedId);
    void ReconnectLinkManagerOK();
    void ReconnectLinkOK(const platform::Value& reply);
    void ReconnectConnected();
    void ReconnectOpened(const platform::Value& reply);
    void OnReconnectionFailed(int32_t code, const WString& message);
    void FreePendingMessages();
    void CallStatusCallbacks(ConnectionStatus status, const WString& name, const GenericAssetInfo& asset);
    platform::RPCClientPtr LinkManagerClient();
    DirectRefs Direct() const;
    platform::FailureFn ReconnectFailure();

    // Fixed at creation.
    const std::string mHostAddress;
    const uint16_t mConnectionPort;
    const std::string mConnectName;
    const std::string mConnectWithVersionName;
    const std::string mCreateLinkName;
    const std::string mCreateHeadedLinkName;
    const std::string mCreateFarlandLinkName;
    const bool mSupportsReconnect;
    platform::RPCServerPtr mRPCServer;

    // Guarded by mStateMutex (a leaf lock: nothing is called while it is held).
    mutable std::mutex mStateMutex;
    platform::RPCClientPtr mLinkManager;
    std::shared_ptr<DirectLink> mDirect;
    platform::Guid mCloseHandlerId;
    platform::Guid mNotificationId;
    GenericAssetRequestInfo mReconnectTarget;
    FarlandProductionRequestInfo mFarlandProduction;
    ServerProgressFn mServerProgress;

    platform::RecursiveMutex mStatusLock;
    std::vector<std::pair<platform::Guid, GenericStatusCallback>> mStatusCallbacks;

    mutable platform::RecursiveMutex mPendingLock;
    std::deque<PendingMessage> mPending;
    int32_t mReconnectingCount = 0;
    int32_t mSessionCloseCount = 0;

    platform::RecursiveMutex mServerCallbackLock;
    std::map<std::string, std::pair<platform::Call, platform::Call>> mServerCallbacks;

    std::atomic<int64_t> mDestroying{0};
    WeakSelf mWeakSelf;
};

}  // namespace tidelink
