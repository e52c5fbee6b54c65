// "qel serve" as a service: what it tells the service manager, and the sockets that it is handed.

#include <qel/common/net/Listen.hpp>
#include <qel/common/util/UniqueFd.hpp>

#include "integration/TestConsole.hpp"
#include "support/DatagramSocket.hpp"
#include "support/Loopback.hpp"
#include "support/TemporaryDirectory.hpp"

#include <csignal>
#include <fcntl.h>
#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using Variables = std::map<std::string, std::string>;

/// Starts "qel serve" with sockets that listen already. A shell says for which process they are.
class ActivatedServer {
public:
    explicit ActivatedServer(const std::vector<int>& sockets, const std::string& count,
                             const std::vector<std::string>& options = {"--plain"})
        : mProcess(pCommand(sockets.empty(), options), {{"LISTEN_FDS", count}}, sockets)
    {}

    Process& process() { return mProcess; }

private:
    static std::vector<std::string> pCommand(bool hasNone, const std::vector<std::string>& options)
    {
        // Whoever runs the tests may have left a descriptor 3 to them.
        const std::string close = hasNone ? "exec 3<&-; " : "";
        std::vector<std::string> command{"/bin/sh", "-c", close + "LISTEN_PID=$$; export LISTEN_PID; exec \"$@\"",
                                         "sh"};
        const std::vector<std::string> serve = qelCommand({"serve"});
        command.insert(command.end(), serve.begin(), serve.end());
        command.insert(command.end(), options.begin(), options.end());
        return command;
    }

    Process mProcess;
};

TEST(ServeService, TellsTheServiceManagerWhatItDoes)
{
    const TemporaryDirectory directory;
    const DatagramSocket manager(directory.file("notify"));
    ServeProcess server({"--partition", "1=cat"}, "127.0.0.1:0", {"--plain"},
                        {{"NOTIFY_SOCKET", directory.file("notify")}});
    const std::string ready = "READY=1\nSTATUS=serving 1 partition on " + server.endpoint();
    EXPECT_EQ(manager.await(), ready);
    server.process().signal(SIGHUP);
    EXPECT_THAT(manager.await(), MatchesRegex("RELOADING=1\nMONOTONIC_USEC=[0-9]+"));
    EXPECT_EQ(manager.await(), ready);
    server.stop();
    EXPECT_EQ(manager.await(), "STOPPING=1\nSTATUS=stopping");
}

TEST(ServeService, FeedsTheWatchdog)
{
    const TemporaryDirectory directory;
    const DatagramSocket manager(directory.file("notify"));
    ServeProcess server({}, "127.0.0.1:0", {"--plain"},
                        {{"NOTIFY_SOCKET", directory.file("notify")}, {"WATCHDOG_USEC", "200000"}});
    EXPECT_THAT(manager.await(), HasSubstr("READY=1"));
    EXPECT_EQ(manager.await(), "WATCHDOG=1");
    EXPECT_EQ(manager.await(), "WATCHDOG=1");
    server.stop();
}

TEST(ServeService, ListensOnTheSocketsThatItIsHanded)
{
    const Socket first = makeListener();
    const Socket second = makeListener();
    ActivatedServer server({first.getFd(), second.getFd()}, "2", {"--plain", "--listen", "127.0.0.1:1"});
    EXPECT_EQ(server.process().readLine(), first.getSocketName().str());
    EXPECT_EQ(server.process().readLine(), second.getSocketName().str());
    const auto result = runQel({"call", "--plain", "--connect", second.getSocketName().str(), "limits"});
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    server.process().signal(SIGTERM);
    EXPECT_EQ(server.process().wait().exitStatus, 0);
}

TEST(ServeService, RefusesWhatItCannotListenOn)
{
    const UniqueFd null(::open("/dev/null", O_RDWR | O_CLOEXEC));
    const auto file = ActivatedServer({null.get()}, "1").process().wait();
    EXPECT_EQ(file.exitStatus, 3);
    EXPECT_THAT(file.errors, HasSubstr("qel: cannot listen on descriptor 3: getsockopt: 88 ("));
    const auto none = ActivatedServer({}, "1").process().wait();
    EXPECT_EQ(none.exitStatus, 3);
    EXPECT_EQ(none.errors, "qel: cannot listen on descriptor 3, which LISTEN_FDS names: it is not open\n");
    const auto wrong = ActivatedServer({}, "many").process().wait();
    EXPECT_EQ(wrong.exitStatus, 2);
    EXPECT_EQ(wrong.errors, "qel: the variable LISTEN_FDS: \"many\" is not an integer in [0, 64]\n");
}

TEST(ServeService, APlainServerRefusesASocketForEverybody)
{
    const Socket everywhere = listenOn(IPEndpoint("0.0.0.0:0"), 1);
    const auto result = ActivatedServer({everywhere.getFd()}, "1").process().wait();
    EXPECT_EQ(result.exitStatus, 2);
    EXPECT_THAT(result.errors,
                HasSubstr("qel: the sockets that are handed over: plain: for loopback addresses only\n"));
}

} // namespace

} // namespace qel::test
