// What a server answers over its status socket, with consoles in memory.

#include <qel/common/QelMessageVirtualSerial.hpp>

#include "protocol/server/ServerFixture.hpp"
#include "serve/ServeMachine.hpp"
#include "serve/ServeStatus.hpp"
#include "support/ComesTrue.hpp"
#include "support/CredentialDirectory.hpp"

#include <filesystem>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <string>

namespace qel::test {

namespace {

using Json = nlohmann::ordered_json;
using testing::Contains;
using testing::HasSubstr;
using testing::IsEmpty;

constexpr uid_t kUser = 1234;

/// A line that is up at once, and may have a break.
class StillLine : public protocol::SerialLine {
public:
    explicit StillLine(bool hasBreak) : mHasBreak(hasBreak) {}
    void start(std::uint16_t) override {}
    void stop() override {}
    ReadResult read(char*, std::size_t) override { return {LineState::Idle, 0}; }
    std::size_t write(const char*, std::size_t length) override { return length; }
    int descriptor() const override { return mWake.getPollFd().mFd.fd; }
    bool sendBreak() override { return mHasBreak; }

private:
    const bool mHasBreak;
    protocol::WakeUp mWake;
};

class ServeStatusTest : public ::testing::Test {
protected:
    ServeStatusTest()
    {
        protocol::PartitionOptions named;
        named.name = "web1";
        named.start = protocol::StartLine::Boot;
        server.addPartition(1, std::make_unique<StillLine>(true), named);
        named.name = "db";
        server.addPartition(2, std::make_unique<StillLine>(false), named);
        server.addPartition(3, std::make_unique<StillLine>(true)); // starts when it is opened
    }

    static protocol::ServerOptions options()
    {
        protocol::ServerOptions options;
        options.listen.clear();
        options.plain = true;
        return options;
    }
    static tool::ServePlan plan()
    {
        tool::ServePlan plan;
        plan.transport.plain = true;
        plan.server.maxConsoles = 5;
        return plan;
    }

    Json ask(const std::string& line) { return Json::parse(status.answer(line, kUser)); }
    std::string refusal(const std::string& line)
    {
        const Json answer = ask(line);
        EXPECT_EQ(answer.at("ok"), false);
        return answer.at("error");
    }

    /// A console with an open session.
    std::unique_ptr<Stream> connect(const std::string& toolId, std::uint16_t partition, std::uint16_t number)
    {
        auto ends = protocol::makeMemoryStreams();
        ends.first->setReadDeadline(Loopback::kDeadline);
        server.serve(std::move(ends.second), "of " + toolId);
        LoopbackMessages messages(*ends.first);
        EXPECT_EQ(messages.ask(QelMessageGetEnclTypeAndInterfaceVersionReq(1, 7, 2, 3, toolId))->getStatus(), 0U);
        EXPECT_EQ(messages.ask(QelMessageInterfaceCmpOpenKrogSessionReq())->getStatus(), 0U);
        EXPECT_EQ(messages.ask(QelMessageVirtualSerialOpenReq(partition, number, false))->getStatus(), 0U);
        return std::move(ends.first);
    }

    CapturedLog log{LogLevel::Info};
    tool::ServeMachine machine{protocol::MachineInfo(), QelCapabilities(), {}};
    protocol::Server server{machine, options()};
    tool::ServeStatus status{server, plan()};
};

TEST_F(ServeStatusTest, ReportsConsolesAndPartitions)
{
    const auto console = connect("ops", 1, 0);
    const Json report = ask("status").at("status");
    EXPECT_EQ(report.at("pid"), ::getpid());
    EXPECT_EQ(report.at("maxConsoles"), 5);
    EXPECT_THAT(report.at("certificates"), IsEmpty());
    EXPECT_EQ(report.at("consoles").at(0).at("toolId"), "ops");
    EXPECT_EQ(report.at("consoles").at(0).at("address"), "of ops");
    EXPECT_EQ(report.at("consoles").at(0).at("received").at("messages"), 3);
    EXPECT_EQ(report.at("partitions").size(), 3U);
    EXPECT_EQ(report.at("partitions").at(0).at("sessions").dump(), R"([{"connection":0,"console":1,"setUp":false}])");
}

TEST_F(ServeStatusTest, TellsTheDatesOfTheCertificatesThatWereLoadedLast)
{
    const CredentialDirectory credentials;
    tool::ServePlan protectedPlan;
    protectedPlan.transport.directory = credentials.path();
    protectedPlan.transport.name = "server";
    status.note(protectedPlan, false); // loading has failed
    EXPECT_THAT(ask("status").at("status").at("certificates"), IsEmpty());
    status.note(protectedPlan, true);
    const Json fine = ask("status").at("status").at("certificates");
    ASSERT_EQ(fine.size(), 2U);
    EXPECT_EQ(fine.at(0).at("file"), credentials.file("server.crt"));
    EXPECT_EQ(fine.at(0).at("state"), "fine");
    EXPECT_EQ(fine.at(1).at("file"), credentials.file("root.crt"));
    protectedPlan.warnExpiry = std::chrono::hours(24) * 36500;
    ASSERT_TRUE(std::filesystem::remove(credentials.file("server.crt")));
    status.note(protectedPlan, false); // the new warning time counts, the certificates are those in use
    const Json due = ask("status").at("status").at("certificates");
    ASSERT_EQ(due.size(), 2U);
    EXPECT_EQ(due.at(0).at("state"), "due");
    EXPECT_EQ(due.at(0).at("notAfter"), fine.at(0).at("notAfter"));
}

TEST_F(ServeStatusTest, ClosesTheSessionThatTypesOrTheOneThatIsNamed)
{
    const auto types = connect("ops", 1, 0);
    const auto watches = connect("eve", 1, 3);
    EXPECT_EQ(ask("close web1").dump(),
              R"({"ok":true,"closed":[{"partition":1,"connection":0,"console":1,"name":"ops"}]})");
    EXPECT_THAT(log.lines(), Contains(HasSubstr("audit: ended console=1 name=\"\" fingerprint=- address=of ops "
                                                "partition=1 connection=0 uid=1234")));
    EXPECT_EQ(refusal("close web1"), "partition 1, connection 0: there is no session");
    EXPECT_EQ(ask("close 1/3").dump(),
              R"({"ok":true,"closed":[{"partition":1,"connection":3,"console":2,"name":"eve"}]})");
    EXPECT_EQ(refusal("close 1/3"), "partition 1, connection 3: there is no session");
}

TEST_F(ServeStatusTest, ClosesAllSessionsOfAConsole)
{
    const auto types = connect("ops", 1, 0);
    EXPECT_EQ(LoopbackMessages(*types).ask(QelMessageVirtualSerialOpenReq(2, 7, false))->getStatus(), 0U);
    EXPECT_EQ(ask("close #1").dump(), R"({"ok":true,"closed":[{"partition":1,"connection":0,"console":1,"name":"ops"},)"
                                      R"({"partition":2,"connection":7,"console":1,"name":"ops"}]})");
    EXPECT_EQ(refusal("close #1"), "console #1 has no session");
    EXPECT_EQ(refusal("close #2"), "there is no partition and no console #2");
}

TEST_F(ServeStatusTest, RefusesAPlaceThatCannotBe)
{
    EXPECT_EQ(refusal("close nobody"), "there is no partition and no console nobody");
    EXPECT_EQ(refusal("close 4"), "there is no partition and no console 4");
    EXPECT_EQ(refusal("close web1/16"), "\"16\" is not a connection number, 0 to 15");
    EXPECT_EQ(refusal("close web1/"), "\"\" is not a connection number, 0 to 15");
    EXPECT_EQ(refusal("close /1"), "there is no partition and no console /1");
    EXPECT_EQ(refusal("close #"), "there is no partition and no console #");
    EXPECT_EQ(refusal("close 65537"), "there is no partition and no console 65537");
}

TEST_F(ServeStatusTest, SendsABreakWhereTheLineCan)
{
    ASSERT_TRUE(comesTrue([&] { return server.partitions().at(1).line == protocol::PartitionState::Line::Up; }));
    EXPECT_EQ(ask("break web1").dump(), R"({"ok":true,"partition":1})");
    EXPECT_THAT(log.lines(), Contains(HasSubstr("audit: break partition=1 uid=1234")));
    EXPECT_EQ(refusal("break 2"),
              "partition 2: its line has no break, or could not send it; the server's log says so then");
    EXPECT_EQ(refusal("break 3"), "partition 3: its line is down");
    EXPECT_EQ(refusal("break 4"), "there is no partition 4");
}

TEST_F(ServeStatusTest, AnswersRubbishWithTheRequestsThatThereAre)
{
    for (const char* line : {"", " ", "status all", "close", "close ", "break", "STATUS", "quit", "\x01"}) {
        SCOPED_TRACE(line);
        EXPECT_EQ(refusal(line), "the requests are: status, close CONSOLE|PARTITION[/CONNECTION], break PARTITION");
    }
    EXPECT_EQ(ask("status\r").at("ok"), true); // of a client that ends lines otherwise
}

TEST_F(ServeStatusTest, ATargetThatIsNotUtf8IsAnswered)
{
    EXPECT_THAT(refusal("close \xFF"), HasSubstr("there is no partition and no console"));
}

} // namespace

} // namespace qel::test
