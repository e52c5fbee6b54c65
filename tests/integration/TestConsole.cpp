#include "integration/TestConsole.hpp"

#include <filesystem>
#include <gtest/gtest.h>
#include <stdexcept>

namespace qel::test {

namespace {

std::vector<std::string> serveArguments(const std::vector<std::string>& options, const std::string& listen,
                                        const std::vector<std::string>& transport)
{
    std::vector<std::string> arguments{"serve", "--listen", listen};
    arguments.insert(arguments.end(), transport.begin(), transport.end());
    arguments.insert(arguments.end(), options.begin(), options.end());
    return qelCommand(arguments);
}

/// Without the default status socket, which all servers of a user would share.
std::map<std::string, std::string> withoutRuntimeDirectory(std::map<std::string, std::string> environment)
{
    environment.emplace("XDG_RUNTIME_DIR", "");
    return environment;
}

} // namespace

std::vector<std::string> qelCommand(const std::vector<std::string>& arguments)
{
    std::vector<std::string> command{QEL_PROGRAM};
    command.insert(command.end(), arguments.begin(), arguments.end());
    return command;
}

Process::Result runQel(const std::vector<std::string>& arguments) { return run(qelCommand(arguments)); }

ServeProcess::ServeProcess(const std::vector<std::string>& options, const std::string& listen,
                           const std::vector<std::string>& transport,
                           const std::map<std::string, std::string>& environment)
    : mProcess(serveArguments(options, listen, transport), withoutRuntimeDirectory(environment)),
      mEndpoint(mProcess.readLine())
{}

Process::Result ServeProcess::call(const std::vector<std::string>& arguments) const
{
    std::vector<std::string> command{"call", "--connect", mEndpoint, "--plain"};
    command.insert(command.end(), arguments.begin(), arguments.end());
    return runQel(command);
}

Process::Result ServeProcess::stop(int signal)
{
    mProcess.signal(signal);
    const Process::Result result = mProcess.wait();
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    EXPECT_EQ(result.signal, 0);
    return result;
}

std::size_t ServeProcess::threads() const
{
    namespace fs = std::filesystem;
    const fs::path directory = "/proc/" + std::to_string(mProcess.pid()) + "/task";
    return static_cast<std::size_t>(std::distance(fs::directory_iterator(directory), fs::directory_iterator()));
}

TestConsole::TestConsole(const std::string& endpoint)
{
    const IPEndpoint to(endpoint);
    Socket socket(to.getFamily(), SOCK_STREAM | SOCK_CLOEXEC, 0);
    socket.connect(to, Loopback::kDeadline);
    mStream = std::make_unique<SocketStream>(std::move(socket));
    mStream->setReadDeadline(Process::kDeadline);
    mMessages = std::make_unique<LoopbackMessages>(*mStream);
}

unsigned int TestConsole::statusOf(const QelMessage& request)
{
    mMessages->send(request);
    for (;;) {
        const auto message = next();
        if (keepData(*message) || message->getCallerId() != request.getCallerId()) continue;
        return message->getStatus();
    }
}

void TestConsole::introduce(const std::string& toolId, std::uint32_t toolType)
{
    ASSERT_EQ(statusOf(QelMessageGetEnclTypeAndInterfaceVersionReq(1, toolType, 1, 0, toolId)), 0U);
}

void TestConsole::openSession(const std::string& toolId)
{
    introduce(toolId);
    ASSERT_EQ(statusOf(QelMessageInterfaceCmpOpenKrogSessionReq()), 0U);
}

void TestConsole::openSerial(std::uint16_t partition)
{
    ASSERT_EQ(statusOf(QelMessageVirtualSerialOpenReq(partition, 0, false)), 0U);
    ASSERT_EQ(statusOf(QelMessageVirtualSerialSetupSessionReq(partition, 0)), 0U);
}

void TestConsole::type(std::uint16_t partition, const std::string& text)
{
    mMessages->send(
        QelMessageVirtualSerialDataToOsAsync(partition, 0, static_cast<std::uint16_t>(text.size()), text.data()));
}

std::string TestConsole::readUntil(std::uint16_t partition, const std::string& text)
{
    static_cast<void>(partition); // the tests open one at a time
    while (mData.find(text) == std::string::npos) {
        const auto message = next();
        if (keepData(*message) || message->getOperation() == QelMessageOpOutboundBroadcastAsync) continue;
        throw std::runtime_error("no data, after: " + mData);
    }
    const std::size_t end = mData.find(text) + text.size();
    std::string found = mData.substr(0, end);
    mData.erase(0, end);
    return found;
}

unsigned int TestConsole::awaitClosed(std::uint16_t partition)
{
    for (;;) {
        const auto message = next();
        if (keepData(*message)) continue;
        const auto& notice = qelMessageCast<QelMessageVirtualSerialSessionClosedAsync>(*message);
        EXPECT_EQ(notice.getLpId(), partition);
        return notice.getCloseReason();
    }
}

void TestConsole::reset()
{
    linger now{};
    now.l_onoff = 1;
    ::setsockopt(mStream->getSocket().getFd(), SOL_SOCKET, SO_LINGER, &now, sizeof(now));
    mStream.reset();
}

std::unique_ptr<QelMessage> TestConsole::next() { return mMessages->receive(); }

bool TestConsole::keepData(const QelMessage& message)
{
    const auto* data = dynamic_cast<const QelMessageVirtualSerialDataToDaxAsync*>(&message);
    if (data == nullptr) return false;
    if (data->getSerialDataLength() > 0) mData.append(data->getSerialData(), data->getSerialDataLength());
    return true;
}

void awaitStuck(TestConsole& other, const std::string& toolId, std::uint32_t toolType)
{
    for (int refusals = 0; refusals < 1000;) {
        const unsigned int status = other.statusOf(QelMessageDaxBroadcastReq(1, 1, toolType, toolId, "x"));
        refusals = status == QelMessageStatusCmdFailed ? refusals + 1 : 0;
    }
}

} // namespace qel::test
