// Shared set-up of the integration tests: every test process runs against its own suite version
// and runtime folder, and leaves no link manager or shared-memory object behind.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include <utility>  // before asio: its C++20 coroutine header needs std::exchange
#include <boost/asio.hpp>

#include "platform/Wire.h"

namespace tidelink::test {

// Suite version of this test process ("9" + five digits), set in the environment by main().
const std::string& SuiteVersion();
// Folder holding the built executables.
std::string BinDir();

// Live link managers started for this test process's suite version.
std::vector<uint32_t> OurManagers();
// Stops them (SIGTERM, then SIGKILL after 5 s) and waits until they are gone.
void StopOurManagers();
// Names in /dev/shm that belong to this test process's suite version.
std::vector<std::string> OurSharedMemory();

void SendSignal(uint32_t pid, int signal);
// Waits up to |seconds| for the process to end.
bool WaitForExit(uint32_t pid, double seconds);
// Waits up to |seconds| for |predicate|.
template <class F>
bool WaitFor(F predicate, double seconds);

struct CommandResult {
    int exitCode = -1;
    std::string out;
    std::string err;
};
// Runs a command line through the shell, capturing stdout and stderr.
CommandResult RunCommand(const std::string& command);

// A plain socket for feeding the servers hand-made bytes.
class RawClient {
public:
    explicit RawClient(uint16_t port);
    void Send(const std::vector<uint8_t>& bytes);
    void SendHello();  // a correct hello, acknowledgement read
    // True when the peer closed the connection within |seconds|.
    bool ClosedWithin(double seconds);

private:
    boost::asio::io_context mIo;
    boost::asio::ip::tcp::socket mSocket;
};

}  // namespace tidelink::test

#include "Harness.inl"
