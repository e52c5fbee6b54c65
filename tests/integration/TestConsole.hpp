#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/net/SocketStream.hpp>

#include "support/LoopbackEnds.hpp"
#include "support/Process.hpp"

#include <map>
#include <memory>
#include <string>
#include <vector>

namespace qel::test {

/// The command line of the program under test.
std::vector<std::string> qelCommand(const std::vector<std::string>& arguments);

/// Runs the program until it exits.
Process::Result runQel(const std::vector<std::string>& arguments);

/// "qel serve" on a port of its own.
class ServeProcess {
public:
    /// @param options  besides --listen and those of the transport
    /// @param environment  added to that of the test
    explicit ServeProcess(const std::vector<std::string>& options = {}, const std::string& listen = "127.0.0.1:0",
                          const std::vector<std::string>& transport = {"--plain"},
                          const std::map<std::string, std::string>& environment = {});

    Process& process() { return mProcess; }
    const std::string& endpoint() const { return mEndpoint; }

    /// "qel call" to it, plain.
    Process::Result call(const std::vector<std::string>& arguments) const;

    /// Stops it by a signal and expects exit status 0.
    Process::Result stop(int signal = SIGTERM);

    /// @return how many threads it has
    std::size_t threads() const;

private:
    Process mProcess;
    std::string mEndpoint;
};

/// A console with a connection of its own, driven frame by frame. Reads have a deadline.
class TestConsole {
public:
    explicit TestConsole(const std::string& endpoint);

    LoopbackMessages& messages() { return *mMessages; }
    SocketStream& stream() { return *mStream; }

    /// Sends a request, keeps data and drops notices until the response. @return the status of the response
    unsigned int statusOf(const QelMessage& request);

    /// The steps to an open virtual serial session; each expects status 0.
    void introduce(const std::string& toolId, std::uint32_t toolType = 5);
    void openSession(const std::string& toolId);
    void openSerial(std::uint16_t partition);

    void type(std::uint16_t partition, const std::string& text);

    /// Reads serial data until they contain the text; broadcasts in between are dropped. @return the serial data
    /// since the last call, up to the end of the text; the next call gets what follows
    std::string readUntil(std::uint16_t partition, const std::string& text);

    /// Takes messages until a session-closed notice. @return its reason
    unsigned int awaitClosed(std::uint16_t partition);

    /// Closes the connection without a request to close the session.
    void vanish() { mStream.reset(); }
    /// Closes it with a TCP reset.
    void reset();

private:
    std::unique_ptr<QelMessage> next();
    bool keepData(const QelMessage& message);

    std::unique_ptr<SocketStream> mStream;
    std::unique_ptr<LoopbackMessages> mMessages;
    std::string mData; // serial data received and not yet returned
};

/// Waits until a console accepts nothing more: broadcasts to it are refused a thousand times in a row.
void awaitStuck(TestConsole& other, const std::string& toolId, std::uint32_t toolType);

} // namespace qel::test
