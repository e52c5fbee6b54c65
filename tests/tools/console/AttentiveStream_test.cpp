#include <qel/common/io/StreamIOException.hpp>

#include "console/AttentiveStream.hpp"
#include "support/Errors.hpp"
#include "support/LoopbackEnds.hpp"

#include <functional>
#include <gmock/gmock.h>
#include <string>

namespace qel::test {

namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::AttentiveStream;

/// A keyboard whose key has been pressed.
class Keyboard : public tool::StreamAttendant {
public:
    Keyboard() { mKey.interrupt(); }

    PollSet attended() const override { return mKey.getPollFd(); }
    bool attend(const PollResult& ready) noexcept override
    {
        EXPECT_TRUE(ready.contains(mKey.getPollFd()));
        mKey.eoi();
        ++presses;
        return onPress();
    }

    std::function<bool()> onPress = [] { return false; };
    int presses = 0;

private:
    PollInterrupt mKey;
};

class AttentiveStreamTest : public ::testing::Test {
protected:
    AttentiveStreamTest()
    {
        Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 1);
        Socket socket(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0);
        socket.connect(listener.getSocketName(), seconds(20));
        stream = std::make_unique<AttentiveStream>(std::move(socket));
        far = std::make_unique<SocketStream>(listener.accept());
        far->setReadDeadline(seconds(20));
    }

    std::string read()
    {
        std::string text(10, '\0');
        text.resize(stream->read(text.data(), text.size()));
        return text;
    }

    std::unique_ptr<AttentiveStream> stream;
    std::unique_ptr<SocketStream> far;
    Keyboard keyboard;
    const std::string much = std::string(16 * 1024 * 1024, 'x'); // more than the buffers of both ends hold
};

TEST_F(AttentiveStreamTest, MovesBytesBothWays)
{
    stream->write("ping", 4);
    std::string text(4, '\0');
    far->fill(text.data(), text.size());
    EXPECT_EQ(text, "ping");
    far->write("pong", 4);
    EXPECT_EQ(read(), "pong");
    far->close();
    EXPECT_EQ(read(), "") << "the end of the stream";
}

TEST_F(AttentiveStreamTest, AttendsWhileItWaitsForBytes)
{
    stream->setAttendant(&keyboard);
    keyboard.onPress = [&] {
        far->write("at last", 7);
        return true;
    };
    EXPECT_EQ(read(), "at last");
    EXPECT_EQ(keyboard.presses, 1);
}

TEST_F(AttentiveStreamTest, BytesThatAreThereAreReadFirst)
{
    stream->setAttendant(&keyboard);
    far->write("x", 1);
    static_cast<void>(PollSet(PollFd(stream->getSocket().getFd(), PollEvents::Read)).wait(seconds(20)));
    EXPECT_EQ(read(), "x");
    EXPECT_EQ(keyboard.presses, 0);
}

TEST_F(AttentiveStreamTest, TheAttendantCanGiveUpAWaitForBytes)
{
    stream->setAttendant(&keyboard);
    EXPECT_THAT([&] { read(); }, ThrowsMessage<StreamIOException>(StrEq("the wait was given up")));
}

TEST_F(AttentiveStreamTest, TheAttendantCanGiveUpAWaitForRoom)
{
    stream->setAttendant(&keyboard);
    EXPECT_THAT([&] { stream->write(much.data(), much.size()); },
                ThrowsMessage<StreamIOException>(StrEq("the wait was given up")));
    EXPECT_EQ(keyboard.presses, 1);
}

TEST_F(AttentiveStreamTest, DeadlinesEndAWait)
{
    stream->setReadDeadline(milliseconds(1));
    EXPECT_THAT([&] { read(); }, ThrowsMessage<StreamIOException>(StrEq("I/O deadline")));
    stream->setReadDeadline(milliseconds(0));
    EXPECT_THAT([&] { read(); }, ThrowsMessage<StreamIOException>(StrEq("I/O deadline")));
    stream->setWriteDeadline(milliseconds(1));
    EXPECT_THAT([&] { stream->write(much.data(), much.size()); },
                ThrowsMessage<StreamIOException>(StrEq("I/O deadline")));
}

TEST_F(AttentiveStreamTest, ACutEndsWaitsWithoutADeadline)
{
    stream->cutAt(std::chrono::steady_clock::now());
    EXPECT_THAT([&] { read(); }, ThrowsMessage<StreamIOException>(StrEq("I/O deadline")));
    EXPECT_THAT([&] { stream->write(much.data(), much.size()); },
                ThrowsMessage<StreamIOException>(StrEq("I/O deadline")));
}

TEST_F(AttentiveStreamTest, ACutEndsWaitsWithALaterDeadline)
{
    stream->setReadDeadline(std::chrono::hours(1));
    stream->cutAt(std::chrono::steady_clock::now() + milliseconds(1));
    EXPECT_THAT([&] { read(); }, ThrowsMessage<StreamIOException>(StrEq("I/O deadline")));
}

TEST_F(AttentiveStreamTest, AConnectionThatBreaksIsReportedWithItsReason)
{
    const linger reset{1, 0};
    ::setsockopt(far->getSocket().getFd(), SOL_SOCKET, SO_LINGER, &reset, sizeof(reset));
    far.reset();
    static_cast<void>(PollSet(PollFd(stream->getSocket().getFd(), PollEvents::Read)).wait(seconds(20)));
    EXPECT_THAT([&] { read(); }, ThrowsMessage<StreamIOException>(StrEq("socket stream receive failure")));
    EXPECT_THAT([&] { stream->write("x", 1); }, ThrowsMessage<StreamIOException>(StrEq("socket stream send failure")));
}

} // namespace

} // namespace qel::test
