// Partitions of the server whose lines are sockets, terminal servers and serial ports.

#include "integration/FarSides.hpp"
#include "integration/TestConsole.hpp"
#include "support/Loopback.hpp"
#include "support/Pty.hpp"
#include "support/TemporaryDirectory.hpp"

#include <gmock/gmock.h>
#include <memory>
#include <string>
#include <unistd.h>
#include <vector>

namespace qel::test {

namespace {

using ::testing::HasSubstr;

constexpr const char* kBack = "[qel: line is back]\r\n";

std::vector<std::string> partition(const std::string& line) { return {"--partition", "1=" + line}; }

/// A console with the session of partition 1.
class Session {
public:
    explicit Session(const ServeProcess& server) : mConsole(server.endpoint())
    {
        mConsole.openSession("console");
        mConsole.openSerial(1);
    }

    void type(const std::string& text) { mConsole.type(1, text); }
    std::string readUntil(const std::string& text) { return mConsole.readUntil(1, text); }

private:
    TestConsole mConsole;
};

/// A socket at a path, where socat echoes to one connection.
class ServeUnixLine : public ::testing::Test {
protected:
    /// Ends when its connection does.
    Socat listen() const
    {
        ::unlink(mPath.c_str());
        return Socat::unixEcho(mPath, false);
    }

    TemporaryDirectory mDirectory;
    const std::string mPath = mDirectory.file("socket");
};

TEST_F(ServeUnixLine, AConsoleAndTheFarSideTalk)
{
    QEL_SKIP_WITHOUT("socat");
    const Socat socat = listen();
    ServeProcess server(partition("unix:" + mPath));
    Session session(server);
    session.type("hello");
    EXPECT_EQ(session.readUntil("hello"), "hello");
    server.stop();
}

TEST_F(ServeUnixLine, ASessionSurvivesTheEndOfTheFarSide)
{
    QEL_SKIP_WITHOUT("socat");
    auto socat = std::make_unique<Socat>(listen());
    ServeProcess server(partition("unix:" + mPath));
    Session session(server);
    session.type("before");
    session.readUntil("before");
    socat->kill();
    session.readUntil("[qel: line lost: the peer has closed the connection; connecting again]\r\n");
    socat.reset();
    const Socat other = listen();
    session.readUntil(kBack);
    session.type("after");
    EXPECT_EQ(session.readUntil("after"), "after");
    EXPECT_THAT(server.stop().errors, HasSubstr("partition 1: line lost: the peer has closed the connection"));
}

TEST_F(ServeUnixLine, AFarSideThatComesLaterIsFound)
{
    QEL_SKIP_WITHOUT("socat");
    ServeProcess server(partition("unix:" + mPath));
    Session session(server);
    session.readUntil("line is down: cannot connect to " + mPath + ": No such file or directory");
    const Socat socat = listen();
    session.readUntil(kBack);
    session.type("hello");
    EXPECT_EQ(session.readUntil("hello"), "hello");
    server.stop();
}

TEST(ServeTcpLine, AConsoleAndTheFarSideTalk)
{
    QEL_SKIP_WITHOUT("socat");
    const Socat socat = Socat::tcpEcho(false);
    ServeProcess server(partition("tcp:localhost:" + std::to_string(socat.port())));
    Session session(server);
    session.type("hello");
    session.readUntil("hello");
    server.stop();
}

TEST(ServeTcpLine, APeerThatRefusesIsTheReason)
{
    const Socket refusing = makeRefusingSocket();
    const std::string address = refusing.getSocketName().str();
    ServeProcess server(partition("tcp:" + address));
    Session session(server);
    session.readUntil("line is down: cannot connect to " + address + ": Connection refused");
    server.stop();
}

TEST(ServeTelnetLine, AConsoleAndThePortBehindSer2NetTalk)
{
    QEL_SKIP_WITHOUT("ser2net");
    const Pty port;
    const Ser2Net terminalServer(port.name());
    ServeProcess server(partition("telnet:" + terminalServer.address() + ",19200n8"));
    Session session(server);
    session.type("to the port");
    EXPECT_EQ(port.read(11), "to the port");
    port.type("from the port");
    session.readUntil("from the port");
    server.stop();
}

TEST(ServeTtyLine, AConsoleAndTheFarSideTalk)
{
    const Pty port;
    ServeProcess server(partition("tty:" + port.name() + ",57600n8"));
    Session session(server);
    session.type("to the port");
    EXPECT_EQ(port.read(11), "to the port");
    port.type("from the port");
    session.readUntil("from the port");
    server.stop();
    const termios attributes = port.attributes();
    EXPECT_NE(::cfgetospeed(&attributes), speed_t(B57600)) << "the server restores the port";
}

} // namespace

} // namespace qel::test
