#include "support/TlsPrograms.hpp"

#include <qel/common/net/SocketStream.hpp>

#include "support/Loopback.hpp"

#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iomanip>
#include <netinet/in.h>
#include <poll.h>
#include <set>
#include <sstream>
#include <stdexcept>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>
#include <utility>

namespace qel::test {

namespace {

namespace fs = std::filesystem;

constexpr std::chrono::seconds kPatience{20};

void writeFile(const std::string& name, const std::string& text)
{
    std::ofstream file(name);
    file << text;
    if (!file.flush()) throw std::runtime_error("cannot write " + name);
}

/// The numbers of the sockets that a process has open: its descriptors are links to "socket:[4711]".
std::set<std::string> socketsOf(pid_t process)
{
    std::set<std::string> numbers;
    std::error_code error; // a descriptor may vanish while one looks
    for (const auto& entry : fs::directory_iterator("/proc/" + std::to_string(process) + "/fd", error)) {
        const std::string target = fs::read_symlink(entry, error).string();
        const std::string start = "socket:[";
        if (target.compare(0, start.size(), start) == 0) {
            numbers.insert(target.substr(start.size(), target.size() - start.size() - 1));
        }
    }
    return numbers;
}

/// What a process listens at. See proc_net_tcp(5).
struct Listening {
    std::string address; ///< as in the table: each four bytes of it as the hexadecimal number that they are here
    std::uint16_t port = 0;
};

/// @param table  "tcp" for IPv4, "tcp6" for IPv6
std::vector<Listening> listeningOf(pid_t process, const std::string& table)
{
    std::vector<Listening> all;
    const std::set<std::string> own = socketsOf(process);
    std::ifstream lines("/proc/" + std::to_string(process) + "/net/" + table);
    std::string line;
    std::getline(lines, line); // the titles
    while (std::getline(lines, line)) {
        std::istringstream words(line);
        std::vector<std::string> columns;
        for (std::string word; words >> word;)
            columns.push_back(word);
        const bool listens = columns.size() > 9 && columns[3] == "0A";
        if (!listens || own.count(columns[9]) == 0) continue;
        const std::size_t colon = columns[1].find(':');
        const auto port = static_cast<std::uint16_t>(std::stoul(columns[1].substr(colon + 1), nullptr, 16));
        all.push_back({columns[1].substr(0, colon), port});
    }
    return all;
}

/// @return four bytes of an address as the tables have them
std::string inTable(std::uint32_t hostOrder)
{
    std::ostringstream text;
    text << std::hex << std::uppercase << std::setw(8) << std::setfill('0') << htonl(hostOrder);
    return text.str();
}

/// @return the port at which a process accepts connections of IPv4; 0 when it does not
/// @throws std::runtime_error  others than this machine could connect
std::uint16_t listeningPort(pid_t process)
{
    std::uint16_t port = 0;
    for (const Listening& listening : listeningOf(process, "tcp")) {
        if (listening.address != inTable(INADDR_LOOPBACK)) throw std::runtime_error("it listens to the whole network");
        port = listening.port;
    }
    for (const Listening& listening : listeningOf(process, "tcp6")) {
        if (listening.address != inTable(0) + inTable(0) + inTable(0) + inTable(1))
            throw std::runtime_error("it listens to the whole network");
    }
    return port;
}

} // namespace

CredentialFiles::CredentialFiles(const SSLCredentials& credentials)
{
    writeFile(certificate(), credentials.mCert);
    writeFile(key(), credentials.mKey);
    writeFile(root(), credentials.mRootCA);
}

bool hasProgram(const std::string& name)
{
    const char* const path = std::getenv("PATH");
    std::istringstream folders(path != nullptr ? path : "");
    for (std::string folder; std::getline(folders, folder, ':');) {
        if (::access((folder + "/" + name).c_str(), X_OK) == 0) return true;
    }
    return false;
}

void ProgramTest::skipWithout(const std::string& program)
{
    if (!hasProgram(program)) GTEST_SKIP() << "there is no " << program << " on this machine";
}

std::unique_ptr<Process> ProgramTest::start(std::vector<std::string> command)
{
    command.insert(command.begin(), "/usr/bin/env");
    return std::make_unique<Process>(command);
}

std::unique_ptr<Process> ProgramTest::startOnLoopback(std::vector<std::string> command)
{
    command.insert(command.begin(), "LD_PRELOAD=" QEL_LOOPBACK_ONLY); // env(1) takes it
    return start(std::move(command));
}

std::string ProgramTest::listen()
{
    mListener = makeListener();
    return std::to_string(mListener.getSocketName().getPort());
}

std::unique_ptr<SSLStream> ProgramTest::acceptClient(Identity identity)
{
    return acceptClient(serverContext(identity));
}

std::unique_ptr<SSLStream> ProgramTest::acceptClient(SSLServerContext& context)
{
    // accept() knows no deadline of its own, but heeds that of the socket.
    const timeval patience{kPatience.count(), 0};
    mListener.setSocketOption(SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof(patience));
    return std::make_unique<SSLStream>(context, pStreamOver(mListener.accept()));
}

std::unique_ptr<SSLStream> ProgramTest::connectTo(const Process& program, Identity identity)
{
    return connectTo(program, clientContext(identity));
}

std::unique_ptr<SSLStream> ProgramTest::connectTo(const Process& program, SSLClientContext& context)
{
    const auto end = std::chrono::steady_clock::now() + kPatience;
    std::uint16_t port = 0;
    while ((port = listeningPort(program.pid())) == 0) {
        if (std::chrono::steady_clock::now() > end) throw std::runtime_error("no process listens: " + program.errors());
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    Socket socket(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0);
    socket.connect(IPEndpoint(IPv4Address{127, 0, 0, 1}, port), kPatience);
    return std::make_unique<SSLStream>(context, pStreamOver(std::move(socket)));
}

void ProgramTest::awaitBytes() const
{
    pollfd connection{mConnection, POLLIN, 0};
    const int timeout = static_cast<int>(std::chrono::milliseconds(kPatience).count());
    if (::poll(&connection, 1, timeout) != 1) throw std::runtime_error("nothing arrives");
}

std::unique_ptr<Stream> ProgramTest::pStreamOver(Socket socket)
{
    mConnection = socket.getFd();
    auto stream = std::make_unique<SocketStream>(std::move(socket));
    stream->setReadDeadline(kPatience);
    stream->setWriteDeadline(kPatience);
    return stream;
}

} // namespace qel::test
