// Lines with other people's programs as far sides: socat and ser2net.

#include <qel/protocol/SerialLine.hpp>

#include "integration/FarSides.hpp"
#include "lines/LineText.hpp"
#include "protocol/hypervisor/LineDriver.hpp"
#include "support/ComesTrue.hpp"
#include "support/Pty.hpp"
#include "support/TemporaryDirectory.hpp"

#include <algorithm>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <memory>
#include <stdexcept>
#include <string>
#include <sys/ioctl.h>
#include <termios.h>
#include <unistd.h>

namespace qel::test {

namespace {

using protocol::SerialLine;
using tool::makeLine;

/// Sends all byte values to a far side that echoes, and expects them back.
void expectEcho(LineDriver& driver)
{
    driver.write(everyByte());
    EXPECT_EQ(driver.read(256), everyByte());
}

TEST(LinePeers, AUnixLineAndSocatCarryAllByteValues)
{
    QEL_SKIP_WITHOUT("socat");
    const TemporaryDirectory directory;
    const Socat socat = Socat::unixEcho(directory.file("socket"));
    const auto made = makeLine("unix:" + directory.file("socket"));
    LineDriver driver(*made.line);
    driver.bringUp();
    expectEcho(driver);
}

TEST(LinePeers, ATcpLineAndSocatCarryAllByteValues)
{
    QEL_SKIP_WITHOUT("socat");
    const Socat socat = Socat::tcpEcho();
    for (const char* host : {"127.0.0.1", "localhost"}) {
        SCOPED_TRACE(host);
        const auto made = makeLine("tcp:" + std::string(host) + ":" + std::to_string(socat.port()));
        LineDriver driver(*made.line);
        driver.bringUp();
        expectEcho(driver);
    }
}

TEST(LinePeers, ALineThatSocatEndsIsConnectedAgain)
{
    QEL_SKIP_WITHOUT("socat");
    const TemporaryDirectory directory;
    const std::string path = directory.file("socket");
    const auto made = makeLine("unix:" + path);
    LineDriver driver(*made.line);
    {
        Socat first = Socat::unixEcho(path, false);
        driver.bringUp();
        expectEcho(driver);
        first.kill();
        EXPECT_EQ(driver.readUntilEnd(), "");
        EXPECT_EQ(made.line->endReason(), "the peer has closed the connection");
    }
    EXPECT_THROW(driver.bringUp(), std::exception);
    made.line->stop();
    ASSERT_EQ(::unlink(path.c_str()), 0);
    const Socat second = Socat::unixEcho(path, false);
    driver.bringUp();
    expectEcho(driver);
}

/// The far end of a pair of terminals, raw.
class FarTerminal {
public:
    explicit FarTerminal(const std::string& path) : mFd(::open(path.c_str(), O_RDWR | O_NOCTTY | O_CLOEXEC))
    {
        if (mFd < 0) throw std::runtime_error("cannot open " + path);
    }
    ~FarTerminal() { ::close(mFd); }
    FarTerminal(const FarTerminal&) = delete;
    FarTerminal& operator=(const FarTerminal&) = delete;

    std::string receive(std::size_t length) const
    {
        std::string text;
        while (text.size() < length) {
            char buffer[256];
            const ssize_t count = ::read(mFd, buffer, std::min(sizeof(buffer), length - text.size()));
            if (count <= 0) break;
            text.append(buffer, static_cast<std::size_t>(count));
        }
        return text;
    }

    void send(const std::string& text) const
    {
        ASSERT_EQ(::write(mFd, text.data(), text.size()), static_cast<ssize_t>(text.size()));
    }

    termios attributes() const
    {
        termios attributes{};
        EXPECT_EQ(::tcgetattr(mFd, &attributes), 0);
        return attributes;
    }

private:
    int mFd;
};

TEST(LinePeers, ATerminalOfSocatIsASerialPort)
{
    QEL_SKIP_WITHOUT("socat");
    const TemporaryDirectory directory;
    const std::string port = directory.file("port");
    Socat socat = Socat::terminals(port, directory.file("far"));
    const FarTerminal far(directory.file("far"));
    const FarTerminal own(port);
    const auto made = makeLine("tty:" + port + ",19200n82");
    LineDriver driver(*made.line);
    driver.bringUp();
    const termios attributes = own.attributes();
    EXPECT_EQ(::cfgetospeed(&attributes), speed_t(B19200));
    EXPECT_NE(attributes.c_cflag & CSTOPB, tcflag_t(0));
    driver.write(everyByte());
    EXPECT_EQ(far.receive(256), everyByte());
    far.send(everyByte());
    EXPECT_EQ(driver.read(256), everyByte());
    socat.kill();
    EXPECT_EQ(driver.readUntilEnd(), "");
    EXPECT_EQ(made.line->endReason(), "the device is gone");
}

class TelnetPeer : public ::testing::Test {
protected:
    /// What the port is set to by now.
    speed_t speed() const
    {
        const termios attributes = mPort.attributes();
        return ::cfgetospeed(&attributes);
    }

    /// Drives the line until a condition comes true.
    template <typename F>
    static bool driveUntil(SerialLine& line, F condition)
    {
        return comesTrue([&] {
            char buffer[64];
            static_cast<void>(line.advance());
            EXPECT_EQ(line.read(buffer, sizeof(buffer)).length, 0U);
            return condition();
        });
    }

    Pty mPort; ///< its master is what is plugged into the port
};

TEST_F(TelnetPeer, Ser2NetCarriesAllByteValuesAndTakesTheSettings)
{
    QEL_SKIP_WITHOUT("ser2net");
    const Ser2Net server(mPort.name());
    const auto made = makeLine("telnet:" + server.address() + ",38400n82");
    LineDriver driver(*made.line);
    driver.bringUp();
    ASSERT_TRUE(driveUntil(*made.line, [this] { return speed() == speed_t(B38400); }));
    ASSERT_TRUE(
        driveUntil(*made.line, [this] { return (mPort.attributes().c_cflag & tcflag_t(CSTOPB)) != tcflag_t(0); }));
    driver.write(everyByte());
    EXPECT_EQ(mPort.read(256), everyByte());
    mPort.type(everyByte());
    EXPECT_EQ(driver.read(256), everyByte());
}

TEST_F(TelnetPeer, ABreakLeavesTheDataOfSer2NetAsTheyAre)
{
    QEL_SKIP_WITHOUT("ser2net");
    const Ser2Net server(mPort.name());
    const auto made = makeLine("telnet:" + server.address() + ",38400n8");
    LineDriver driver(*made.line);
    driver.bringUp();
    ASSERT_TRUE(driveUntil(*made.line, [this] { return speed() == speed_t(B38400); }));
    driver.write("before");
    EXPECT_TRUE(made.line->sendBreak());
    driver.write("after"); // waits for the end of the break
    ASSERT_TRUE(driveUntil(*made.line, [this] {
        int waiting = 0;
        return ::ioctl(mPort.master(), FIONREAD, &waiting) == 0 && waiting == 11;
    }));
    EXPECT_EQ(mPort.read(11), "beforeafter");
}

TEST_F(TelnetPeer, ALineThatSer2NetEndsIsConnectedAgain)
{
    QEL_SKIP_WITHOUT("ser2net");
    auto server = std::make_unique<Ser2Net>(mPort.name());
    const auto made = makeLine("telnet:" + server->address());
    LineDriver driver(*made.line);
    driver.bringUp();
    driver.write("x");
    EXPECT_EQ(mPort.read(1), "x");
    server.reset();
    EXPECT_EQ(driver.readUntilEnd(), "");
    EXPECT_THROW(driver.bringUp(), std::exception);
}

TEST_F(TelnetPeer, ASideThatDoesNotSpeakTelnetIsServedAsItIs)
{
    QEL_SKIP_WITHOUT("socat");
    const Socat socat("TCP-LISTEN:0,bind=127.0.0.1", "SYSTEM:dd bs=15 count=1 iflag=fullblock >/dev/null 2>&1; cat",
                      "listening on");
    const auto made = makeLine("telnet:127.0.0.1:" + std::to_string(socat.port()));
    LineDriver driver(*made.line);
    driver.bringUp();
    driver.write("plain");
    EXPECT_EQ(driver.read(5), "plain");
}

} // namespace

} // namespace qel::test
