// RPC round trip and pipelined throughput against raw blocking TCP ping-pong, between the same two
// processes in the same run.
//
//   bench_rpc [--json] [--iterations N]
//
// rtt_us           one request at a time, each sent from the previous one's reply function
// rtt_blocking_us  one request at a time, the calling thread waiting for each reply
// raw_rtt_us       blocking socket ping-pong of the same payload size, no RPC layer
// pipelined_rps    requests per second with 64 in flight
#include <utility>  // before asio: its C++20 coroutine header needs std::exchange
#include <boost/asio.hpp>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <string>
#include <thread>

#include "platform/Process.h"
#include "platform/Rpc.h"
#include "platform/Sync.h"

namespace asio = boost::asio;
using asio::ip::tcp;
using namespace tidelink::platform;

namespace {

constexpr size_t kPayload = 48;  // about the size of a small request frame
constexpr int kInFlight = 64;

double Now() {
    return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch()).count();
}

// ---- child: serves both kinds of ping-pong until told to stop ----
int RunChild(const std::string& portFile) {
    auto transport = SocketTransport::Create(CreateCPUBoundExecutor());
    auto server = transport->ServerStart(0, true);
    auto registrar = MessageRegistrar::Create();
    RPCServer rpc(server, "bench", registrar);
    Gate quit;
    registrar->Register("bench.echo", std::make_shared<FunctionRequestHandler>(
                                          [](const ResponderPtr& r, const Value& args) { r->SendGeneralResult(args[0]); }));
    registrar->Register("bench.quit", std::make_shared<FunctionNotificationHandler>([&](const Value&) { quit.Open(); }));

    asio::io_context io;
    tcp::acceptor acceptor(io, tcp::endpoint(asio::ip::address_v4::loopback(), 0));
    std::thread raw([&] {
        tcp::socket s(io);
        acceptor.accept(s);
        s.set_option(tcp::no_delay(true));
        uint8_t buf[kPayload];
        boost::system::error_code ec;
        for (;;) {
            asio::read(s, asio::buffer(buf), ec);
            if (ec) return;
            asio::write(s, asio::buffer(buf), ec);
            if (ec) return;
        }
    });
    {
        std::ofstream out(portFile + ".tmp");
        out << server->GetPort() << " " << acceptor.local_endpoint().port() << "\n";
    }
    std::rename((portFile + ".tmp").c_str(), portFile.c_str());
    quit.Wait(120000);
    acceptor.close();
    raw.join();
    server->Stop();
    return 0;
}

double MeasureRaw(uint16_t port, int iterations) {
    asio::io_context io;
    tcp::socket s(io);
    s.connect(tcp::endpoint(asio::ip::address_v4::loopback(), port));
    s.set_option(tcp::no_delay(true));
    uint8_t buf[kPayload] = {};
    auto once = [&] {
        asio::write(s, asio::buffer(buf));
        asio::read(s, asio::buffer(buf));
    };
    for (int i = 0; i < 1000; ++i) once();
    const double start = Now();
    for (int i = 0; i < iterations; ++i) once();
    return (Now() - start) / iterations * 1e6;
}

// Requests sent from the reply function of the previous one, |depth| at a time.
double MeasureChained(const RPCClientPtr& client, int total, int depth) {
    // Shared with the reply functions, which may still be running when the count completes.
    struct State {
        RPCClientPtr client;
        Call call = BuildCall("bench.echo", Value::array({"ping"}));
        int total = 0;
        std::atomic<int> sent{0};
        std::atomic<int> done{0};
        Gate finished;
    };
    auto state = std::make_shared<State>();
    state->client = client;
    state->total = total;
    struct Sender {
        static void SendOne(const std::shared_ptr<State>& st) {
            if (st->sent.fetch_add(1) >= st->total) return;
            st->client->SendRequest(
                st->call,
                [st](const Value&, RequestId) {
                    SendOne(st);
                    if (st->done.fetch_add(1) + 1 == st->total) st->finished.Open();
                },
                [](int32_t code, const WString& message, RequestId) {
                    std::fprintf(stderr, "bench_rpc: request failed (%d): %s\n", code, ToUTF8(message).c_str());
                    std::_Exit(1);
                });
        }
    };
    const double start = Now();
    for (int i = 0; i < depth; ++i) Sender::SendOne(state);
    state->finished.Wait();
    return Now() - start;
}

double MeasureBlocking(const RPCClientPtr& client, int iterations) {
    const Call call = BuildCall("bench.echo", Value::array({"ping"}));
    auto once = [&] {
        auto g = std::make_shared<Gate>();
        client->SendRequest(call, [g](const Value&, RequestId) { g->Open(); },
                            [g](int32_t, const WString&, RequestId) { g->Open(); });
        g->Wait();
    };
    for (int i = 0; i < 1000; ++i) once();
    const double start = Now();
    for (int i = 0; i < iterations; ++i) once();
    return (Now() - start) / iterations * 1e6;
}

}  // namespace

int main(int argc, char** argv) {
    bool json = false;
    int iterations = 20000;
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg == "--child" && i + 1 < argc) return RunChild(argv[i + 1]);
        if (arg == "--json") {
            json = true;
        } else if (arg == "--iterations" && i + 1 < argc) {
            iterations = std::max(100, std::atoi(argv[++i]));
        } else {
            std::fprintf(stderr, "usage: bench_rpc [--json] [--iterations N]\n");
            return 2;
        }
    }

    const std::string portFile = "/tmp/tidelink-bench-rpc-" + std::to_string(GetCurrentProcessID());
    if (LaunchProcess(GetCurrentExecutablePath(), {"--child", portFile}) < 0) {
        std::perror("bench_rpc: cannot start the child");
        return 1;
    }
    unsigned rpcPort = 0, rawPort = 0;
    for (int i = 0; i < 10000 && rpcPort == 0; ++i) {
        std::ifstream in(portFile);
        if (!(in >> rpcPort >> rawPort)) {
            rpcPort = 0;
            SleepMilliseconds(1);
        }
    }
    std::remove(portFile.c_str());
    if (rpcPort == 0) {
        std::fprintf(stderr, "bench_rpc: the child did not start\n");
        return 1;
    }

    const double rawRtt = MeasureRaw(static_cast<uint16_t>(rawPort), iterations);

    auto transport = SocketTransport::Create(CreateCPUBoundExecutor());
    auto session = transport->ClientStart("127.0.0.1", static_cast<uint16_t>(rpcPort));
    if (!session) {
        std::fprintf(stderr, "bench_rpc: cannot connect to the child\n");
        return 1;
    }
    auto client = std::make_shared<RPCClient>(session, "DirectClient");
    MeasureChained(client, 2000, 1);  // warm-up
    const double rtt = MeasureChained(client, iterations, 1) / iterations * 1e6;
    const double blockingRtt = MeasureBlocking(client, iterations);
    const int pipelinedTotal = iterations * 10;
    const double pipelinedRps = pipelinedTotal / MeasureChained(client, pipelinedTotal, kInFlight);

    client->SendNotification(BuildCall("bench.quit"));
    SleepMilliseconds(50);
    session->Close();

    if (json) {
        std::printf(
            "{\"rtt_us\": %.3f, \"raw_rtt_us\": %.3f, \"rtt_ratio\": %.3f, \"rtt_blocking_us\": %.3f, "
            "\"blocking_rtt_ratio\": %.3f, \"pipelined_rps\": %.0f, \"in_flight\": %d, \"iterations\": %d}\n",
            rtt, rawRtt, rtt / rawRtt, blockingRtt, blockingRtt / rawRtt, pipelinedRps, kInFlight, iterations);
    } else {
        std::printf("round trip, chained       %8.2f us\n", rtt);
        std::printf("round trip, caller waits  %8.2f us\n", blockingRtt);
        std::printf("raw TCP ping-pong         %8.2f us\n", rawRtt);
        std::printf("ratio (chained / raw)     %8.2f   (caller waits / raw %.2f)\n", rtt / rawRtt, blockingRtt / rawRtt);
        std::printf("pipelined, %d in flight   %8.0f requests/s\n", kInFlight, pipelinedRps);
    }
    return 0;
}
