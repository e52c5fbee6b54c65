// What happens in which order when a server reads its configuration again.

#include "lines/LineLogs.hpp"
#include "protocol/server/ServerFixture.hpp"
#include "serve/ServeMachine.hpp"
#include "serve/ServePlan.hpp"
#include "serve/ServeReload.hpp"
#include "support/CapturedLog.hpp"
#include "support/ComesTrue.hpp"
#include "support/TemporaryDirectory.hpp"

#include <fstream>
#include <functional>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace qel::test {

namespace {

using testing::Contains;
using testing::ElementsAre;

/// A line that is never up, and says when it is stopped.
class EndingLine : public protocol::SerialLine {
public:
    explicit EndingLine(std::function<void()> onStop) : mOnStop(std::move(onStop)) {}
    void start(std::uint16_t) override {}
    void stop() override { mOnStop(); }
    ReadResult read(char*, std::size_t) override { return {LineState::Idle, 0}; }
    std::size_t write(const char*, std::size_t length) override { return length; }
    int descriptor() const override { return mWake.getPollFd().mFd.fd; }

private:
    const std::function<void()> mOnStop;
    protocol::WakeUp mWake;
};

class ServeReloading : public ::testing::Test {
protected:
    static protocol::ServerOptions options()
    {
        protocol::ServerOptions options;
        options.listen.clear();
        options.plain = true;
        return options;
    }
    static protocol::Peer named(const std::string& name)
    {
        protocol::Peer peer;
        peer.commonName = name;
        peer.fingerprint = "AA";
        return peer;
    }

    /// A configuration with one partition.
    void write(const std::string& line, const std::string& access) const
    {
        std::ofstream(file) << "credentials = \"" << directory.path()
                            << "\"\nname = \"server\"\n[partition.web]\nid = 1\nline = \"" << line << "\"\naccess = \""
                            << access << "\"\n";
    }

    bool mayOpen(const std::string& name) { return machine.mayOpen(named(name), 1); }

    CapturedLog log{LogLevel::Info};
    const TemporaryDirectory directory;
    const std::string file = directory.file("serve.toml");
    tool::ServeMachine machine{protocol::MachineInfo(), QelCapabilities(), {}};
    protocol::Server server{machine, options()};
    tool::LineLogs logs{4096};
};

TEST_F(ServeReloading, NewRulesDoNotOpenTheOldLineOfAPartition)
{
    write("old", "alice");
    const tool::ServePlan plan = tool::planAgain({"--config=" + file});
    machine.setPolicy(plan.policy);
    std::vector<std::string> mayUseTheOldLine;
    protocol::PartitionOptions boots;
    boots.start = protocol::StartLine::Boot;
    server.addPartition(1, std::make_unique<EndingLine>([&] {
                            for (const char* name : {"alice", "bob"}) {
                                if (mayOpen(name)) mayUseTheOldLine.emplace_back(name);
                            }
                        }),
                        boots);
    ASSERT_TRUE(comesTrue([&] { return server.partitions().front().line == protocol::PartitionState::Line::Up; }));
    tool::ServeReload reload(server, machine, logs, plan, [](const tool::ServePlan&, bool) {});

    write("new", "bob");
    reload.run();
    EXPECT_THAT(mayUseTheOldLine, ElementsAre("alice"));
    EXPECT_FALSE(mayOpen("alice"));
    EXPECT_TRUE(mayOpen("bob"));
    EXPECT_THAT(log.lines(), Contains("I: [qel] partition 1: removed").Times(1));
    EXPECT_THAT(log.lines(),
                Contains("I: [qel] SIGHUP: read " + file + ": 1 partition, 1 rule, 0 sessions ended").Times(1));
}

} // namespace

} // namespace qel::test
