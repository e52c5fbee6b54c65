// Records of TLS that hold no message, or a part of one: against a TLS peer that sends them one by one.

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/Error.hpp>

#include "protocol/console/OtherEnd.hpp"
#include "support/CapturedLog.hpp"
#include "support/Errors.hpp"
#include "support/RawTlsPeer.hpp"

#include <chrono>
#include <future>
#include <gmock/gmock.h>
#include <memory>
#include <optional>
#include <string>
#include <utility>

namespace qel::test {

namespace {

using namespace protocol;
using std::chrono::milliseconds;
using Broadcast = QelMessageDaxBroadcastOutboundAsync;

constexpr std::uint8_t kData = 23; // the type of a record with data

std::string frameOf(const QelMessage& message) { return std::string(message.serialize(), message.msgLength()); }

/// A console, introduced over TLS, and its peer. The test has both on its own thread.
class ConsoleRecords : public ::testing::Test {
protected:
    ConsoleRecords()
    {
        ConsoleOptions options = consoleOptions(Cover::Tls);
        options.frameTimeout = milliseconds(20);
        console.emplace(mEnd.takeStream(), options);
        console->onNotice<Broadcast>([this](const Broadcast& notice) { heard += notice.getSenderToolId(); });
        peer = mReady.get_future().get();
    }
    ~ConsoleRecords() override { mIsOver.set_value(); }

    static std::string broadcastFrom(const std::string& sender) { return frameOf(Broadcast(1, 1, sender, "x")); }

    const CapturedLog log{LogLevel::Critical};
    std::optional<Console> console;
    RawTlsPeer* peer = nullptr;
    std::string heard; ///< who sent the broadcasts

private:
    void pPlay(std::unique_ptr<Stream> stream)
    {
        awaitUpgrade(*stream, -1);
        grantUpgrade(*stream);
        const SSLCredentials credentials = Authority::trusted().serverCredentials();
        RawTlsPeer::Options options;
        options.credentials = &credentials;
        RawTlsPeer server(RawTlsPeer::Server, options, std::move(stream));
        server.handshake();
        server.exchangeVersions();
        const std::size_t length = QelMessageGetEnclTypeAndInterfaceVersionReq(1, 1, 1, 0, "").msgLength();
        QelMessageRegistry registry;
        const std::string bytes = server.read(length);
        const auto request = registry.deserialize(bytes.data(), static_cast<unsigned int>(bytes.size()));
        server.write(
            frameOf(QelMessageGetEnclTypeAndInterfaceVersionRsp(request->getCallerId(), 'Q', 1, 0, "type", "serial")));
        mReady.set_value(&server);
        mIsOver.get_future().wait();
    }

    std::promise<RawTlsPeer*> mReady;
    std::promise<void> mIsOver;
    OtherEnd mEnd{[this](std::unique_ptr<Stream> stream) { pPlay(std::move(stream)); }};
};

TEST_F(ConsoleRecords, AnUpdateOfKeysBeginsNoMessage)
{
    peer->updateKeys(false);
    EXPECT_FALSE(console->process(milliseconds(60))) << "longer than a message may take";
    EXPECT_FALSE(console->process());
    EXPECT_FALSE(console->hasPending());
    peer->write(broadcastFrom("a"));
    EXPECT_TRUE(console->process(std::chrono::seconds(10)));
    EXPECT_EQ(heard, "a");
}

TEST_F(ConsoleRecords, AnUpdateOfKeysThatIsToBeAnsweredEndsNoRequest)
{
    peer->updateKeys(true);
    EXPECT_THAT([&] { console->request(QelMessageGetQelTodReq(), milliseconds(60)); },
                failsWith<DeadlinePassed>("the peer did not answer in time: no response to request 0x6003/0x0107"));
    peer->write(broadcastFrom("a"));
    EXPECT_TRUE(console->process(std::chrono::seconds(10)));
    EXPECT_EQ(heard, "a");
}

TEST_F(ConsoleRecords, ARecordThatIsCutAnywhereBeginsNoMessage)
{
    std::string expected;
    const std::size_t length = broadcastFrom("x").size() + 22; // header, type and tag of the record
    for (std::size_t cut = 1; cut < length; ++cut) {
        SCOPED_TRACE(cut);
        const std::string record = peer->protectedRecord(kData, broadcastFrom("x"));
        ASSERT_EQ(record.size(), length);
        peer->sendBytes(record.substr(0, cut));
        EXPECT_FALSE(console->process());
        EXPECT_FALSE(console->hasPending()) << "a loop would not wait";
        peer->sendBytes(record.substr(cut));
        EXPECT_TRUE(console->process());
        EXPECT_EQ(heard, expected += "x");
        EXPECT_FALSE(console->hasPending());
    }
}

TEST_F(ConsoleRecords, ManyMessagesInOneRecordAreAllSeen)
{
    std::string together;
    for (const char sender : std::string("abcdef"))
        together += broadcastFrom(std::string(1, sender));
    peer->write(together);
    EXPECT_TRUE(console->process());
    for (int i = 0; i < 5; ++i) {
        EXPECT_TRUE(console->hasPending());
        EXPECT_TRUE(console->process());
    }
    EXPECT_EQ(heard, "abcdef");
    EXPECT_FALSE(console->hasPending());
}

TEST_F(ConsoleRecords, TheLastMessageBeforeTheEndOfTlsIsSeen)
{
    peer->hold();
    peer->write(broadcastFrom("a") + broadcastFrom("b"));
    peer->closeNotify();
    peer->release();
    EXPECT_TRUE(console->process());
    EXPECT_TRUE(console->process());
    EXPECT_EQ(heard, "ab");
    EXPECT_THAT([&] { console->process(); }, failsWith<ClosedByPeer>("connection lost: SSL error 6"));
}

TEST_F(ConsoleRecords, AMessageHasItsTimeFromItsFirstByte)
{
    peer->write(broadcastFrom("a").substr(0, 1));
    EXPECT_THAT([&] { console->process(); },
                failsWith<DeadlinePassed>("the peer did not answer in time: I/O deadline"));
}

} // namespace

} // namespace qel::test
