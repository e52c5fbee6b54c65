// What a service manager is told, and what it says in variables.

#include "base/Failures.hpp"
#include "serve/ServiceManager.hpp"
#include "support/CapturedLog.hpp"
#include "support/DatagramSocket.hpp"
#include "support/SettableClock.hpp"
#include "support/TemporaryDirectory.hpp"

#include <cstdlib>
#include <gmock/gmock.h>
#include <map>
#include <string>
#include <unistd.h>

namespace qel::test {

namespace {

using std::chrono::microseconds;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::SizeIs;
using ::testing::StartsWith;
using tool::ServiceManager;

using Values = std::map<std::string, std::string>;

/// Variables of the environment while the object lives; all others of a service manager are not set.
class Variables {
public:
    explicit Variables(const Values& values)
    {
        pClear();
        for (const auto& value : values)
            ::setenv(value.first.c_str(), value.second.c_str(), 1);
    }
    ~Variables() { pClear(); }
    Variables(const Variables&) = delete;
    Variables& operator=(const Variables&) = delete;

private:
    static void pClear()
    {
        for (const char* name : {"NOTIFY_SOCKET", "WATCHDOG_USEC", "WATCHDOG_PID", "LISTEN_FDS", "LISTEN_PID"})
            ::unsetenv(name);
    }
};

class ServiceManagerTest : public ::testing::Test {
protected:
    const CapturedLog log{LogLevel::Warn};
    const TemporaryDirectory directory;
    const std::string path = directory.file("notify");
};

TEST_F(ServiceManagerTest, IsToldWhatTheServerDoes)
{
    const SettableClock clock; // 1000 s after the start of the machine
    const DatagramSocket socket(path);
    ServiceManager manager(path, microseconds(0));
    manager.ready("serving 1 partition");
    manager.reloading();
    manager.feedWatchdog();
    manager.stopping();
    EXPECT_EQ(socket.take(), "READY=1\nSTATUS=serving 1 partition");
    EXPECT_EQ(socket.take(), "RELOADING=1\nMONOTONIC_USEC=1000000000");
    EXPECT_EQ(socket.take(), "WATCHDOG=1");
    EXPECT_EQ(socket.take(), "STOPPING=1\nSTATUS=stopping");
    EXPECT_EQ(socket.take(), "");
    EXPECT_THAT(log.lines(), SizeIs(0));
}

TEST_F(ServiceManagerTest, MayBeInTheAbstractNamespace)
{
    const std::string address = "@qel-test-" + std::to_string(::getpid());
    const DatagramSocket socket(address);
    ServiceManager(address, microseconds(0)).feedWatchdog();
    EXPECT_EQ(socket.take(), "WATCHDOG=1");
}

TEST_F(ServiceManagerTest, AStatusIsOneLine)
{
    const DatagramSocket socket(path);
    ServiceManager(path, microseconds(0)).ready("a\nSTOPPING=1\x7f");
    EXPECT_EQ(socket.take(), "READY=1\nSTATUS=a STOPPING=1 ");
}

TEST_F(ServiceManagerTest, OneThatIsNotThereIsLoggedOnce)
{
    ServiceManager manager(path, microseconds(0));
    manager.ready("");
    manager.feedWatchdog();
    EXPECT_THAT(log.lines(), ElementsAre("W: [qel] cannot notify the service manager at \"" + path +
                                         "\": 2 (No such file or directory)"));
}

TEST_F(ServiceManagerTest, OneThatDoesNotReadHoldsNothingUp)
{
    const DatagramSocket socket(path);
    ServiceManager manager(path, microseconds(0));
    for (int i = 0; i < 10000; ++i)
        manager.feedWatchdog();
    EXPECT_THAT(log.lines(), ElementsAre(HasSubstr(": 11 (")));
    EXPECT_EQ(socket.take(), "WATCHDOG=1");
}

TEST_F(ServiceManagerTest, HearsWithTheNextBeatWhatFoundNoRoom)
{
    const DatagramSocket socket(path);
    ServiceManager manager(path, microseconds(0));
    while (log.lines().empty()) // until there is no room
        manager.feedWatchdog();
    manager.ready("too early");
    manager.ready("serving");
    for (std::string message = "WATCHDOG=1"; !message.empty(); message = socket.take())
        EXPECT_EQ(message, "WATCHDOG=1");
    manager.feedWatchdog();
    manager.feedWatchdog();
    EXPECT_EQ(socket.take(), "READY=1\nSTATUS=serving");
    EXPECT_EQ(socket.take(), "WATCHDOG=1");
    EXPECT_EQ(socket.take(), "WATCHDOG=1");
    EXPECT_EQ(socket.take(), "");
}

TEST_F(ServiceManagerTest, IsReadFromTheVariables)
{
    const Variables variables(Values{{"NOTIFY_SOCKET", path}, {"WATCHDOG_USEC", "30000000"}});
    const DatagramSocket socket(path);
    ServiceManager manager = ServiceManager::fromEnvironment();
    EXPECT_EQ(manager.watchdogInterval(), std::chrono::seconds(15));
    manager.feedWatchdog();
    EXPECT_EQ(socket.take(), "WATCHDOG=1");
}

TEST_F(ServiceManagerTest, WithoutVariablesThereIsNone)
{
    const Variables variables(Values{{"WATCHDOG_USEC", "30000000"}}); // nobody to tell
    ServiceManager manager = ServiceManager::fromEnvironment();
    manager.ready("");
    EXPECT_EQ(manager.watchdogInterval().count(), 0);
    EXPECT_THAT(log.lines(), SizeIs(0));
}

TEST_F(ServiceManagerTest, AnAddressThatIsNoneIsLoggedAndNotUsed)
{
    for (const std::string& address :
         {std::string("relative"), std::string("@"), std::string("/"), "/" + std::string(107, 'x'),
          "@" + std::string(107, 'x'), std::string("vsock:2:1234"), std::string("\x1b[2J")}) {
        SCOPED_TRACE(address);
        const CapturedLog own{LogLevel::Warn};
        const Variables variables(Values{{"NOTIFY_SOCKET", address}});
        ServiceManager::fromEnvironment().ready("");
        EXPECT_THAT(own.lines(), ElementsAre(StartsWith("W: [qel] the variable NOTIFY_SOCKET is not used: \"")));
    }
}

TEST_F(ServiceManagerTest, TheLongestAddressIsTaken)
{
    const std::string longest = "@" + std::to_string(::getpid()) + std::string(107 - 1, 'x');
    const DatagramSocket socket(longest.substr(0, 107));
    const Variables variables(Values{{"NOTIFY_SOCKET", longest.substr(0, 107)}});
    ServiceManager::fromEnvironment().feedWatchdog();
    EXPECT_EQ(socket.take(), "WATCHDOG=1");
}

TEST_F(ServiceManagerTest, AWatchdogTimeIsTakenOrLogged)
{
    struct Case {
        const char* time;
        std::string pid; ///< empty: not set
        long long interval;
        bool isLogged;
    };
    const std::string own = std::to_string(::getpid());
    const Case cases[] = {{"2", own, 1, false},
                          {"31622400000000", "", 15811200000000, false},
                          {"31622400000001", "", 0, true},
                          {"1", "", 0, true},
                          {"0", "", 0, true},
                          {"-1", "", 0, true},
                          {"x", "", 0, true},
                          {"99999999999999999999999", "", 0, true},
                          {"30000000", "1", 0, false}, // of another process
                          {"30000000", "x", 0, false}};
    for (const Case& row : cases) {
        SCOPED_TRACE(row.time);
        const CapturedLog lines{LogLevel::Warn};
        Values values{{"NOTIFY_SOCKET", path}, {"WATCHDOG_USEC", row.time}};
        if (!row.pid.empty()) values["WATCHDOG_PID"] = row.pid;
        const Variables variables(values);
        EXPECT_EQ(ServiceManager::fromEnvironment().watchdogInterval().count(), row.interval);
        EXPECT_THAT(lines.lines(), SizeIs(row.isLogged ? 1 : 0));
    }
}

TEST(HandedSockets, AreThoseOfThisProcess)
{
    const std::string own = std::to_string(::getpid());
    const Values none[] = {{},
                           {{"LISTEN_FDS", "1"}},
                           {{"LISTEN_FDS", "1"}, {"LISTEN_PID", "1"}},
                           {{"LISTEN_FDS", "1"}, {"LISTEN_PID", own + "x"}},
                           {{"LISTEN_FDS", "1"}, {"LISTEN_PID", "4294967297"}},
                           {{"LISTEN_FDS", "0"}, {"LISTEN_PID", own}},
                           {{"LISTEN_FDS", ""}, {"LISTEN_PID", own}}};
    for (const auto& values : none) {
        const Variables variables(values);
        EXPECT_THAT(tool::takeHandedSockets(), SizeIs(0));
    }
}

TEST(HandedSockets, AWrongNumberIsRefused)
{
    for (const char* number : {"-1", "x", "65", "1e3", "99999999999999999999"}) {
        SCOPED_TRACE(number);
        const Variables variables(Values{{"LISTEN_FDS", number}, {"LISTEN_PID", std::to_string(::getpid())}});
        try {
            tool::takeHandedSockets();
            ADD_FAILURE() << "accepted";
        } catch (const tool::CommandFailure& error) {
            EXPECT_EQ(error.getExitStatus(), tool::ExitStatus::Usage);
            EXPECT_EQ(error.what(),
                      "the variable LISTEN_FDS: \"" + std::string(number) + "\" is not an integer in [0, 64]");
        }
    }
}

} // namespace

} // namespace qel::test
