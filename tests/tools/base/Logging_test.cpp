#include <qel/common/QelDebug.hpp>
#include <qel/common/Utilities.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/UniqueFd.hpp>

#include "base/Logging.hpp"
#include "support/Allocations.hpp"
#include "support/CapturedLog.hpp"
#include "support/TemporaryDirectory.hpp"

#include <array>
#include <fcntl.h>
#include <future>
#include <gmock/gmock.h>
#include <sys/stat.h>
#include <unistd.h>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::LogOptions;

class LoggingTest : public ::testing::Test {
protected:
    LoggingTest() { QelDebug::globals().resetLoggers(); }
    ~LoggingTest() override { QelDebug::globals().resetLoggers(); }

    const TemporaryDirectory directory;
};

TEST_F(LoggingTest, LinesOfTheProgramHaveItsName)
{
    CapturedLog log(LogLevel::Info);
    tool::logLine(LogLevel::Debug, "hidden");
    tool::logLine(LogLevel::Info, "shown ", 1);
    EXPECT_THAT(log.lines(), ElementsAre("I: [qel] shown 1"));
}

TEST_F(LoggingTest, AQuietCommandLogsOnRequest)
{
    LogOptions options;
    options.quiet = true;
    tool::startLogging(options, "name.log");
    EXPECT_THAT(QelLogger::get().getBackends(), IsEmpty());
    options.level = "debug";
    tool::startLogging(options, "name.log");
    EXPECT_EQ(QelLogger::get().getBackends().size(), 1U);
    EXPECT_EQ(QelLogger::get().getEffectiveLevel(), LogLevel::Debug);
}

TEST_F(LoggingTest, WithADirectoryTheLogIsAFile)
{
    LogOptions options;
    options.directory = directory.path();
    tool::startLogging(options, "name.log");
    tool::logLine(LogLevel::Info, "in the file");
    tool::logLine(LogLevel::Debug, "not in the file");
    const std::string text = Utilities::readFile(directory.file("name.log"));
    EXPECT_THAT(text, HasSubstr("[qel] in the file\n"));
    EXPECT_THAT(text, Not(HasSubstr("not in the file")));
}

TEST_F(LoggingTest, AFileThatCannotBeWrittenIsAFailure)
{
    const std::string path = directory.file("name.log");
    ASSERT_EQ(::mkdir(path.c_str(), 0700), 0);
    LogOptions options;
    options.directory = directory.path();
    EXPECT_THAT([&] { tool::startLogging(options, "name.log"); },
                ThrowsMessage<FileIOError>(StrEq("cannot write the log " + path + ": 21 (Is a directory)")));
}

TEST_F(LoggingTest, WithoutADirectoryTheLogIsStandardError)
{
    LogOptions options;
    options.level = "error";
    tool::startLogging(options, "name.log");
    ::testing::internal::CaptureStderr();
    tool::logLine(LogLevel::Error, "to be seen");
    tool::logLine(LogLevel::Warn, "not to be seen");
    const std::string text = ::testing::internal::GetCapturedStderr();
    EXPECT_THAT(text, HasSubstr("(E): [qel] to be seen\n"));
    EXPECT_THAT(text, Not(HasSubstr("not to be seen")));
}

TEST_F(LoggingTest, WithoutMemoryALineToStandardErrorIsStillWritten)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    LogOptions options;
    options.level = "info";
    tool::startLogging(options, "name.log");
    ::testing::internal::CaptureStderr();
    const std::string line(1000, 'x');
    QelLogger& logger = protocol::logger();
    Allocations allocations;
    allocations.failAll();
    EXPECT_NO_THROW(logger.send(LogLevel::Info, line)); // what throws here ends the process in practice
    EXPECT_EQ(allocations.count(), 0U);
    allocations.succeedAgain();
    EXPECT_EQ(::testing::internal::GetCapturedStderr(), line + "\n");
}

TEST_F(LoggingTest, ALineLongerThanAPipeIsWrittenWhole)
{
    std::array<int, 2> pipe{};
    ASSERT_EQ(::pipe(pipe.data()), 0);
    const UniqueFd readEnd(pipe[0]);
    ASSERT_NE(::fcntl(pipe[1], F_SETPIPE_SZ, 4096), -1);
    LogOptions options;
    options.level = "info";
    tool::startLogging(options, "name.log");
    const UniqueFd before(::dup(STDERR_FILENO));
    ASSERT_EQ(::dup2(pipe[1], STDERR_FILENO), STDERR_FILENO);
    ::close(pipe[1]);
    const std::string text(20000, 'x');
    auto written = std::async(std::launch::async, [&] {
        tool::logLine(LogLevel::Info, text);
        ::dup2(before.get(), STDERR_FILENO); // ends the pipe
    });
    std::string read;
    std::array<char, 512> part{};
    for (ssize_t count = 0; (count = ::read(readEnd.get(), part.data(), part.size())) > 0;)
        read.append(part.data(), static_cast<std::size_t>(count));
    written.get();
    EXPECT_THAT(read, EndsWith("[qel] " + text + "\n"));
}

TEST_F(LoggingTest, ALineToAClosedStandardErrorIsDropped)
{
    LogOptions options;
    options.level = "info";
    tool::startLogging(options, "name.log");
    const UniqueFd before(::dup(STDERR_FILENO));
    ::close(STDERR_FILENO);
    EXPECT_NO_THROW(protocol::logger().send(LogLevel::Info, "to nobody"));
    ASSERT_EQ(::dup2(before.get(), STDERR_FILENO), STDERR_FILENO);
}

struct Case {
    std::vector<std::string> arguments;
    bool good;
};

TEST_F(LoggingTest, TheOptionsAreChecked)
{
    const std::vector<Case> cases{
        {{}, true},
        {{"--log-level", "WARN"}, true},
        {{"--log-level", "0"}, true},
        {{"--log-level", "loud"}, false},
        {{"--log-level", "c"}, true},
        {{"--log-level", "4"}, true},
        {{"--log-level", "5"}, false},
        {{"--log-level", "1x"}, false},
        {{"--log-level", "03"}, false},
        {{"--log-level", " 3"}, false},
        {{"--log-level", ""}, false},
        {{"--log-level", "-1"}, false},
        {{"--log-level", "^"}, false},
        {{"--log-level", "inherit"}, false},
        {{"--log-dir", directory.path()}, true},
        {{"--log-dir", directory.file("missing")}, false},
        {{"--log-size", "4096"}, true},
        {{"--log-size", "4095"}, false},
    };
    for (const Case& entry : cases) {
        SCOPED_TRACE(CLI::detail::join(entry.arguments, " "));
        LogOptions options;
        CLI::App app;
        tool::addLogOptions(app, options);
        bool good = true;
        try {
            app.parse(std::vector<std::string>(entry.arguments.rbegin(), entry.arguments.rend()));
        } catch (const CLI::ParseError&) {
            good = false;
        }
        EXPECT_EQ(good, entry.good);
    }
}

TEST_F(LoggingTest, HelpStatesTheDefaultLevel)
{
    LogOptions loud;
    CLI::App loudApp;
    tool::addLogOptions(loudApp, loud);
    EXPECT_EQ(loudApp.get_option("--log-level")->get_description(),
              "Log lines of this level and above: debug, info, warn, error or critical (default: info)");
    LogOptions quiet;
    quiet.usual = LogLevel::Warn;
    quiet.quiet = true;
    CLI::App quietApp;
    tool::addLogOptions(quietApp, quiet);
    EXPECT_EQ(
        quietApp.get_option("--log-level")->get_description(),
        "Log lines of this level and above: debug, info, warn, error or critical (default: no log; with --log-dir "
        "warn)");
}

TEST_F(LoggingTest, QuietCommandLogsFromItsUsualLevelWithADirectory)
{
    LogOptions options;
    options.quiet = true;
    options.usual = LogLevel::Warn;
    options.directory = directory.path();
    tool::startLogging(options, "name.log");
    EXPECT_EQ(QelLogger::get().getEffectiveLevel(), LogLevel::Warn);
}

} // namespace

} // namespace qel::test
