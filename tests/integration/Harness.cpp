#include "Harness.h"

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <sstream>

#include "platform/Process.h"
#include "platform/SessionSecret.h"
#include "platform/SharedMemory.h"
#include "tidelink/core/LinkManager.h"

namespace tidelink::test {

namespace asio = boost::asio;

const std::string& SuiteVersion() {
    static const std::string version = [] {
        const char* v = std::getenv("TIDELINK_SUITE_VERSION");
        return std::string(v ? v : "");
    }();
    return version;
}

std::string BinDir() {
    const std::string exe = platform::GetCurrentExecutablePath();
    return exe.substr(0, exe.find_last_of('/'));
}

std::vector<uint32_t> OurManagers() {
    std::vector<uint32_t> ours;
    const std::string marker = "TIDELINK_SUITE_VERSION=" + SuiteVersion();
    for (uint32_t pid : platform::GetProcessIDsForName(kTideLinkManagerName)) {
        std::ifstream in("/proc/" + std::to_string(pid) + "/environ", std::ios::binary);
        std::string entry;
        while (std::getline(in, entry, '\0')) {
            if (entry == marker) {
                ours.push_back(pid);
                break;
            }
        }
    }
    return ours;
}

void SendSignal(uint32_t pid, int signal) { ::kill(static_cast<pid_t>(pid), signal); }

bool WaitForExit(uint32_t pid, double seconds) {
    // Our own children are reaped by the launcher; others vanish from the process list.
    return WaitFor(
        [pid] {
            std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
            std::string line;
            if (!std::getline(in, line)) return true;
            const auto close = line.rfind(')');
            return close != std::string::npos && close + 2 < line.size() && line[close + 2] == 'Z';
        },
        seconds);
}

void StopOurManagers() {
    for (uint32_t pid : OurManagers()) {
        SendSignal(pid, SIGTERM);
        if (!WaitForExit(pid, 5.0)) {
            SendSignal(pid, SIGKILL);
            WaitForExit(pid, 5.0);
        }
    }
}

std::vector<std::string> OurSharedMemory() {
    std::vector<std::string> ours;
    const std::string suffix = CSVersionPortNumberString();
    for (const auto& name : platform::ListSharedMemoryNames("")) {
        if (name.size() > suffix.size() &&
            name.compare(name.size() - suffix.size(), suffix.size(), suffix) == 0) {
            ours.push_back(name);
        }
    }
    return ours;
}

CommandResult RunCommand(const std::string& command) {
    CommandResult result;
    char errPath[] = "/tmp/tidelink-test-stderr-XXXXXX";
    const int errFd = ::mkstemp(errPath);
    ::close(errFd);
    FILE* pipe = ::popen((command + " 2>" + errPath).c_str(), "r");
    if (pipe == nullptr) return result;
    std::array<char, 4096> buf;
    size_t n;
    while ((n = std::fread(buf.data(), 1, buf.size(), pipe)) > 0) result.out.append(buf.data(), n);
    const int status = ::pclose(pipe);
    result.exitCode = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    std::ifstream err(errPath);
    std::stringstream ss;
    ss << err.rdbuf();
    result.err = ss.str();
    ::unlink(errPath);
    return result;
}

RawClient::RawClient(uint16_t port) : mSocket(mIo) {
    mSocket.connect(asio::ip::tcp::endpoint(asio::ip::address_v4::loopback(), port));
}

void RawClient::Send(const std::vector<uint8_t>& bytes) {
    boost::system::error_code ec;
    asio::write(mSocket, asio::buffer(bytes), ec);
}

void RawClient::SendHello() {
    Send(platform::wire::MakeHello(*platform::GetSessionSecret()));
    std::array<uint8_t, platform::wire::kAckSize> ack{};
    asio::read(mSocket, asio::buffer(ack));
}

bool RawClient::ClosedWithin(double seconds) {
    mSocket.non_blocking(true);
    return WaitFor(
        [this] {
            std::array<uint8_t, 256> buf;
            boost::system::error_code ec;
            mSocket.read_some(asio::buffer(buf), ec);
            return ec && ec != asio::error::would_block;
        },
        seconds);
}

}  // namespace tidelink::test
