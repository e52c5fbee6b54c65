#pragma once

#include "support/Process.hpp"
#include "support/TemporaryDirectory.hpp"

#include <chrono>
#include <cstddef>
#include <memory>
#include <string>
#include <vector>

/// @file
/// `qel serve` and `qel bench` as processes, for the programs that measure them.

namespace qel::bench {

/// From now on SIGINT, SIGTERM and SIGHUP only set what isStopped() returns, so that processes and files are cleaned
/// up; SIGPIPE is ignored.
void stopOnSignals();
bool isStopped();

/// @throws std::runtime_error  isStopped()
void checkNotStopped();

/// A `qel serve` on loopback, and certificates for it and for those who connect. They run with the caller's affinity.
class QelServer {
public:
    enum class Protection { Plain, Tls };

    /// What a run of `qel bench` has reported.
    struct Figures {
        double perSecond; // messages
        double p50;       // microseconds
        double p99;       // microseconds
    };

    /// @param more  options of `qel serve`
    /// @throws std::runtime_error  one of the programs failed; what it wrote is in the text
    explicit QelServer(Protection protection, const std::vector<std::string>& more = {});

    /// Runs `qel bench`.
    /// @throws std::runtime_error  it failed, or isStopped()
    Figures measure(unsigned int consoles, std::size_t payload, std::chrono::milliseconds time);

    /// `qel` with a subcommand that connects to the server, and then more of its arguments.
    std::vector<std::string> client(const std::string& subcommand, const std::vector<std::string>& more) const;

    const test::Process& process() const { return *mServer; }

    /// Where the certificates are: "server.crt", "server.key", "operator.crt", "operator.key" and "root.crt".
    std::string credentials() const { return pCredentials(); }

private:
    std::string pCredentials() const { return mDirectory.file("authority"); }

    const test::TemporaryDirectory mDirectory;
    const Protection mProtection;
    std::unique_ptr<test::Process> mServer;
    std::string mEndpoint;
};

} // namespace qel::bench
