// A person leaves a console, whatever does not move, and is told about a server that says nothing.

#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/net/Listen.hpp>
#include <qel/common/util/UniqueFd.hpp>

#include "integration/TestConsole.hpp"
#include "support/ComesTrue.hpp"
#include "support/PtyProcess.hpp"
#include "support/TemporaryDirectory.hpp"

#include <chrono>
#include <csignal>
#include <fcntl.h>
#include <functional>
#include <gmock/gmock.h>
#include <string>
#include <sys/stat.h>
#include <thread>

namespace qel::test {

namespace {

using ::testing::EndsWith;
using ::testing::HasSubstr;

using Arguments = std::vector<std::string>;
using Milliseconds = std::chrono::milliseconds;

/// Leaving takes a tenth of a second; a machine that does much else is given more. The timeout of the requests, which
/// it must not wait for, is longer by far.
constexpr Milliseconds kSoon{2000};

Arguments consoleTo(const std::string& endpoint, const Arguments& more)
{
    Arguments arguments = qelCommand({"console", "--connect", endpoint, "--plain"});
    arguments.insert(arguments.end(), more.begin(), more.end());
    return arguments;
}

/// Types the command to leave, expects that the person is let go at once, and notes how long it took.
PtyProcess::Result leave(PtyProcess& person, const std::string& command = "~.")
{
    const auto start = std::chrono::steady_clock::now();
    person.type(command);
    const PtyProcess::Result result = person.wait();
    const auto taken = std::chrono::duration_cast<Milliseconds>(std::chrono::steady_clock::now() - start);
    ::testing::Test::RecordProperty("milliseconds", std::to_string(taken.count()));
    EXPECT_LT(taken, kSoon);
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_TRUE(person.isTerminalUntouched());
    return result;
}

bool isFull(const UniqueFd& pipe) { return !PollSet(PollFd(pipe.get(), PollEvents::Write)).poll().anyReady(); }

/// Partition 1 repeats its input, 2 reads nothing, 3 writes without end, 4 writes much and ends.
class ConsoleStuckTest : public ::testing::Test {
protected:
    ~ConsoleStuckTest() override { server.process().signal(SIGCONT); }

    Arguments console(const Arguments& more) const { return consoleTo(server.endpoint(), more); }

    ServeProcess server{{"--partition", "1=exec cat", "--partition", "2=stty raw -echo; echo ready; exec sleep 1000",
                         "--partition", "3=exec yes", "--partition", "4=head -c 300000 /dev/zero"}};
};

TEST_F(ConsoleStuckTest, LeavesAStoppedServer)
{
    PtyProcess person(console({"1"}));
    person.await("connected");
    server.process().signal(SIGSTOP);
    EXPECT_THAT(leave(person).screen, EndsWith("\r\nqel: left partition 1\r\n"));
}

TEST_F(ConsoleStuckTest, LeavesAStoppedServerIntoWhichMuchWasPasted)
{
    PtyProcess person(console({"1"}));
    person.await("connected");
    server.process().signal(SIGSTOP);
    person.type(std::string(512 * 1024, 'x') + "\r");
    person.await(" bytes of input are held back: the partition or the server takes none; ~. at the start of a line "
                 "leaves and throws them away\r\n");
    EXPECT_THAT(leave(person).screen, EndsWith(" bytes of input that were not sent are thrown away\r\n"));
}

TEST_F(ConsoleStuckTest, LeavesAStoppedServerWhileTheSessionIsOpenedAgain)
{
    PtyProcess person(console({"1"}));
    person.await("connected");
    server.process().signal(SIGSTOP);
    person.type("~f");
    person.await("qel: opening partition 1 again by force\r\n");
    EXPECT_THAT(leave(person).screen, EndsWith("by force\r\nqel: left partition 1\r\n"));
}

TEST_F(ConsoleStuckTest, ASignalEndsItWhileTheSessionIsOpenedAgain)
{
    PtyProcess person(console({"1"}));
    person.await("connected");
    server.process().signal(SIGSTOP);
    person.type("~f");
    person.await("qel: opening partition 1 again by force\r\n");
    person.signal(SIGTERM);
    EXPECT_EQ(person.wait().signal, SIGTERM);
    EXPECT_TRUE(person.isTerminalUntouched());
}

TEST_F(ConsoleStuckTest, LeavesAPartitionThatDoesNotReadIntoWhichMuchWasPasted)
{
    PtyProcess person(console({"2"}));
    person.await("ready");
    person.type(std::string(1024 * 1024, 'x') + "\r");
    person.await(" bytes of input are held back: ");
    EXPECT_THAT(leave(person).screen, EndsWith(" bytes of input that were not sent are thrown away\r\n"));
}

TEST_F(ConsoleStuckTest, APartitionThatDoesNotReadIsFreeWhenItsConsoleHasLeft)
{
    PtyProcess person(console({"2"}));
    person.await("ready");
    person.type(std::string(1024 * 1024, 'x') + "\r");
    person.await(" bytes of input are held back: ");
    leave(person);
    EXPECT_TRUE(comesTrue([&] {
        PtyProcess next(console({"2"}));
        next.await("partition 2 ");
        next.type("\r~.");
        return next.wait().exitStatus == 0; // not: it is held by another console
    }));
}

TEST_F(ConsoleStuckTest, HeldInputThatIsLostWithTheConnectionIsTold)
{
    PtyProcess person(console({"2"}));
    person.await("ready");
    person.type(std::string(1024 * 1024, 'x') + "\r");
    person.await(" bytes of input are held back: ");
    server.process().signal(SIGKILL);
    person.await(" bytes of input that were not sent are thrown away\r\n");
    EXPECT_EQ(person.wait().exitStatus, 7);
}

TEST_F(ConsoleStuckTest, InputBeyondTheLimitIsDroppedAndNothingHangs)
{
    PtyProcess person(console({"2"}));
    person.await("ready");
    person.type(std::string(3 * 1024 * 1024, 'x') + "\r");
    person.await("\aqel: the limit of 1 MiB is reached: further input is dropped until there is room");
    leave(person);
}

TEST_F(ConsoleStuckTest, LeavesWhileNobodyReadsTheOutput)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("pipe");
    ASSERT_EQ(::mkfifo(path.c_str(), 0600), 0);
    const UniqueFd pipe(::open(path.c_str(), O_RDWR | O_CLOEXEC)); // and nobody reads it
    std::string command = "exec";
    for (const std::string& argument : console({"3"}))
        command += " '" + argument + "'";
    PtyProcess person({"/bin/sh", "-c", command + " >" + path});
    person.await("connected");
    ASSERT_TRUE(comesTrue([&] { return isFull(pipe); }));
    leave(person);
}

TEST_F(ConsoleStuckTest, LeavesWhenTheSessionHasEndedAndNobodyReadsTheOutput)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("pipe");
    ASSERT_EQ(::mkfifo(path.c_str(), 0600), 0);
    const UniqueFd pipe(::open(path.c_str(), O_RDWR | O_CLOEXEC));
    std::string command = "exec";
    for (const std::string& argument : console({"4"}))
        command += " '" + argument + "'";
    PtyProcess person({"/bin/sh", "-c", command + " >" + path});
    person.await("connected");
    ASSERT_TRUE(comesTrue([&] { return isFull(pipe); }));
    leave(person);
}

TEST_F(ConsoleStuckTest, AStoppedServerIsReportedInTimeAndSoIsItsReturn)
{
    PtyProcess person(console({"1", "--keepalive", "0.4"}));
    person.await("connected");
    server.process().signal(SIGSTOP);
    person.await("qel: the server has sent nothing for 0.4 s: it is gone or stopped; wait, or leave with ~. at the "
                 "start of a line\r\n");
    person.type("still there?\r");
    server.process().signal(SIGCONT);
    person.await("qel: the server answers again\r\n");
    person.await("still there?\r\n");
    leave(person);
}

/// A server that grants what a console asks for up to the open session, and then does what the test says.
class PlayedServer {
public:
    /// @param afterwards  the connection ends when it returns
    explicit PlayedServer(std::function<void(LoopbackMessages&)> afterwards)
        : mListener(listenOn(IPEndpoint("127.0.0.1:0"), 1)), mEndpoint(mListener.getSocketName().str()),
          mThread([this, afterwards = std::move(afterwards)] {
              SocketStream stream(mListener.accept());
              stream.setReadDeadline(Process::kDeadline);
              LoopbackMessages messages(stream);
              for (int requests = 0; requests < 4; ++requests)
                  grantNext(messages);
              afterwards(messages);
          })
    {}
    ~PlayedServer() { mThread.join(); }
    PlayedServer(const PlayedServer&) = delete;
    PlayedServer& operator=(const PlayedServer&) = delete;

    const std::string& endpoint() const { return mEndpoint; }

    /// @return the operation of the request
    static unsigned int grantNext(LoopbackMessages& messages)
    {
        const auto request = messages.receive();
        messages.send(
            QelMessageGeneric(request->getCallerId(), request->getFunction(), request->getOperation(), MsgResponse));
        return request->getOperation();
    }

private:
    Socket mListener;
    std::string mEndpoint;
    std::thread mThread;
};

TEST(ConsoleKeepAlive, AServerThatAnswersIsNotReported)
{
    const PlayedServer server([](LoopbackMessages& messages) {
        for (int i = 0; i < 3; ++i)
            EXPECT_EQ(PlayedServer::grantNext(messages), QelMessageOpGetQelTod);
        messages.send(QelMessageVirtualSerialSessionClosedAsync(
            1, 0, QelMessageVirtualSerialSessionClosedAsync::CloseReasonReadFailure));
        PlayedServer::grantNext(messages); // to close the session
    });
    PtyProcess person(consoleTo(server.endpoint(), {"1", "--keepalive", "0.2"}));
    const auto result = person.wait();
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.screen, ::testing::Not(HasSubstr("has sent nothing")));
}

TEST(ConsoleForce, WhoMayNotTakeASessionGoesOnWatching)
{
    const PlayedServer server([](LoopbackMessages& messages) {
        EXPECT_EQ(PlayedServer::grantNext(messages), QelMessageOpCloseVirtualSerialSession);
        const auto request = messages.receive();
        const auto* const open = dynamic_cast<const QelMessageVirtualSerialOpenReq*>(request.get());
        ASSERT_NE(open, nullptr);
        EXPECT_EQ(open->getVssConnectionNumber(), 0);
        QelMessageGeneric refusal(request->getCallerId(), request->getFunction(), request->getOperation(), MsgResponse);
        refusal.setStatus(QelMessageStatusInvalidOperation);
        messages.send(refusal);
        EXPECT_EQ(PlayedServer::grantNext(messages), QelMessageOpOpenVirtualSerialSession);
        EXPECT_EQ(PlayedServer::grantNext(messages), QelMessageOpSetupVirtualSerialSession);
        messages.send(QelMessageVirtualSerialSessionClosedAsync(
            1, 1, QelMessageVirtualSerialSessionClosedAsync::CloseReasonReadFailure));
        PlayedServer::grantNext(messages); // to close the session
    });
    PtyProcess person(consoleTo(server.endpoint(), {"1", "--watch"}));
    person.await("watching partition 1");
    person.type("~f");
    person.await("qel: the rules of the server do not let this console type in partition 1, or take it by force; ");
    person.await("watching partition 1");
    EXPECT_EQ(person.wait().exitStatus, 0);
}

/// A server whose connection stays there until the end of the test, but nothing comes any more.
class VanishingServer {
public:
    /// @param last  what comes last
    explicit VanishingServer(const std::string& last)
        : mServer([this, last](LoopbackMessages& messages) {
              messages.sendBytes(last);
              PollSet(mGone.getPollFd()).wait();
          })
    {}
    ~VanishingServer() { mGone.interrupt(); }
    VanishingServer(const VanishingServer&) = delete;
    VanishingServer& operator=(const VanishingServer&) = delete;

    const std::string& endpoint() const { return mServer.endpoint(); }

private:
    PollInterrupt mGone;
    PlayedServer mServer;
};

TEST(ConsoleVanishedServer, LeavesAServerThatSaysNothing)
{
    const VanishingServer server("");
    PtyProcess person(consoleTo(server.endpoint(), {"1"}));
    person.await("connected");
    leave(person);
}

TEST(ConsoleVanishedServer, LeavesAServerThatVanishedInTheMiddleOfAMessage)
{
    const VanishingServer server(std::string("\xDE\xCA\xFF\x20\0\0\0\x28half", 12));
    PtyProcess person(consoleTo(server.endpoint(), {"1"}));
    person.await("connected");
    leave(person);
}

} // namespace

} // namespace qel::test
