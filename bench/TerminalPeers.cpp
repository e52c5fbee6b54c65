#include "TerminalPeers.hpp"

#include <fstream>
#include <stdexcept>
#include <sys/stat.h>
#include <unistd.h>

namespace qel::bench {

namespace {

using test::Process;

std::vector<std::string> partitions(const std::string& output, const std::string& echo)
{
    // What a command has put out is not wanted again by the next one.
    return {"--log-level", "error", "--replay", "0", "--partition", "1=" + output, "--partition", "2=" + echo};
}

/// A certificate and its key in one file, as socat wants them.
void joinFiles(const std::string& joined, const std::string& name)
{
    std::ofstream file(joined);
    for (const char* const kind : {".crt", ".key"})
        file << std::ifstream(name + kind).rdbuf();
    if (!file.flush().good()) throw std::runtime_error("cannot write " + joined);
}

void makeKey(const std::string& file)
{
    const Process::Result made = test::run({"/usr/bin/ssh-keygen", "-q", "-t", "ed25519", "-N", "", "-f", file});
    if (made.exitStatus != 0) throw std::runtime_error("ssh-keygen: " + made.errors);
}

} // namespace

TerminalPeers::TerminalPeers(const std::string& output, const std::string& echo)
    : mPlain(QelServer::Protection::Plain, partitions(output, echo)),
      mTls(QelServer::Protection::Tls, partitions(output, echo))
{
    pAddQel("qel, plain", mPlain);
    pAddQel("qel, TLS", mTls);
    pAddSocat(output, echo);
    pAddSsh(output, echo);
}

void TerminalPeers::pAddQel(const char* name, const QelServer& server)
{
    mPeers.push_back({name, server.client("console", {"--no-eof", "1"}), server.client("console", {"2"})});
}

void TerminalPeers::pAddSocat(const std::string& output, const std::string& echo)
{
    const std::string own = mDirectory.file("server.pem");
    const std::string client = mDirectory.file("operator.pem");
    const std::string root = mTls.credentials() + "/root.crt";
    joinFiles(own, mTls.credentials() + "/server");
    joinFiles(client, mTls.credentials() + "/operator");
    const std::string listen = ":0,bind=127.0.0.1,fork,nodelay";
    const std::string tls = ",cert=" + own + ",cafile=" + root + ",verify=1";
    const auto serve = [&](const std::string& address, const std::string& command) {
        return pListen({address, "SYSTEM:\"" + command + "\",pty,rawer"});
    };
    const auto add = [&](const char* name, const std::string& listener, const std::string& connector,
                         const std::string& options) {
        const std::string one = connector + serve(listener, output) + options;
        const std::string other = connector + serve(listener, echo) + options;
        mPeers.push_back({name, {"socat", "-u", one, "STDOUT"}, {"socat", "-,raw,echo=0", other}});
    };
    add("socat, TCP", "TCP-LISTEN" + listen, "TCP:", ",nodelay");
    add("socat, TLS", "OPENSSL-LISTEN" + listen + tls,
        "OPENSSL:", ",nodelay,commonname=server,cert=" + client + ",cafile=" + root);
}

/// A server of its own for each connection, which socat starts: sshd takes no port 0.
void TerminalPeers::pAddSsh(const std::string& output, const std::string& echo)
{
    constexpr const char* kServer = "/usr/sbin/sshd";
    if (::access(kServer, X_OK) != 0) return;
    if (::getuid() == 0) static_cast<void>(::mkdir("/run/sshd", 0755)); // where it locks its children in
    const std::string hostKey = mDirectory.file("host");
    const std::string key = mDirectory.file("user");
    const std::string config = mDirectory.file("sshd_config");
    makeKey(hostKey);
    makeKey(key);
    std::ofstream(config) << "HostKey " << hostKey << "\nAuthorizedKeysFile " << key
                          << ".pub\nStrictModes no\nUsePAM no\nPrintMotd no\nPrintLastLog no\nPidFile none\n";
    const std::string address = pListen(
        {"TCP-LISTEN:0,bind=127.0.0.1,fork,nodelay", "EXEC:" + std::string(kServer) + " -i -f " + config + ",nofork"});
    const auto client = [&](const std::string& command) {
        return std::vector<std::string>{"ssh",       "-F",
                                        "none",      "-tt",
                                        "-i",        key,
                                        "-p",        address.substr(address.find(':') + 1),
                                        "-o",        "StrictHostKeyChecking=no",
                                        "-o",        "UserKnownHostsFile=/dev/null",
                                        "-o",        "BatchMode=yes",
                                        "-o",        "EscapeChar=none",
                                        "127.0.0.1", command};
    };
    mPeers.push_back({"ssh", client(output), client(echo)});
}

/// Starts a socat that listens. @return where
std::string TerminalPeers::pListen(const std::vector<std::string>& arguments)
{
    std::vector<std::string> command{"/usr/bin/socat", "-d", "-d"};
    command.insert(command.end(), arguments.begin(), arguments.end());
    mServers.push_back(std::make_unique<Process>(command));
    const std::string mark = "listening on AF=2 ";
    mServers.back()->awaitErrors(mark);
    const std::string said = mServers.back()->errors();
    const std::size_t begin = said.find(mark) + mark.size();
    return said.substr(begin, said.find_first_of(" \n", begin) - begin);
}

} // namespace qel::bench
