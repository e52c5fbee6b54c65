#include <qel/protocol/CommandLine.hpp>

#include "protocol/hypervisor/PtyFixture.hpp"

#include <cerrno>
#include <csignal>
#include <gmock/gmock.h>
#include <stdexcept>

namespace qel::test {

namespace {

using protocol::commandLine;
using protocol::CommandLineOptions;
using protocol::SerialLine;
using ::testing::ThrowsMessage;

bool exists(pid_t pid) { return ::kill(pid, 0) == 0 || errno != ESRCH; }

class CommandLineTest : public PtyFixture {
protected:
    static std::string outputOf(const std::string& command, const CommandLineOptions& options = {})
    {
        const std::unique_ptr<SerialLine> line = commandLine(command, options);
        line->start(kPartition);
        return readUntilEnd(*line);
    }
};

TEST_F(CommandLineTest, RunsTheCommandWithItsPartitionAndTerminalType)
{
    EXPECT_EQ(outputOf("echo $QEL_PARTITION $TERM"), "7 vt220\r\n");
}

TEST_F(CommandLineTest, TheOptionsSetTheEnvironment)
{
    CommandLineOptions options;
    options.term = "xterm";
    options.environment = {"A=1", "LANG=C"};
    EXPECT_EQ(outputOf("echo $TERM $A $LANG", options), "xterm 1 C\r\n");
}

TEST_F(CommandLineTest, ALineCanBeStartedForAnotherPartition)
{
    const std::unique_ptr<SerialLine> line = commandLine("echo $QEL_PARTITION");
    line->start(1);
    EXPECT_EQ(readUntilEnd(*line), "1\r\n");
    line->stop();
    line->start(2);
    EXPECT_EQ(readUntilEnd(*line), "2\r\n");
}

TEST_F(CommandLineTest, TheLastLineWaitsForAllCommandsToEnd)
{
    std::unique_ptr<SerialLine> first = commandLine("echo pid=$$; cat");
    std::unique_ptr<SerialLine> second = commandLine("echo pid=$$; cat");
    first->start(1);
    second->start(2);
    const pid_t firstPid = pidIn(readUntil(*first, "\n"));
    const pid_t secondPid = pidIn(readUntil(*second, "\n"));
    first.reset();
    second.reset();
    EXPECT_FALSE(exists(firstPid));
    EXPECT_FALSE(exists(secondPid));
}

TEST_F(CommandLineTest, WrongArgumentsAreRefusedByName)
{
    const auto make = [](const std::string& command, const std::string& term, const std::string& variable) {
        return [=] { commandLine(command, {term, {variable}}); };
    };
    const std::string null("a=\0b", 4);
    EXPECT_THAT(make("", "vt220", "A=1"), ThrowsMessage<std::invalid_argument>("command"));
    EXPECT_THAT(make(null, "vt220", "A=1"), ThrowsMessage<std::invalid_argument>("command"));
    EXPECT_THAT(make("true", "", "A=1"), ThrowsMessage<std::invalid_argument>("term"));
    EXPECT_THAT(make("true", null, "A=1"), ThrowsMessage<std::invalid_argument>("term"));
    for (const std::string& variable : {std::string(), std::string("A"), std::string("=1"), null})
        EXPECT_THAT(make("true", "vt220", variable), ThrowsMessage<std::invalid_argument>("environment")) << variable;
    make("true", "vt220", "A=")();
}

} // namespace

} // namespace qel::test
