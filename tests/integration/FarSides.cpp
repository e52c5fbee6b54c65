#include "integration/FarSides.hpp"

#include <qel/common/net/Socket.hpp>
#include <qel/common/util/PosixError.hpp>

#include "support/ComesTrue.hpp"

#include <chrono>
#include <cstdlib>
#include <fstream>
#include <random>
#include <sstream>
#include <stdexcept>
#include <sys/socket.h>
#include <unistd.h>

namespace qel::test {

namespace {

std::size_t countOf(const std::string& part, const std::string& text)
{
    std::size_t count = 0;
    for (std::size_t at = text.find(part); at != std::string::npos; at = text.find(part, at + part.size()))
        ++count;
    return count;
}

IPEndpoint localEndpoint(std::uint16_t port) { return IPEndpoint("127.0.0.1:" + std::to_string(port)); }

bool isFree(std::uint16_t port)
{
    try {
        Socket(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0).bind(localEndpoint(port));
        return true;
    } catch (const PosixError&) {
        return false;
    }
}

bool accepts(std::uint16_t port)
{
    try {
        Socket(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0).connect(localEndpoint(port), std::chrono::seconds(1));
        return true;
    } catch (const PosixError&) {
        return false;
    }
}

} // namespace

std::string pathOfProgram(const std::string& name)
{
    const char* const path = std::getenv("PATH");
    std::istringstream folders((path == nullptr ? "/usr/bin:/bin" : path) + std::string(":/usr/sbin"));
    for (std::string folder; std::getline(folders, folder, ':');) {
        const std::string file = folder + "/" + name;
        if (::access(file.c_str(), X_OK) == 0) return file;
    }
    return {};
}

Socat::Socat(const std::string& first, const std::string& second, const std::string& notice, std::size_t notices)
    : mProcess(std::make_unique<Process>(std::vector<std::string>{pathOfProgram("socat"), "-d", "-d", first, second}))
{
    const bool isReady = comesTrue([&] { return countOf(notice, mProcess->errors()) >= notices; });
    if (!isReady) throw std::runtime_error("socat is not ready: " + mProcess->errors());
}

Socat Socat::unixEcho(const std::string& path, bool forever)
{
    return Socat("UNIX-LISTEN:" + path + (forever ? ",fork" : ""), "PIPE", "listening on");
}

Socat Socat::tcpEcho(bool forever)
{
    return Socat(std::string("TCP-LISTEN:0,bind=127.0.0.1") + (forever ? ",fork" : ""), "PIPE", "listening on");
}

Socat Socat::terminals(const std::string& first, const std::string& second)
{
    return Socat("PTY,raw,echo=0,link=" + first, "PTY,raw,echo=0,link=" + second, "starting data transfer loop");
}

std::uint16_t Socat::port() const
{
    const std::string start = "127.0.0.1:";
    const std::string text = mProcess->errors();
    return static_cast<std::uint16_t>(std::stoul(text.substr(text.find(start) + start.size())));
}

Ser2Net::Ser2Net(const std::string& device) : mDevice(device)
{
    // It cannot be told to take any port, so a port is looked for that the system does not hand out by itself. Another
    // program may take it meanwhile; then the next one is tried.
    constexpr unsigned kFirstPort = 20000;
    constexpr unsigned kPorts = 12000;
    std::random_device random;
    for (int attempt = 0; attempt < 10; ++attempt) {
        const auto port = static_cast<std::uint16_t>(kFirstPort + random() % kPorts);
        if (isFree(port) && start(port)) return;
    }
    throw std::runtime_error("ser2net does not listen: " + mProcess->errors());
}

/// @return false: it does not listen
bool Ser2Net::start(std::uint16_t port)
{
    mAddress = localEndpoint(port).str();
    const std::string path = mDirectory.file("ser2net.yaml");
    std::ofstream(path) << "%YAML 1.1\n---\n"
                        << "connection: &port\n"
                        << "  accepter: telnet(rfc2217),tcp,127.0.0.1," << port << "\n"
                        << "  connector: serialdev," << mDevice << ",9600n81,local\n"
                        << "  options:\n"
                        << "    kickolduser: true\n"; // the connection that tries the port is gone a little later
    mProcess = std::make_unique<Process>(std::vector<std::string>{pathOfProgram("ser2net"), "-n", "-c", path});
    return comesTrue([port] { return accepts(port); });
}

} // namespace qel::test
