// The status socket and the thread that serves it, with clients that mean no good.

#include <qel/common/util/Poll.hpp>

#include "base/Failures.hpp"
#include "status/StatusClient.hpp"
#include "status/StatusServer.hpp"
#include "support/CapturedLog.hpp"
#include "support/ComesTrue.hpp"
#include "support/Loopback.hpp"
#include "support/TemporaryDirectory.hpp"

#include <array>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <string>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

namespace qel::test {

namespace {

using testing::AllOf;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::StartsWith;
using testing::ThrowsMessage;
using tool::CommandFailure;
using tool::StatusServer;
using tool::StatusSocket;

constexpr std::chrono::seconds kTime = std::chrono::seconds(20);

mode_t modeOf(const std::string& path)
{
    struct stat file {};
    return ::lstat(path.c_str(), &file) == 0 ? file.st_mode & 07777U : 0;
}

bool exists(const std::string& path)
{
    struct stat file {};
    return ::lstat(path.c_str(), &file) == 0;
}

/// A client that does as the test says. Its reads end after a time.
class Client {
public:
    explicit Client(const std::string& path) : mFd(tool::connectStatus(path))
    {
        const timeval time{20, 0};
        ::setsockopt(mFd.get(), SOL_SOCKET, SO_RCVTIMEO, &time, sizeof(time));
    }

    bool send(const std::string& bytes) const
    {
        return ::send(mFd.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(bytes.size());
    }
    void endSending() const { ::shutdown(mFd.get(), SHUT_WR); }
    bool hears(std::chrono::milliseconds time) const
    {
        return PollSet(PollFd(mFd.get(), PollEvents::Read)).wait(time).anyReady();
    }

    /// What comes until the end, or until the server cuts the connection.
    std::string receive() const
    {
        std::string text;
        std::array<char, 65536> buffer;
        for (;;) {
            const ssize_t count = ::recv(mFd.get(), buffer.data(), buffer.size(), 0);
            if (count == 0 || (count < 0 && errno == ECONNRESET)) return text;
            if (count < 0) return text + " and then " + std::strerror(errno);
            text.append(buffer.data(), static_cast<std::size_t>(count));
        }
    }

private:
    UniqueFd mFd;
};

class UmaskScope {
public:
    explicit UmaskScope(mode_t mask) : mBefore(::umask(mask)) {}
    ~UmaskScope() { ::umask(mBefore); }
    UmaskScope(const UmaskScope&) = delete;
    UmaskScope& operator=(const UmaskScope&) = delete;

private:
    mode_t mBefore;
};

class StatusServerTest : public ::testing::Test {
protected:
    void serve()
    {
        server = std::make_unique<StatusServer>(
            path, [](const std::string& line, uid_t user) { return line + " from " + std::to_string(user); });
    }
    /// Whether the server answers.
    std::string ask(const std::string& line = "well") const
    {
        const Client client(path);
        EXPECT_TRUE(client.send(line + "\n"));
        return client.receive();
    }
    std::string answer(const std::string& line = "well") const
    {
        return line + " from " + std::to_string(::getuid()) + "\n";
    }

    CapturedLog log{LogLevel::Info};
    const TemporaryDirectory directory;
    const std::string path = directory.file("s");
    std::unique_ptr<StatusServer> server;
};

TEST_F(StatusServerTest, AnswersALineAndClosesTheConnection)
{
    serve();
    EXPECT_EQ(ask("first"), answer("first"));
    EXPECT_EQ(ask("second"), answer("second"));
    const Client slow(path); // a line may come in pieces
    EXPECT_TRUE(slow.send("in "));
    EXPECT_EQ(ask(), answer());
    EXPECT_TRUE(slow.send("pieces\nand more"));
    EXPECT_EQ(slow.receive(), answer("in pieces"));
}

TEST_F(StatusServerTest, TheSocketIsForItsUserAloneWhateverTheUmask)
{
    for (const mode_t mask : {0U, 0777U, 022U}) {
        const UmaskScope scope(mask);
        const StatusSocket socket(path);
        EXPECT_EQ(modeOf(path), 0600U & ~mask) << mask;
    }
}

/// Root tries what another user could do if somebody opened the socket to all.
TEST_F(StatusServerTest, RefusesAnotherUserEvenIfTheFileDoesNot)
{
    if (::geteuid() != 0) GTEST_SKIP() << "only root can become another user";
    serve();
    ASSERT_EQ(::chmod(directory.path().c_str(), 0755), 0);
    ASSERT_EQ(::chmod(path.c_str(), 0666), 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(static_cast<char*>(address.sun_path), path.size());
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) { // system calls alone from here on
        constexpr uid_t kNobody = 65534;
        char byte = 0;
        const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        if (::setuid(kNobody) != 0) ::_exit(3);
        if (::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) != 0) ::_exit(4);
        static_cast<void>(::send(fd, "status\n", 7, MSG_NOSIGNAL));
        ::_exit(::recv(fd, &byte, 1, 0) > 0 ? 1 : 0);
    }
    int status = -1;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
    EXPECT_THAT(log.lines(), testing::Contains(HasSubstr("status socket: refused a process of another user")));
    EXPECT_EQ(ask(), answer());
}

TEST_F(StatusServerTest, TheSocketIsRemovedAtTheEnd)
{
    serve();
    EXPECT_TRUE(exists(path));
    server.reset();
    EXPECT_FALSE(exists(path));
}

TEST_F(StatusServerTest, AFileThatHasTakenThePlaceOfTheSocketStays)
{
    serve();
    ASSERT_EQ(::unlink(path.c_str()), 0);
    std::ofstream(path) << "mine";
    server.reset();
    EXPECT_TRUE(exists(path));
}

TEST_F(StatusServerTest, ReplacesTheSocketOfADeadServer)
{
    {
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::strcpy(static_cast<char*>(address.sun_path), path.c_str()); // NOLINT: a short path
        const UniqueFd dead(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        ASSERT_EQ(::bind(dead.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)), 0);
        ASSERT_EQ(::listen(dead.get(), 1), 0);
    }
    ASSERT_TRUE(exists(path));
    serve();
    EXPECT_EQ(ask(), answer());
}

TEST_F(StatusServerTest, LeavesTheSocketOfALivingServerAlone)
{
    serve();
    EXPECT_THAT([&] { StatusSocket second(path); },
                ThrowsMessage<CommandFailure>("cannot listen on " + path + ": another server listens there"));
    EXPECT_EQ(ask(), answer());
}

TEST_F(StatusServerTest, LeavesAFileThatIsNoSocketAlone)
{
    std::ofstream(path) << "mine";
    EXPECT_THAT([&] { StatusSocket socket(path); },
                ThrowsMessage<CommandFailure>("cannot listen on " + path + ": a file that is not a socket is there"));
    EXPECT_TRUE(exists(path));
    EXPECT_THAT(
        [&] { tool::connectStatus(path); },
        ThrowsMessage<CommandFailure>("cannot reach a server over " + path + ": no server listens there any more"));
}

TEST_F(StatusServerTest, APathHasAnUpperLimit)
{
    const std::string longest = "/" + std::string(107, 'x');
    const std::string reason = "a path of a socket has 1 to 107 bytes";
    EXPECT_THAT([&] { StatusSocket socket(longest); },
                ThrowsMessage<CommandFailure>("cannot listen on " + longest + ": " + reason));
    EXPECT_THAT([&] { StatusSocket socket(directory.file("none/s")); },
                ThrowsMessage<CommandFailure>(HasSubstr("No such file or directory")));
    EXPECT_THAT([&] { tool::connectStatus(longest); }, ThrowsMessage<CommandFailure>(HasSubstr(reason)));
}

TEST_F(StatusServerTest, WaitsForAnotherServerThatIsAboutToListen)
{
    UniqueFd lock(::open(directory.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    ASSERT_EQ(::flock(lock.get(), LOCK_EX), 0);
    std::thread starts([&] { serve(); });
    EXPECT_FALSE(exists(path));
    lock.reset();
    starts.join();
    EXPECT_EQ(ask(), answer());
}

TEST_F(StatusServerTest, ClientsThatDoNothingAreInNobodysWay)
{
    serve();
    std::vector<std::unique_ptr<Client>> idle;
    for (std::size_t i = 0; i < 3 * StatusServer::kMostClients; ++i)
        idle.push_back(std::make_unique<Client>(path));
    EXPECT_EQ(ask(), answer());
    EXPECT_EQ(idle.front()->receive(), ""); // it has made room
}

TEST_F(StatusServerTest, ALineThatIsTooLongEndsTheConnection)
{
    serve();
    const Client client(path);
    static_cast<void>(client.send(std::string(StatusServer::kLineBytes, 'x')));
    EXPECT_EQ(client.receive(), "");
    const std::string longest(StatusServer::kLineBytes - 1, 'x');
    EXPECT_EQ(ask(longest), answer(longest));
}

TEST_F(StatusServerTest, AMegabyteOfRubbishEndsTheConnection)
{
    serve();
    const Client client(path);
    static_cast<void>(client.send(std::string(1024 * 1024, '\0')));
    EXPECT_EQ(client.receive(), "");
    EXPECT_EQ(ask(), answer());
}

TEST_F(StatusServerTest, AnEndWithoutALineGetsNoAnswer)
{
    serve();
    const Client client(path);
    EXPECT_TRUE(client.send("status"));
    client.endSending();
    EXPECT_EQ(client.receive(), "");
    const Client complete(path);
    EXPECT_TRUE(complete.send("status\n"));
    complete.endSending();
    EXPECT_EQ(complete.receive(), answer("status"));
}

TEST_F(StatusServerTest, AClientThatDoesNotReadItsAnswerHoldsNobodyUp)
{
    const std::string large(4 * 1024 * 1024, 'x');
    server = std::make_unique<StatusServer>(path, [&](const std::string&, uid_t) { return large; });
    const Client lazy(path);
    EXPECT_TRUE(lazy.send("a\n"));
    EXPECT_EQ(ask().size(), large.size() + 1);
    EXPECT_EQ(lazy.receive().size(), large.size() + 1); // it has only been slow
}

TEST_F(StatusServerTest, AClientThatLeavesBeforeItsAnswerDoesNoHarm)
{
    serve();
    for (int i = 0; i < 100; ++i)
        EXPECT_TRUE(Client(path).send("status\n"));
    EXPECT_EQ(ask(), answer());
}

TEST_F(StatusServerTest, EndsWhileClientsAreConnected)
{
    serve();
    const Client idle(path);
    EXPECT_EQ(ask(), answer());
    server.reset();
    EXPECT_EQ(idle.receive(), "");
}

TEST_F(StatusServerTest, LogsWhatAHandlerThrowsAndGoesOn)
{
    server = std::make_unique<StatusServer>(path, [](const std::string& line, uid_t) -> std::string {
        if (line == "bad") throw std::runtime_error("out of order");
        return line;
    });
    EXPECT_EQ(ask("bad"), "");
    EXPECT_EQ(ask("good"), "good\n");
    EXPECT_THAT(log.lines(), testing::ElementsAre(HasSubstr("status socket: out of order")));
}

/// The lowest number of a descriptor that is free.
rlim_t firstFree() { return static_cast<rlim_t>(UniqueFd(::dup(STDIN_FILENO)).get()); }

TEST_F(StatusServerTest, LogsOnceThatItCannotAcceptUntilItCanAgain)
{
#ifdef QEL_SANITIZES_UNDEFINED
    GTEST_SKIP() << "the sanitizer needs descriptors for its check of object types and sees errors without them";
#endif
    serve();
    for (int times = 1; times <= 2; ++times) {
        {
            const NoMoreDescriptors none(firstFree() + 1); // for the client alone
            const Client waits(path);
            EXPECT_TRUE(waits.send("well\n"));
            EXPECT_FALSE(waits.hears(std::chrono::milliseconds(350))); // the server tries it every 100 ms
        }
        EXPECT_EQ(ask(), answer());
        EXPECT_EQ(log.lines().size(), static_cast<std::size_t>(times));
    }
    EXPECT_THAT(log.lines(),
                testing::Each("E: [qel] status socket: cannot accept a connection: 24 (Too many open files)"));
}

// The client against servers that are not what they should be.

class StatusClientTest : public StatusServerTest {
protected:
    void serveAnswer(const std::string& text)
    {
        server.reset();
        server = std::make_unique<StatusServer>(path, [text](const std::string&, uid_t) { return text; });
    }
    tool::ExitStatus statusOf() const
    {
        try {
            tool::askStatus(path, kTime);
            return tool::ExitStatus::Done;
        } catch (const CommandFailure& failure) {
            EXPECT_THAT(failure.what(), HasSubstr(path));
            return failure.getExitStatus();
        }
    }
};

TEST_F(StatusClientTest, AnAnswerThatIsNotUnderstoodIsAnError)
{
    for (const char* text : {"", "hello", "[1]", "{}", R"({"ok":1})", R"({"ok":true})", R"({"ok":true,"status":[]})"}) {
        SCOPED_TRACE(text);
        serveAnswer(text);
        EXPECT_EQ(statusOf(), tool::ExitStatus::ProtocolBroken);
    }
}

TEST_F(StatusClientTest, TheReasonOfARefusalIsPrintedSafely)
{
    serveAnswer(R"({"ok":false,"error":"not \u001b[2J so"})");
    EXPECT_THAT([&] { tool::askServer(path, "x", kTime); }, ThrowsMessage<CommandFailure>("not \\x1b[2J so"));
    serveAnswer(R"({"ok":false,"error":7})");
    EXPECT_THAT([&] { tool::askServer(path, "x", kTime); },
                ThrowsMessage<CommandFailure>("the server gives no reason"));
}

TEST_F(StatusClientTest, AServerThatDoesNotAnswerIsGivenUp)
{
    const StatusSocket silent(path);
    try {
        tool::askServer(path, "x", std::chrono::milliseconds(20));
        FAIL();
    } catch (const CommandFailure& failure) {
        EXPECT_EQ(failure.getExitStatus(), tool::ExitStatus::DeadlinePassed);
        EXPECT_EQ(failure.what(), "the server at " + path + " does not answer");
    }
}

TEST_F(StatusClientTest, NoServerIsAnError) { EXPECT_EQ(statusOf(), tool::ExitStatus::CannotConnect); }

TEST(StatusSocketDefault, IsInTheRuntimeDirectoryIfThatIsForThisUserAlone)
{
    const TemporaryDirectory directory; // mode 0700
    ::setenv("XDG_RUNTIME_DIR", directory.path().c_str(), 1);
    EXPECT_EQ(tool::defaultStatusSocket(), directory.path() + "/qel-status.sock");
    EXPECT_EQ(tool::statusSocketFor(""), directory.path() + "/qel-status.sock");
    EXPECT_EQ(tool::statusSocketFor("x"), "x");
    ::setenv("QEL_STATUS_SOCKET", "/run/y", 1);
    EXPECT_EQ(tool::statusSocketFor(""), "/run/y");
    ::unsetenv("QEL_STATUS_SOCKET");
    ASSERT_EQ(::chmod(directory.path().c_str(), 0755), 0);
    EXPECT_EQ(tool::defaultStatusSocket(), "");
    ::setenv("RUNTIME_DIRECTORY", (directory.path() + ":/run/other").c_str(), 1); // as systemd sets it
    EXPECT_EQ(tool::defaultStatusSocket(), directory.path() + "/status.sock");
    ASSERT_EQ(::chmod(directory.path().c_str(), 0775), 0);
    EXPECT_EQ(tool::defaultStatusSocket(), "");
    ::unsetenv("RUNTIME_DIRECTORY");
    for (const char* other : {"", "relative", "/nowhere/at/all", "/"}) {
        ::setenv("XDG_RUNTIME_DIR", other, 1);
        EXPECT_EQ(tool::defaultStatusSocket(), "") << other;
    }
    ::unsetenv("XDG_RUNTIME_DIR");
    EXPECT_EQ(tool::defaultStatusSocket(), "");
}

} // namespace

} // namespace qel::test
