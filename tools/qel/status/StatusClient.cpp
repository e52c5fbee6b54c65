#include "status/StatusClient.hpp"

#include <qel/common/util/Poll.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/common/util/UniqueFd.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Failures.hpp"
#include "status/StatusSocket.hpp"

#include <array>
#include <cerrno>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <sys/socket.h>
#include <unistd.h>
#include <utility>

namespace qel::tool {

namespace {

/// A report of as many consoles and partitions as there may be has less than a mebibyte.
constexpr std::size_t kMostBytes = 16 * 1024 * 1024;

/// That of the service: see qel-serve.service.
constexpr const char* kServiceSocket = "/run/qel/status.sock";

class Exchange {
public:
    Exchange(const std::string& path, std::chrono::milliseconds timeout)
        : mPath(path), mFd(connectStatus(path)), mEnd(TimeProvider::steady() + timeout)
    {}

    void send(std::string line)
    {
        line += '\n';
        while (!line.empty()) {
            pWait(PollEvents::Write);
            const ssize_t count = ::send(mFd.get(), line.data(), line.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
            if (count >= 0) {
                line.erase(0, static_cast<std::size_t>(count));
            } else if (!pMayTryAgain()) {
                return; // what it has answered before closing may say why
            }
        }
    }

    /// @return what the server sends until it closes the connection
    std::string receive()
    {
        std::string text;
        std::array<char, 16384> buffer;
        for (;;) {
            pWait(PollEvents::Read);
            const ssize_t count = ::recv(mFd.get(), buffer.data(), buffer.size(), MSG_DONTWAIT);
            if (count > 0) text.append(buffer.data(), static_cast<std::size_t>(count));
            if (count == 0 || (count < 0 && !pMayTryAgain())) return text;
            if (text.size() > kMostBytes) pFail(ExitStatus::ProtocolBroken, "sends too much");
        }
    }

    [[noreturn]] void pFail(ExitStatus status, const std::string& what) const
    {
        throw CommandFailure(status, "the server at " + printable(mPath) + " " + what);
    }

private:
    static bool pMayTryAgain() { return errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR; }

    void pWait(PollEvents events) const
    {
        const auto now = TimeProvider::steady();
        if (mEnd.isExpired(now)) pFail(ExitStatus::DeadlinePassed, "does not answer");
        static_cast<void>(PollSet(PollFd(mFd.get(), events)).wait(mEnd.getTimeout(now)));
    }

    const std::string& mPath;
    const UniqueFd mFd;
    const PollDeadline mEnd;
};

} // namespace

std::string statusSocketFor(const std::string& option)
{
    if (!option.empty()) return option;
    const char* const variable = std::getenv("QEL_STATUS_SOCKET");
    if (variable != nullptr && *variable != '\0') return variable;
    std::string usual = defaultStatusSocket();
    const auto exists = [](const std::string& path) { return ::access(path.c_str(), F_OK) == 0; };
    return !exists(usual) && exists(kServiceSocket) ? kServiceSocket : usual;
}

nlohmann::ordered_json askServer(const std::string& path, const std::string& request, std::chrono::milliseconds timeout)
{
    Exchange exchange(path, timeout);
    exchange.send(request);
    const std::string text = exchange.receive();
    if (text.empty()) exchange.pFail(ExitStatus::ClosedByPeer, "has closed the connection without an answer");
    auto answer = nlohmann::ordered_json::parse(text, nullptr, false);
    const auto ok = answer.is_object() ? answer.find("ok") : answer.end();
    if (ok == answer.end() || !ok->is_boolean()) {
        exchange.pFail(ExitStatus::ProtocolBroken, "gives an answer that is not understood");
    }
    if (ok->get<bool>()) return answer;
    const auto reason = answer.find("error");
    const bool hasReason = reason != answer.end() && reason->is_string();
    throw CommandFailure(ExitStatus::Refused,
                         hasReason ? printable(reason->get<std::string>()) : "the server gives no reason");
}

StatusReport askStatus(const std::string& path, std::chrono::milliseconds timeout)
{
    const auto answer = askServer(path, "status", timeout);
    try {
        return statusReportOf(answer.at("status"));
    } catch (const std::exception& error) {
        throw CommandFailure(ExitStatus::ProtocolBroken,
                             "the server at " + printable(path) +
                                 " gives a status that is not understood: " + printable(error.what()));
    }
}

} // namespace qel::tool
