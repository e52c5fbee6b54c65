// A hypervisor with one partition, a shell. Over TLS, the certificate "operator" may use it, and no other.
#include <qel/protocol/CommandLine.hpp>
#include <qel/protocol/Server.hpp>

#include <csignal>
#include <exception>
#include <iostream>
#include <sys/signalfd.h>

namespace {

class Machine : public qel::protocol::Hypervisor {
    bool mayOpen(const qel::protocol::Peer& peer, std::uint16_t) override
    {
        return !peer.isProtected || peer.commonName == "operator";
    }
};

/// Makes the signal that ends a program readable from a descriptor.
qel::PollFd watchTermination()
{
    sigset_t signals;
    ::sigemptyset(&signals);
    ::sigaddset(&signals, SIGTERM);
    ::sigprocmask(SIG_BLOCK, &signals, nullptr);
    return qel::PollFd(::signalfd(-1, &signals, SFD_CLOEXEC), qel::PollEvents::Read);
}

} // namespace

int main(int count, char** words)
try {
    if (count != 1 && count != 3) throw std::invalid_argument("usage: hypervisor [DIRECTORY NAME]");
    const qel::PollFd stop = watchTermination();
    qel::protocol::ServerOptions options;
    options.plain = count == 1; // otherwise TLS, with credentials as "qel ca" writes them
    if (!options.plain) options.credentials = qel::protocol::Credentials::fromDirectory(words[1], words[2]);
    Machine machine;
    machine.addPartition(1, qel::protocol::commandLine("/bin/sh"));
    qel::protocol::Server server(machine, options);
    std::cout << server.endpoints().front() << std::endl;
    server.run(stop);
} catch (const std::exception& error) {
    return std::cerr << "hypervisor: " << error.what() << std::endl, 1;
}
