#pragma once

#include "QelServer.hpp"
#include "support/Process.hpp"
#include "support/TemporaryDirectory.hpp"

#include <memory>
#include <string>
#include <vector>

namespace qel::bench {

/// One way to bring the output of a command here: a server, which runs until this is destroyed, and its client.
struct TerminalPeer {
    std::string name;
    std::vector<std::string> toReceive; ///< the client that writes the command's output to its own
    std::vector<std::string> toType;    ///< the client that joins its terminal with the far end's
};

/// `qel`, socat and, where it is installed, ssh, all on loopback: each plain or protected as it can be. The ports are
/// free ones.
class TerminalPeers {
public:
    /// @param output  a shell's command: what toReceive gets
    /// @param echo  a shell's command: what toType talks to
    /// @throws std::runtime_error  a server does not start; socat is missing
    TerminalPeers(const std::string& output, const std::string& echo);

    const std::vector<TerminalPeer>& all() const { return mPeers; }

private:
    void pAddQel(const char* name, const QelServer& server);
    void pAddSocat(const std::string& output, const std::string& echo);
    void pAddSsh(const std::string& output, const std::string& echo);
    std::string pListen(const std::vector<std::string>& arguments);

    const test::TemporaryDirectory mDirectory;
    const QelServer mPlain;
    const QelServer mTls;
    std::vector<std::unique_ptr<test::Process>> mServers;
    std::vector<TerminalPeer> mPeers;
};

} // namespace qel::bench
