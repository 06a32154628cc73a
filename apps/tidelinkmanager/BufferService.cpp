#include "BufferService.h"

#include <unistd.h>

#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <map>
#include <mutex>
#include <set>
#include <thread>
#include <vector>

#include "platform/Config.h"
#include "platform/Guid.h"
#include "platform/Process.h"
#include "platform/SharedMemory.h"
#include "platform/Trace.h"
#include "processcoordination/Protocol.h"
#include "tidelink/core/LinkManager.h"

namespace tidelink::manager {

using namespace platform;
namespace proto = tidelinkmanager::processcoordinationprotocol;

namespace {

constexpr const char* kCat = "TideLinkManager";

// A client is one connection; the key is its session object, which stays alive while its close
// handler runs, and its record is gone before that handler returns.
using ClientKey = const Session*;

// What one client holds of one buffer: the allocation itself, and the identifiers under which the
// buffer was handed to it. A drop lists the identifiers the client knew the file by, so a grant
// that crosses a drop on the wire (sent before the drop arrived) keeps the buffer alive.
struct Hold {
    bool allocation = false;
    std::set<Guid> grants;
    bool Empty() const { return !allocation && grants.empty(); }
};

struct Buffer {
    std::string name;
    uint64_t size = 0;
    std::unique_ptr<MemoryMappedFile> object;  // keeps the object named; removes it when destroyed
    std::set<Guid> identifiers;
    std::map<ClientKey, Hold> holders;
    bool managerHold = false;  // handed over and not yet claimed by a waiter
    double retainedSince = 0;
    ClientKey allocator = nullptr;
    bool unpublished = true;  // counts against its allocator's cap
};

struct Client {
    std::weak_ptr<Session> session;
    std::set<std::string> held;
    std::set<Guid> waits;
    uint64_t pendingBytes = 0;
};

struct ErrorRecord {
    int32_t code = -1;
    double at = 0;
};

// A message to send once the lock is released.
struct Outgoing {
    SessionPtr session;
    Call call;
};

std::string RandomHex(size_t bytes) {
    std::vector<uint8_t> raw(bytes);
    FillRandom(raw.data(), raw.size());
    static const char* kDigits = "0123456789abcdef";
    std::string out;
    for (uint8_t b : raw) {
        out += kDigits[b >> 4];
        out += kDigits[b & 15];
    }
    return out;
}

std::optional<Guid> ArgGuid(const Value& args, size_t i) {
    if (!args.is_array() || args.size() <= i || !args[i].is_string()) return std::nullopt;
    return Guid::Parse(args[i].get_ref<const std::string&>());
}

std::optional<std::string> ArgString(const Value& args, size_t i) {
    if (!args.is_array() || args.size() <= i || !args[i].is_string()) return std::nullopt;
    return args[i].get<std::string>();
}

Value Description(int32_t result, const std::string& name = {}, uint64_t size = 0) {
    return Value(proto::BinaryReferenceDescription{result, name, size});
}

}  // namespace

std::string BufferNamePrefix() { return "tlmbuf-" + std::to_string(::getuid()) + "-"; }

BufferServiceOptions BufferServiceOptionsFromEnvironment() {
    BufferServiceOptions o;
    if (const char* v = std::getenv("TIDELINK_BUFFER_CLIENT_CAP")) o.clientCapBytes = std::strtoull(v, nullptr, 10);
    if (const char* v = std::getenv("TIDELINK_BUFFER_RETENTION")) o.retentionSeconds = std::atof(v);
    if (const char* v = std::getenv("TIDELINK_BUFFER_RETAINED_CAP")) {
        o.retainedCapBytes = std::strtoull(v, nullptr, 10);
    }
    return o;
}

struct BufferService::Impl {
    explicit Impl(BufferServiceOptions o) : options(o) {}

    BufferServiceOptions options;
    std::string suffix = "-" + CSVersionPortNumberString();

    mutable std::mutex mutex;
    bool stopped = false;
    // Allocations creating their object outside the lock; stopping waits for them, so that no
    // object is created after the service has let its objects go.
    int creating = 0;
    std::map<std::string, Buffer> buffers;  // live: someone holds them
    std::deque<Buffer> pool;                // nobody holds them; oldest first
    uint64_t pooledBytes = 0;
    uint64_t liveBytes = 0;
    std::map<Guid, std::string> published;  // identifier -> live buffer
    std::map<Guid, ErrorRecord> errors;
    std::map<Guid, std::set<ClientKey>> waiters;
    std::map<ClientKey, Client> clients;
    std::deque<std::string> retained;  // names under a manager hold, oldest first
    uint64_t retainedBytes = 0;
    uint64_t objectsCreated = 0;
    uint64_t allocations = 0;

    std::condition_variable wake;
    std::thread sweeper;

    // ---- helpers; all run under |mutex| ----

    Client* FindClient(const SessionPtr& session, bool create) {
        auto it = clients.find(session.get());
        if (it != clients.end()) return &it->second;
        // A session that has closed has had its clean-up already (or is about to have it, and
        // waits for this lock): it must not get a new record that nothing would remove.
        if (!create || stopped || !session->IsOpen()) return nullptr;
        Client& c = clients[session.get()];
        c.session = session;
        return &c;
    }

    void RemoveHold(Buffer& b, ClientKey key) {
        b.holders.erase(key);
        auto c = clients.find(key);
        if (c != clients.end()) c->second.held.erase(b.name);
    }

    void Grant(Buffer& b, ClientKey key, Client& c, const Guid& id) {
        b.holders[key].grants.insert(id);
        c.held.insert(b.name);
    }

    void ReleaseManagerHold(Buffer& b) {
        if (!b.managerHold) return;
        b.managerHold = false;
        retainedBytes -= b.size;
        for (auto it = retained.begin(); it != retained.end(); ++it) {
            if (*it == b.name) {
                retained.erase(it);
                break;
            }
        }
    }

    // Called after a hold went away: a buffer nobody holds forgets its identifiers and goes to
    // the pool (or away).
    void MaybeRelease(const std::string& name) {
        auto it = buffers.find(name);
        if (it == buffers.end()) return;
        Buffer& b = it->second;
        if (!b.holders.empty() || b.managerHold) return;
        for (const Guid& id : b.identifiers) {
            auto p = published.find(id);
            if (p != published.end() && p->second == name) published.erase(p);
        }
        if (b.unpublished && b.allocator != nullptr) {
            auto c = clients.find(b.allocator);
            if (c != clients.end()) c->second.pendingBytes -= b.size;
        }
        liveBytes -= b.size;
        Buffer freed = std::move(b);
        buffers.erase(it);
        freed.identifiers.clear();
        freed.allocator = nullptr;
        freed.unpublished = true;
        if (stopped || freed.size > options.poolMaxBytes || options.poolMaxBuffers == 0) return;
        pooledBytes += freed.size;
        pool.push_back(std::move(freed));
        while (pool.size() > options.poolMaxBuffers || pooledBytes > options.poolMaxBytes) {
            pooledBytes -= pool.front().size;
            pool.pop_front();
        }
    }

    // Hands the data of |id| to every client waiting for it.
    void NotifyWaiters(const Guid& id, std::vector<Outgoing>& out) {
        auto w = waiters.find(id);
        if (w == waiters.end()) return;
        const std::set<ClientKey> waiting = std::move(w->second);
        waiters.erase(w);
        auto p = published.find(id);
        Buffer* b = p == published.end() ? nullptr : &buffers.at(p->second);
        auto e = errors.find(id);
        bool claimed = false;
        for (ClientKey key : waiting) {
            auto c = clients.find(key);
            if (c == clients.end()) continue;
            c->second.waits.erase(id);
            auto session = c->second.session.lock();
            if (!session) continue;
            proto::BinaryReferenceAvailable item{id, {}};
            if (b != nullptr) {
                Grant(*b, key, c->second, id);
                item.reference = {0, b->name, b->size};
                claimed = true;
            } else {
                item.reference = {e != errors.end() ? e->second.code : -1, {}, 0};
            }
            Value list = Value::array();
            list.push_back(Value(item));
            out.push_back({session, BuildCall(proto::kBinaryDataArrived, Value::array({list}))});
        }
        if (b != nullptr && claimed) ReleaseManagerHold(*b);
    }

    void ExpireRetained(double now) {
        while (!retained.empty()) {
            auto it = buffers.find(retained.front());
            if (it == buffers.end()) {
                retained.pop_front();
                continue;
            }
            const bool old = now - it->second.retainedSince >= options.retentionSeconds;
            if (!old && retainedBytes <= options.retainedCapBytes) break;
            TL_TRACE(kCat, 5) << "Releasing unclaimed buffer " << it->first
                              << (old ? " past its retention time" : " over the retained-bytes cap");
            const std::string name = it->first;
            ReleaseManagerHold(it->second);
            MaybeRelease(name);
        }
        std::erase_if(errors, [&](const auto& e) { return now - e.second.at >= options.retentionSeconds; });
    }

    // ---- messages ----

    void Allocate(const SessionPtr& session, const ResponderPtr& r, const Value& args) {
        if (!args.is_array() || args.empty() || !(args[0].is_number_unsigned() || args[0].is_number_integer())) {
            return r->SendGeneralResult(Description(-3));
        }
        const int64_t signedSize = args[0].is_number_unsigned() ? 1 : args[0].get<int64_t>();
        const uint64_t size = args[0].is_number_unsigned() ? args[0].get<uint64_t>() : 0;
        if (signedSize <= 0 || size == 0) return r->SendGeneralResult(Description(-3));
        Buffer b;
        {
            std::lock_guard lock(mutex);
            Client* c = FindClient(session, true);
            if (c == nullptr) return r->SendGeneralResult(Description(-1));
            if (size > options.clientCapBytes || c->pendingBytes + size > options.clientCapBytes) {
                TL_TRACE(kCat, 1) << "Refused an allocation of " << size << " bytes: the client has "
                                  << c->pendingBytes << " bytes allocated and unpublished, cap "
                                  << options.clientCapBytes;
                return r->SendGeneralResult(Description(-1));
            }
            if (c->held.size() >= options.maxHeldPerClient) {
                TL_TRACE(kCat, 1) << "Refused an allocation: the client holds " << c->held.size()
                                  << " buffers";
                return r->SendGeneralResult(Description(-1));
            }
            // Equal sizes are handed out again under the same name, so mappings cached by the
            // producer and its consumers stay valid.
            for (auto it = pool.rbegin(); it != pool.rend(); ++it) {
                if (it->size == size) {
                    b = std::move(*it);
                    pool.erase(std::next(it).base());
                    pooledBytes -= size;
                    break;
                }
            }
            if (b.object) {
                const Buffer& nb = Commit(std::move(b), session.get(), *c);
                ++allocations;
                return r->SendGeneralResult(Description(0, nb.name, nb.size));
            }
            // Reserve the bytes against the cap before creating outside the lock.
            c->pendingBytes += size;
            ++creating;
        }
        // Creating and reserving the pages may take a while for large buffers.
        auto object = std::make_unique<MemoryMappedFile>();
        const std::string name = BufferNamePrefix() + RandomHex(12) + suffix;
        const bool ok = object->Init(name, size, 0);
        std::unique_lock lock(mutex);
        if (--creating == 0) wake.notify_all();
        Client* c = FindClient(session, false);
        if (c != nullptr) c->pendingBytes -= size;
        if (!ok) {
            TL_TRACE(kCat, 1) << "Cannot create a buffer of " << size << " bytes: errno " << object->LastError();
            return r->SendGeneralResult(Description(-1));
        }
        if (c == nullptr) {
            object.reset();  // removed now, while the lock holds back a stop
            return r->SendGeneralResult(Description(-1));
        }
        ++objectsCreated;
        ++allocations;
        b.name = name;
        b.size = size;
        b.object = std::move(object);
        Commit(std::move(b), session.get(), *c);
        r->SendGeneralResult(Description(0, name, size));
    }

    const Buffer& Commit(Buffer b, ClientKey key, Client& c) {
        b.allocator = key;
        b.unpublished = true;
        b.holders[key].allocation = true;
        c.held.insert(b.name);
        c.pendingBytes += b.size;
        liveBytes += b.size;
        const std::string name = b.name;
        return buffers.emplace(name, std::move(b)).first->second;
    }

    // The buffer |name| if |key| holds it.
    Buffer* Held(ClientKey key, const std::string& name, const char* what) {
        auto it = buffers.find(name);
        if (it == buffers.end() || it->second.holders.count(key) == 0) {
            TL_TRACE(kCat, 1) << what << ": the client does not hold \"" << name.substr(0, 100) << "\"; ignored";
            return nullptr;
        }
        return &it->second;
    }

    void Associate(Buffer& b, const Guid& id, std::vector<Outgoing>& out) {
        auto p = published.find(id);
        if (p != published.end() && p->second != b.name) {
            auto old = buffers.find(p->second);
            if (old != buffers.end()) old->second.identifiers.erase(id);
        }
        published[id] = b.name;
        b.identifiers.insert(id);
        errors.erase(id);
        NotifyWaiters(id, out);
    }

    void Publish(const SessionPtr& session, const Value& args) {
        auto name = ArgString(args, 0);
        auto id = ArgGuid(args, 1);
        if (!name || !id || args.size() < 3) {
            TL_TRACE(kCat, 1) << "Malformed publication ignored";
            return;
        }
        const bool handOver = proto::ReadBoolean(args[2]);
        std::vector<Outgoing> out;
        {
            std::lock_guard lock(mutex);
            Client* c = FindClient(session, false);
            Buffer* b = c ? Held(session.get(), *name, "Publish") : nullptr;
            if (b == nullptr) return;
            if (b->unpublished) {
                b->unpublished = false;
                auto a = clients.find(b->allocator);
                if (a != clients.end()) a->second.pendingBytes -= b->size;
            }
            if (handOver) {
                // The client has let go of its reference; the manager keeps the data until a
                // waiter claims them or the retention time passes.
                RemoveHold(*b, session.get());
                if (!b->managerHold) {
                    b->managerHold = true;
                    b->retainedSince = NowSeconds();
                    retained.push_back(b->name);
                    retainedBytes += b->size;
                }
            }
            Associate(*b, *id, out);
            // Unclaimed hand-overs beyond the cap go now, oldest first.
            ExpireRetained(NowSeconds());
        }
        Send(out);
    }

    void PublishError(const Value& args) {
        auto id = ArgGuid(args, 0);
        if (!id || args.size() < 2 || !(args[1].is_number_integer() || args[1].is_number_unsigned())) {
            TL_TRACE(kCat, 1) << "Malformed error publication ignored";
            return;
        }
        int64_t code = args[1].is_number_unsigned() ? -1 : args[1].get<int64_t>();
        // 0 would tell the waiters that data exist; out-of-range codes would wrap.
        if (code >= 0 || code < INT32_MIN) code = -1;
        std::vector<Outgoing> out;
        {
            std::lock_guard lock(mutex);
            if (published.count(*id) != 0) return;  // data already exist for it
            if (errors.size() >= options.maxErrors) errors.erase(errors.begin());
            errors[*id] = {static_cast<int32_t>(code), NowSeconds()};
            NotifyWaiters(*id, out);
        }
        Send(out);
    }

    void Alias(const SessionPtr& session, const Value& args) {
        auto name = ArgString(args, 1);
        auto alias = ArgGuid(args, 2);
        if (!name || !alias) {
            TL_TRACE(kCat, 1) << "Malformed alias ignored";
            return;
        }
        std::vector<Outgoing> out;
        {
            std::lock_guard lock(mutex);
            Buffer* b = Held(session.get(), *name, "Alias");
            if (b == nullptr) return;
            Associate(*b, *alias, out);
        }
        Send(out);
    }

    void IfAvailable(const SessionPtr& session, const ResponderPtr& r, const Value& args) {
        auto id = ArgGuid(args, 0);
        if (!id) return r->SendGeneralResult(Description(-3));
        std::lock_guard lock(mutex);
        auto p = published.find(*id);
        if (p != published.end()) {
            Client* c = FindClient(session, true);
            if (c == nullptr) return r->SendGeneralResult(Description(-1));
            if (c->held.size() >= options.maxHeldPerClient && c->held.count(p->second) == 0) {
                return r->SendGeneralResult(Description(-1));
            }
            Buffer& b = buffers.at(p->second);
            Grant(b, session.get(), *c, *id);
            return r->SendGeneralResult(Description(0, b.name, b.size));
        }
        auto e = errors.find(*id);
        r->SendGeneralResult(Description(e != errors.end() ? e->second.code : -1));
    }

    void WhenAvailable(const SessionPtr& session, const ResponderPtr& r, const Value& args) {
        auto id = ArgGuid(args, 0);
        if (!id) return r->SendError(kErrorRequestRefused, u"Expected an identifier");
        std::vector<Outgoing> out;
        {
            std::lock_guard lock(mutex);
            Client* c = FindClient(session, true);
            if (c == nullptr) return r->SendError(kErrorSessionClosed, u"Connection closed");
            if (c->waits.count(*id) == 0 && c->waits.size() >= options.maxWaitsPerClient) {
                TL_TRACE(kCat, 1) << "Refused a wait: the client already waits for " << c->waits.size()
                                  << " identifiers";
                return r->SendError(kErrorRequestRefused, u"Too many waits");
            }
            c->waits.insert(*id);
            waiters[*id].insert(session.get());
            if (published.count(*id) != 0 || errors.count(*id) != 0) NotifyWaiters(*id, out);
        }
        r->SendGeneralResult(true);
        Send(out);
    }

    void Drop(const SessionPtr& session, const Value& args) {
        auto name = ArgString(args, 0);
        if (!name || args.size() < 2 || !args[1].is_array()) {
            TL_TRACE(kCat, 1) << "Malformed drop ignored";
            return;
        }
        std::lock_guard lock(mutex);
        Buffer* b = Held(session.get(), *name, "Drop");
        if (b == nullptr) return;
        Hold& h = b->holders[session.get()];
        if (h.allocation) {
            h.allocation = false;
            if (b->unpublished) {
                b->unpublished = false;
                auto a = clients.find(b->allocator);
                if (a != clients.end()) a->second.pendingBytes -= b->size;
            }
        }
        for (const auto& v : args[1]) {
            if (!v.is_string()) continue;
            if (auto id = Guid::Parse(v.get_ref<const std::string&>())) h.grants.erase(*id);
        }
        if (h.Empty()) {
            RemoveHold(*b, session.get());
            MaybeRelease(*name);
        }
    }

    void Closed(const SessionPtr& session) {
        std::lock_guard lock(mutex);
        auto it = clients.find(session.get());
        if (it == clients.end()) return;
        Client c = std::move(it->second);
        clients.erase(it);
        for (const Guid& id : c.waits) {
            auto w = waiters.find(id);
            if (w == waiters.end()) continue;
            w->second.erase(session.get());
            if (w->second.empty()) waiters.erase(w);
        }
        size_t released = 0;
        for (const std::string& name : c.held) {
            auto b = buffers.find(name);
            if (b == buffers.end()) continue;
            b->second.holders.erase(session.get());
            if (b->second.allocator == session.get()) b->second.allocator = nullptr;
            ++released;
            MaybeRelease(name);
        }
        // Buffers it allocated but no longer holds (handed over) only lose their allocator.
        for (auto& [name, b] : buffers) {
            if (b.allocator == session.get()) b.allocator = nullptr;
        }
        if (released > 0 || !c.waits.empty()) {
            TL_TRACE(kCat, 4) << "Connection closed: released " << released << " buffers and "
                              << c.waits.size() << " waits";
        }
    }

    bool IsWanted(const Value& args) {
        auto id = ArgGuid(args, 0);
        if (!id) return false;
        std::lock_guard lock(mutex);
        return waiters.count(*id) != 0;
    }

    static void Send(std::vector<Outgoing>& out) {
        for (auto& o : out) o.session->SendNotification(o.call);
    }
};

BufferService::BufferService(BufferServiceOptions options) : mImpl(std::make_unique<Impl>(options)) {}

BufferService::~BufferService() { OnStop(); }

void BufferService::Register(ManagerService& service) {
    // Objects of ours that a killed manager of this version left behind. Only one manager of a
    // version runs at a time (the instance lock), so every such object is stale.
    const std::string prefix = BufferNamePrefix();
    for (const auto& name : ListSharedMemoryNames(prefix)) {
        if (name.size() > prefix.size() + mImpl->suffix.size() &&
            name.compare(name.size() - mImpl->suffix.size(), mImpl->suffix.size(), mImpl->suffix) == 0 &&
            service.HoldsInstanceLock() && MemoryMappedFile::Remove(name)) {
            TL_TRACE(kCat, 3) << "Removed the stale buffer " << name;
        }
    }

    std::weak_ptr<BufferService> weak = shared_from_this();
    auto request = [&](const char* name, auto fn) {
        service.Registrar()->Register(
            name, std::make_shared<SessionRequestHandler>(
                      [weak, fn](const SessionPtr& s, const ResponderPtr& r, const Value& args) {
                          auto self = weak.lock();
                          if (!self) return r->SendError(kErrorTransportShutdown, u"Link manager is stopping");
                          fn(*self->mImpl, s, r, args);
                      }));
    };
    auto notification = [&](const char* name, auto fn) {
        service.Registrar()->Register(
            name, std::make_shared<SessionNotificationHandler>([weak, fn](const SessionPtr& s, const Value& args) {
                if (auto self = weak.lock()) fn(*self->mImpl, s, args);
            }));
    };
    request(proto::kAllocateBinaryData,
            [](Impl& i, const SessionPtr& s, const ResponderPtr& r, const Value& a) { i.Allocate(s, r, a); });
    request(proto::kGetBinaryDataIfAvailable,
            [](Impl& i, const SessionPtr& s, const ResponderPtr& r, const Value& a) { i.IfAvailable(s, r, a); });
    request(proto::kGetBinaryDataWhenAvailable,
            [](Impl& i, const SessionPtr& s, const ResponderPtr& r, const Value& a) { i.WhenAvailable(s, r, a); });
    request(proto::kIsBinaryDataCurrentlyWanted,
            [](Impl& i, const SessionPtr&, const ResponderPtr& r, const Value& a) {
                r->SendGeneralResult(i.IsWanted(a));
            });
    notification(proto::kPublishBinaryData, [](Impl& i, const SessionPtr& s, const Value& a) { i.Publish(s, a); });
    notification(proto::kPublishBinaryDataGenerationError,
                 [](Impl& i, const SessionPtr&, const Value& a) { i.PublishError(a); });
    notification(proto::kCreateBinaryDataAlias, [](Impl& i, const SessionPtr& s, const Value& a) { i.Alias(s, a); });
    notification(proto::kDropReferenceToBinaryData,
                 [](Impl& i, const SessionPtr& s, const Value& a) { i.Drop(s, a); });

    mImpl->sweeper = std::thread([impl = mImpl.get()] {
        std::unique_lock lock(impl->mutex);
        while (!impl->stopped) {
            impl->wake.wait_for(lock, std::chrono::seconds(1));
            if (!impl->stopped) impl->ExpireRetained(NowSeconds());
        }
    });
}

void BufferService::OnSessionClosed(const SessionPtr& session) { mImpl->Closed(session); }

void BufferService::AddInfo(Value& info) {
    const BufferServiceCounters c = Counters();
    Value v = Value::object();
    v["buffers_live"] = c.buffersLive;
    v["bytes_live"] = c.bytesLive;
    v["buffers_pooled"] = c.buffersPooled;
    v["bytes_pooled"] = c.bytesPooled;
    v["clients"] = c.clients;
    v["objects_created"] = c.objectsCreated;
    v["allocations"] = c.allocations;
    info["buffers"] = v;
}

void BufferService::OnStop() {
    std::map<std::string, Buffer> buffers;
    std::deque<Buffer> pool;
    {
        std::unique_lock lock(mImpl->mutex);
        mImpl->stopped = true;
        // An object being created now is removed by its allocation, which finds no client.
        mImpl->wake.wait_for(lock, std::chrono::seconds(5), [&] { return mImpl->creating == 0; });
        buffers.swap(mImpl->buffers);
        pool.swap(mImpl->pool);
        mImpl->published.clear();
        mImpl->waiters.clear();
        mImpl->clients.clear();
        mImpl->retained.clear();
        mImpl->liveBytes = mImpl->pooledBytes = mImpl->retainedBytes = 0;
    }
    mImpl->wake.notify_all();
    if (mImpl->sweeper.joinable() && mImpl->sweeper.get_id() != std::this_thread::get_id()) {
        mImpl->sweeper.join();
    }
    // |buffers| and |pool| go here, unlinking their objects.
}

BufferServiceCounters BufferService::Counters() const {
    std::lock_guard lock(mImpl->mutex);
    BufferServiceCounters c;
    c.buffersLive = mImpl->buffers.size();
    c.bytesLive = mImpl->liveBytes;
    c.buffersPooled = mImpl->pool.size();
    c.bytesPooled = mImpl->pooledBytes;
    c.clients = mImpl->clients.size();
    c.objectsCreated = mImpl->objectsCreated;
    c.allocations = mImpl->allocations;
    return c;
}

void BufferService::Sweep() {
    std::lock_guard lock(mImpl->mutex);
    mImpl->ExpireRetained(NowSeconds());
}

}  // namespace tidelink::manager
