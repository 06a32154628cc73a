// Entry points to the peer applications: one class per application. A factory reaches the
// application and reports a described object; CreateLink turns it into a working Server on a
// reconnecting connection.
//
// Brokered peers (Kestrel, Osprey, Puffin) are reached through the link manager, which connects
// them on request. Direct peers (Plover) are named servers: the link manager starts or finds the
// process and returns its address, and the library talks to it on its own session.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "platform/Export.h"
#include "platform/Rpc.h"
#include "tidelink/core/Brokering.h"
#include "tidelink/core/ConnectionStatus.h"
#include "tidelink/core/Server.h"

namespace tidelink {

// Passed to CreateLink: use the connection type given to the factory.
inline constexpr ServerConnectionType kCreationConnectionType = static_cast<ServerConnectionType>(0xFFFFFFFFu);

// Project file extension of the Kestrel application.
inline constexpr const char16_t* kKestrelProjectExtension = u".kstproj";

class GenericServer;
using GenericServerPtr = std::shared_ptr<GenericServer>;

class TIDELINK_EXPORT GenericServer : public ServerInfo {
public:
    using LinkCallback = std::function<void(ConnectionStatus, ServerPtr)>;

    GenericServer(platform::RPCClientPtr linkManager, ServerConnectionType type, std::string connectName,
                  std::string connectWithVersionName, std::string createLinkName,
                  std::string createHeadedLinkName, std::string createFarlandLinkName);
    ~GenericServer() override;

    // Builds a Server on a new reconnecting connection and reports it from the shared executor.
    // No request is sent here; the link itself is made when the Server opens something.
    virtual void CreateLink(LinkCallback callback, ServerConnectionType type = kCreationConnectionType);

    platform::RPCClientPtr GetRPCClient() const { return mLinkManager; }
    platform::SessionPtr GetSession() const;
    platform::SocketTransportPtr GetTransporter() const;
    ServerConnectionType GetConnectionType() const { return mConnectionType; }
    const std::string& GetConnectName() const { return mConnectName; }
    const std::string& GetConnectWithVersionName() const { return mConnectWithVersionName; }
    const std::string& GetCreateLinkName() const { return mCreateLinkName; }
    const std::string& GetCreateHeadedLinkName() const { return mCreateHeadedLinkName; }
    const std::string& GetCreateFarlandLinkName() const { return mCreateFarlandLinkName; }

protected:
    using Completion = std::function<void(ConnectionStatus, GenericServerPtr)>;

    // The brokered factory: reaches the link manager and asks it for the application.
    // |context| names the factory in log lines.
    static void Connect(const std::function<GenericServerPtr(platform::RPCClientPtr)>& make,
                        Completion completion, const char* context);
    static void OnTidelinkManagerConnectionOK(const GenericServerPtr& server, const platform::Value& reply);
    static void OnTidelinkManagerConnectionWithVersionFailed(const GenericServerPtr& server,
                                                             platform::RequestId failedId);
    static void OnTidelinkManagerConnectionFailed(const GenericServerPtr& server, int32_t code,
                                                  const WString& message);
    // Calls and releases the kept completion (once).
    void Complete(ConnectionStatus status, const GenericServerPtr& server);

    platform::RPCClientPtr mLinkManager;
    std::string mCreateHeadedLinkName;
    std::string mConnectName;
    std::string mConnectWithVersionName;
    std::string mCreateLinkName;
    std::string mCreateFarlandLinkName;
    ServerConnectionType mConnectionType;

private:
    std::mutex mCompletionMutex;
    Completion mCompletion;
};

class KestrelServer;
class OspreyServer;
class PuffinServer;
using KestrelServerPtr = std::shared_ptr<KestrelServer>;
using OspreyServerPtr = std::shared_ptr<OspreyServer>;
using PuffinServerPtr = std::shared_ptr<PuffinServer>;

class TIDELINK_EXPORT KestrelServer : public GenericServer {
public:
    static void CreateTideLinkServer(std::function<void(ConnectionStatus, KestrelServerPtr)> callback,
                                     ServerConnectionType type = ServerConnectionType::Default);
    KestrelServer(platform::RPCClientPtr linkManager, ServerConnectionType type);
};

class TIDELINK_EXPORT OspreyServer : public GenericServer {
public:
    static constexpr const char16_t* kOspreyServerSourceTypeProjectExtension = u".ospproj";
    static void CreateTideLinkServer(std::function<void(ConnectionStatus, OspreyServerPtr)> callback,
                                     ServerConnectionType type = ServerConnectionType::Default);
    OspreyServer(platform::RPCClientPtr linkManager, ServerConnectionType type);
};

class TIDELINK_EXPORT PuffinServer : public GenericServer {
public:
    static constexpr const char16_t* kPuffinServerName = u"Puffin";
    static constexpr const char16_t* kPuffinSourceTypeProject = u"Puffin Project";
    static constexpr const char16_t* kPuffinSourceTypeProjectExtension = u".pufproj";
    static constexpr int32_t kPuffinServerVersion = 10;
    static constexpr const char* kPuffinCommitOID = "commitoid";
    static void CreateTideLinkServer(std::function<void(ConnectionStatus, PuffinServerPtr)> callback,
                                     ServerConnectionType type = ServerConnectionType::Default);
    PuffinServer(platform::RPCClientPtr linkManager, ServerConnectionType type);
};

class PloverServer;
using PloverServerPtr = std::shared_ptr<PloverServer>;

// A named server: the link manager starts the host's own executable as the Plover server.
class TIDELINK_EXPORT PloverServer : public std::enable_shared_from_this<PloverServer>, public ServerInfo {
public:
    using LinkCallback = std::function<void(ConnectionStatus, ServerPtr)>;

    static void CreateTideLinkServer(std::function<void(ConnectionStatus, PloverServerPtr)> callback);
    explicit PloverServer(platform::RPCClientPtr linkManager);

    // Throws std::bad_weak_ptr when the object is not held by a shared pointer.
    virtual void CreateLink(LinkCallback callback);

    platform::RPCClientPtr GetRPCClient() const;
    platform::SessionPtr GetSession() const;
    platform::SocketTransportPtr GetTransporter() const;

    // Where the link manager starts the Plover server (default: this process's executable).
    static void SetServerPath(const WString& path);

protected:
    static void CompleteServerConnection(const PloverServerPtr& server, const ServerConnection& connection,
                                         LinkCallback callback);
    static void OnDirectConnectionOK(const PloverServerPtr& server, const platform::Value& reply,
                                     LinkCallback callback);
    static void OnDirectConnectionWithVersionFailed(const PloverServerPtr& server, platform::RequestId failedId,
                                                    LinkCallback callback);
    static void OnDirectConnectionFailed(LinkCallback callback);

private:
    mutable std::mutex mMutex;
    platform::RPCClientPtr mLinkManager;
    platform::SessionPtr mDirectSession;
    platform::RPCClientPtr mDirectClient;
};

// Asks the link manager to start or find the named server and calls |done| with its address
// (port 0 when it could not be had). Returns the request id, or 0 when no request could be sent
// (|done| is then not called).
TIDELINK_EXPORT int64_t CreateNamedServerConnection(const WString& serverName, const WString& serverPath,
                                                    const WString& instanceArgument,
                                                    std::function<void(ServerConnection)> done);
// Withdraws the request; |done| is then not called.
TIDELINK_EXPORT void CancelNamedServerConnection(int64_t requestId);

}  // namespace tidelink
