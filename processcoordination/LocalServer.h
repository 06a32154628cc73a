// The per-process agent of the coordination client: talks to the link manager, keeps this
// process's tables of identifiers, files and live references, and maps files.
#pragma once

#include <memory>

#include "processcoordination/ProcessCoordination.h"

namespace processcoordination {

class ILocalServer {
public:
    class IAsyncCompletionClient {
    public:
        virtual void NotifyBinaryAvailability(Guid identifier, BinaryReferencePtr reference, int result) = 0;
        virtual void NotifyLostConnection() = 0;

    protected:
        ~IAsyncCompletionClient() = default;
    };

    virtual int IsBinaryDataCurrentlyAvailable(const Guid& identifier) = 0;
    virtual int IsBinaryDataCurrentlyWanted(const Guid& identifier) = 0;
    virtual int GetBinaryDataIfAvailable(const Guid& identifier, BinaryReferencePtr& out) = 0;
    virtual int GetBinaryDataWhenAvailableAsync(const Guid& identifier, RegistrationCallback registered) = 0;
    virtual int CreateBinaryAlias(const Guid& identifier, BinaryReferencePtr reference, const Guid& alias) = 0;
    virtual int GetWritableBinaryData(uint64_t size, WritableBinaryReferencePtr& out) = 0;
    virtual int PutCompletedBinaryData(WritableBinaryReferencePtr reference, const Guid& identifier,
                                       bool handOver) = 0;
    virtual int PutBinaryDataGenerationError(const Guid& identifier, int error) = 0;
    virtual ~ILocalServer() = default;
};

// Null when the link manager cannot be reached.
std::unique_ptr<ILocalServer> CreateLocalServer(ILocalServer::IAsyncCompletionClient* client);

}  // namespace processcoordination
