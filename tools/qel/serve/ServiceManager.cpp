#include "serve/ServiceManager.hpp"

#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Logging.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Failures.hpp"
#include "base/OptionChecks.hpp"

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <fcntl.h>
#include <limits>
#include <unistd.h>
#include <utility>

namespace qel::tool {

namespace {

constexpr int kFirstHandedDescriptor = 3;
constexpr std::uint64_t kMaxHandedDescriptors = 64;
constexpr auto kMaxPid = static_cast<std::uint64_t>(std::numeric_limits<pid_t>::max());
/// A time that can be halved and set as a timer whatever its type.
constexpr std::uint64_t kMaxWatchdogMicroseconds = std::uint64_t{366} * 24 * 60 * 60 * 1000 * 1000;

/// The text of a variable; empty: it is not set.
std::string variable(const char* name)
{
    const char* const text = std::getenv(name);
    return text == nullptr ? "" : text;
}

void warn(const char* name, const std::string& text, const std::string& reason)
{
    logLine(LogLevel::Warn, "the variable ", name, " is not used: ", quoted(text), " ", reason);
}

/// A variable for another process is not for this one.
bool isForThisProcess(const std::string& pid)
{
    const auto number = parseInteger(pid);
    return number && *number <= kMaxPid && static_cast<pid_t>(*number) == ::getpid();
}

std::chrono::microseconds watchdogTime()
{
    const std::string text = variable("WATCHDOG_USEC");
    const std::string pid = variable("WATCHDOG_PID");
    if (text.empty() || (!pid.empty() && !isForThisProcess(pid))) return {};
    const auto number = parseInteger(text);
    if (number && *number >= 2 && *number <= kMaxWatchdogMicroseconds) return std::chrono::microseconds(*number);
    warn("WATCHDOG_USEC", text, "is not an integer in [2, " + std::to_string(kMaxWatchdogMicroseconds) + "]");
    return {};
}

/// What is wrong with an address; empty: nothing.
std::string addressProblem(const std::string& address)
{
    if (address.size() < 2 || (address[0] != '/' && address[0] != '@')) return "is neither a path nor @NAME";
    if (address.size() >= sizeof(sockaddr_un::sun_path)) return "is longer than the address of a socket";
    return {};
}

/// A line of a message: the manager takes what follows a line feed for another entry.
std::string oneLine(std::string text)
{
    std::replace_if(
        text.begin(), text.end(), [](unsigned char character) { return character < 0x20 || character == 0x7F; }, ' ');
    return text;
}

} // namespace

ServiceManager ServiceManager::fromEnvironment()
{
    const std::string address = variable("NOTIFY_SOCKET");
    const std::string problem = address.empty() ? "" : addressProblem(address);
    if (problem.empty()) return {address, watchdogTime()};
    warn("NOTIFY_SOCKET", address, problem);
    return {"", watchdogTime()};
}

ServiceManager::ServiceManager(const std::string& address, std::chrono::microseconds watchdog)
    : mAddress(address), mWatchdog(watchdog)
{
    if (address.empty()) mWatchdog = std::chrono::microseconds::zero(); // there is nobody to tell
    if (address.empty() || !addressProblem(address).empty()) return;
    mTo.sun_family = AF_UNIX;
    std::memcpy(mTo.sun_path, address.data(), address.size());
    if (mTo.sun_path[0] == '@') mTo.sun_path[0] = '\0';
    const std::size_t terminator = address[0] == '@' ? 0 : 1; // of a path
    mToLength = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + address.size() + terminator);
    mSocket = UniqueFd(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    const int error = errno;
    if (mSocket.get() < 0) logLine(LogLevel::Warn, "the service manager is not told anything: ", PosixErrorCode(error));
}

void ServiceManager::ready(const std::string& status) { pTell("READY=1\nSTATUS=" + oneLine(status)); }

void ServiceManager::reloading()
{
    const auto now = std::chrono::duration_cast<std::chrono::microseconds>(TimeProvider::steady().time_since_epoch());
    pTell("RELOADING=1\nMONOTONIC_USEC=" + std::to_string(now.count()));
}

void ServiceManager::stopping() { pTell("STOPPING=1\nSTATUS=stopping"); }

void ServiceManager::feedWatchdog()
{
    pTellOwed();
    static_cast<void>(pSend("WATCHDOG=1"));
}

/// A manager that has not heard that the server is ready ends it after a time.
void ServiceManager::pTell(std::string message)
{
    mOwed = std::move(message);
    pTellOwed();
}

void ServiceManager::pTellOwed() noexcept
{
    if (!mOwed.empty() && pSend(mOwed)) mOwed.clear();
}

/// @return whether the manager has taken it
bool ServiceManager::pSend(const std::string& message) noexcept
{
    if (mSocket.get() < 0) return false;
    const auto* const to = reinterpret_cast<const sockaddr*>(&mTo);
    ssize_t sent = -1;
    do {
        sent = ::sendto(mSocket.get(), message.data(), message.size(), MSG_NOSIGNAL, to, mToLength);
    } while (sent < 0 && errno == EINTR);
    const int error = errno;
    if (sent >= 0) return true;
    if (std::exchange(mHasFailed, true)) return false;
    try {
        logLine(LogLevel::Warn, "cannot notify the service manager at ", quoted(mAddress), ": ", PosixErrorCode(error));
    } catch (const std::exception&) { // NOLINT(bugprone-empty-catch): a line of the log is not worth more
    }
    return false;
}

std::vector<UniqueFd> takeHandedSockets()
{
    const std::string count = variable("LISTEN_FDS");
    if (count.empty() || !isForThisProcess(variable("LISTEN_PID"))) return {};
    const auto number = parseInteger(count);
    if (!number || *number > kMaxHandedDescriptors) {
        throw CommandFailure(ExitStatus::Usage,
                             "the variable LISTEN_FDS: " + notAnIntegerIn(printable(count), 0, kMaxHandedDescriptors));
    }
    std::vector<UniqueFd> sockets;
    for (int fd = kFirstHandedDescriptor; fd < kFirstHandedDescriptor + static_cast<int>(*number); ++fd) {
        if (::fcntl(fd, F_SETFD, FD_CLOEXEC) != 0) {
            throw CommandFailure(ExitStatus::CannotConnect, "cannot listen on descriptor " + std::to_string(fd) +
                                                                ", which LISTEN_FDS names: it is not open");
        }
        sockets.emplace_back(fd);
    }
    return sockets;
}

} // namespace qel::tool
