#pragma once

#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/net/Listen.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/net/SocketStream.hpp>

#include "integration/TestConsole.hpp"

#include <exception>
#include <functional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace qel::test {

/// A server that a test scripts: runs one function on the first connection.
class WrongServer {
public:
    explicit WrongServer(std::function<void(LoopbackMessages&)> behave)
        : mListener(listenOn(IPEndpoint("127.0.0.1:0"), 1)), mEndpoint(mListener.getSocketName().str()),
          mThread([this, behave = std::move(behave)] {
              SocketStream stream(mListener.accept());
              stream.setReadDeadline(Process::kDeadline);
              LoopbackMessages messages(stream);
              try {
                  behave(messages);
              } catch (const std::exception&) { // the client has closed the connection
              }
          })
    {}
    ~WrongServer() { mThread.join(); }

    const std::string& endpoint() const { return mEndpoint; }

    /// Runs "qel call" against it, without TLS.
    Process::Result call(const std::vector<std::string>& arguments) const
    {
        std::vector<std::string> command{"call", "--connect", mEndpoint, "--plain"};
        command.insert(command.end(), arguments.begin(), arguments.end());
        return runQel(command);
    }

private:
    Socket mListener;
    std::string mEndpoint;
    std::thread mThread;
};

} // namespace qel::test
