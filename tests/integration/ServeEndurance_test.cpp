// What a server lives through in months: reloads of changing files, consoles that come and go. Nothing may be left of
// it. With QEL_TEST_LONG in the environment as often as in a day; otherwise a few times.

#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/Utilities.hpp>

#include "integration/TlsConsole.hpp"
#include "integration/TlsTest.hpp"
#include "support/ComesTrue.hpp"
#include "support/DatagramSocket.hpp"
#include "support/TemporaryDirectory.hpp"

#include <csignal>
#include <cstdlib>
#include <gmock/gmock.h>
#include <string>

namespace qel::test {

namespace {

using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::StartsWith;

int times(int few, int many) { return std::getenv("QEL_TEST_LONG") == nullptr ? few : many; }

/// A console over TLS with one session, which echoes what is typed.
class EnduringConsole {
public:
    EnduringConsole(const std::string& endpoint, const std::string& toolId, std::uint16_t partition, bool force = false)
        : mConsole(endpoint), mPartition(partition)
    {
        mConsole.comeIn(toolId);
        grant(QelMessageInterfaceCmpOpenKrogSessionReq());
        grant(QelMessageVirtualSerialOpenReq(partition, 0, force));
        grant(QelMessageVirtualSerialSetupSessionReq(partition, 0));
    }

    void grant(const QelMessage& request)
    {
        mConsole.messages().send(request);
        for (;;) {
            const auto message = mConsole.messages().receive();
            if (message->getClassification() != QelMessageClassification::Response) continue;
            ASSERT_EQ(message->getStatus(), 0U) << request.getLogID();
            return;
        }
    }

    /// Types a line and waits for its echo.
    void expectEcho(const std::string& word)
    {
        mConsole.tls().setReadDeadline(Loopback::kDeadline); // the one from the beginning has passed
        const std::string line = word + "\n";
        mConsole.messages().send(
            QelMessageVirtualSerialDataToOsAsync(mPartition, 0, static_cast<std::uint16_t>(line.size()), line.data()));
        while (mData.find(word + "\r\n" + word) == std::string::npos) { // of the terminal, and of the command
            const auto message = mConsole.messages().receive();
            const auto* data = dynamic_cast<const QelMessageVirtualSerialDataToDaxAsync*>(message.get());
            ASSERT_NE(data, nullptr) << message->getLogID();
            mData.append(data->getSerialData(), data->getSerialDataLength());
        }
        mData.clear();
    }

private:
    TlsConsole mConsole;
    const std::uint16_t mPartition;
    std::string mData;
};

/// What a process uses.
struct Use {
    std::size_t descriptors;
    std::size_t threads;
    std::size_t children;

    friend bool operator==(const Use& a, const Use& b)
    {
        return a.descriptors == b.descriptors && a.threads == b.threads && a.children == b.children;
    }
    friend std::ostream& operator<<(std::ostream& os, const Use& use)
    {
        return os << use.descriptors << " descriptors, " << use.threads << " threads, " << use.children << " children";
    }
};

class ServeEndurance : public Tls {
protected:
    static Use useOf(ServeProcess& server)
    {
        return {server.process().descriptors(), server.threads(), server.process().children()};
    }

    static void expectUse(ServeProcess& server, const Use& expected)
    {
        EXPECT_TRUE(comesTrue([&] { return useOf(server) == expected; })) << useOf(server) << ", not " << expected;
    }
};

/// The configuration of a round: one partition that stays, others that come, go and change, rules, and logs.
std::string configuration(int round, const std::string& logs)
{
    const std::string number = std::to_string(round);
    std::string toml = "[partition.kept]\nid = 1\nline = 'exec cat'\nreplay = " + std::to_string(round % 3 * 1000) +
                       "\ndescription = 'round " + number + "'\n";
    if (round % 2 == 1) toml += "log = '" + logs + "'\n";
    toml += "[partition.changed]\nid = 2\nstart = 'boot'\nline = 'exec cat # " + number + "'\n";
    if (round % 3 != 0) toml += "[partition.r" + number + "]\nid = 3\nline = 'unix:/no/such/" + number + "'\n";
    toml += "[[rule]]\nname = 'client'\nmay = ['type', 'force']\n";
    if (round % 5 != 0) toml += "[[rule]]\nname = 'other" + number + "'\nmay = 'watch'\npartitions = '1-2'\n";
    return toml;
}

TEST_F(ServeEndurance, ReloadsLeaveNothingBehindAndSessionsAlone)
{
    const TemporaryDirectory logs;
    const DatagramSocket manager(directory.file("notify"));
    const std::string file = directory.file("serve.toml");
    Utilities::writeFile(file, configuration(0, logs.path()));
    ServeProcess server({"--config", file, "--max-consoles", "8"}, "127.0.0.1:0", directory.options("server"),
                        {{"NOTIFY_SOCKET", directory.file("notify")}});
    ASSERT_THAT(manager.await(), StartsWith("READY=1"));
    EnduringConsole first(server.endpoint(), "first", 1);
    EnduringConsole second(server.endpoint(), "second", 2); // whose partition is replaced each time
    first.expectEcho("before");
    ASSERT_TRUE(comesTrue([&] { return server.process().children() == 2; }));
    const Use before = useOf(server);
    const int rounds = times(30, 1440);
    for (int round = 1; round <= rounds + 1; ++round) {
        Utilities::writeFile(file, configuration(round <= rounds ? round : 0, logs.path()));
        server.process().signal(SIGHUP);
        ASSERT_THAT(manager.await(), StartsWith("RELOADING=1")) << round;
        ASSERT_THAT(manager.await(), StartsWith("READY=1")) << round;
        if (round % 10 != 0) continue;
        ASSERT_NO_FATAL_FAILURE(first.expectEcho("round " + std::to_string(round)));
    }
    first.expectEcho("after");
    expectUse(server, before);
    EXPECT_THAT(server.stop().errors, Not(HasSubstr("(E):")));
}

TEST_F(ServeEndurance, SessionsLeaveNothingBehind)
{
    ServeProcess server({"--partition", "1=head -n 1", "--partition", "2=cat"}, "127.0.0.1:0",
                        directory.options("server"));
    EnduringConsole kept(server.endpoint(), "kept", 2);
    kept.expectEcho("before");
    const Use before = useOf(server);
    const int sessions = times(30, 1000);
    for (int i = 0; i < sessions; ++i) {
        // By force: the server may not have noticed yet that the one before has gone.
        EnduringConsole console(server.endpoint(), "passing-" + std::to_string(i), 1, true);
        ASSERT_NO_FATAL_FAILURE(console.expectEcho("x")) << i;
        if (i % 3 == 0) console.grant(QelMessageInterfaceCmpCloseKrogSessionReq()); // the others vanish
    }
    kept.expectEcho("after");
    expectUse(server, before);
    server.stop();
}

} // namespace

} // namespace qel::test
