#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/net/SocketStream.hpp>

#include "support/Process.hpp"
#include "tools/transport/Loopback.hpp"

#include <memory>
#include <string>
#include <vector>

namespace qel::test {

/// The program under test, with some arguments.
std::vector<std::string> qelCommand(const std::vector<std::string>& arguments);

/// Runs the program to its end.
Process::Result runQel(const std::vector<std::string>& arguments);

/// "qel serve" on a port of its own.
class ServeProcess {
public:
    /// @param options  besides --listen and those of the transport
    explicit ServeProcess(const std::vector<std::string>& options = {}, const std::string& listen = "127.0.0.1:0",
                          const std::vector<std::string>& transport = {"--plain"});

    Process& process() { return mProcess; }
    const std::string& endpoint() const { return mEndpoint; }

    /// "qel call" to it, plain.
    Process::Result call(const std::vector<std::string>& arguments) const;

    /// Asks it to stop and expects that it does so cleanly.
    Process::Result stop(int signal = SIGTERM);

    /// The threads it has.
    std::size_t threads() const;

private:
    Process mProcess;
    std::string mEndpoint;
};

/// A console that talks to a server over its own connection, frame by frame. Reads have a deadline.
class TestConsole {
public:
    explicit TestConsole(const std::string& endpoint);

    LoopbackMessages& messages() { return *mMessages; }
    SocketStream& stream() { return *mStream; }

    /// Sends a request, takes notices and data that come in between, and returns the status of the response.
    unsigned int statusOf(const QelMessage& request);

    /// The steps up to a virtual serial session, each expected to be granted.
    void introduce(const std::string& toolId, std::uint32_t toolType = 5);
    void openSession(const std::string& toolId);
    void openSerial(std::uint16_t partition);

    void type(std::uint16_t partition, const std::string& text);

    /// Reads serial data until they contain the text; broadcasts in between are dropped. @return all serial data since
    /// the last call
    std::string readUntil(std::uint16_t partition, const std::string& text);

    /// Takes messages until a session-closed notice. @return its reason
    unsigned int awaitClosed(std::uint16_t partition);

    /// Cuts the connection without any farewell.
    void vanish() { mStream.reset(); }
    /// The same with a reset.
    void reset();

private:
    std::unique_ptr<QelMessage> next();
    bool keepData(const QelMessage& message);

    std::unique_ptr<SocketStream> mStream;
    std::unique_ptr<LoopbackMessages> mMessages;
    std::string mData; // serial data that nobody asked for yet
};

} // namespace qel::test
