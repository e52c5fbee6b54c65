// Lines that cannot be written, or only in part.

#include <qel/common/QelDebugContext.hpp>
#include <qel/common/QelLogger.hpp>

#include "LogBackendRotatingTest.hpp"
#include "support/Allocations.hpp"
#include "support/CapturedLog.hpp"
#include "support/FileCalls.hpp"

#include <cerrno>
#include <csignal>
#include <gmock/gmock.h>
#include <string>
#include <sys/resource.h>
#include <unistd.h>
#include <vector>

namespace qel::test {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::StartsWith;

TEST_F(LogBackendRotatingTest, ReportsAFullDiskOncePerRunOfLostLines)
{
    ASSERT_EQ(::symlink("/dev/full", path("log").c_str()), 0);
    const auto backend = make();
    for (int i = 0; i < 3; ++i)
        log(*backend, "line");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(error("cannot write to log " + path("log"), "28 (No space left on device)")));
}

TEST_F(LogBackendRotatingTest, ReportsTheNumberOfLostLinesAtTheFirstSuccess)
{
    const auto backend = make();
    log(*backend, "before");
    FileCalls calls;
    calls.fail(FileCalls::Writev, ENOSPC, 3);
    for (int i = 0; i < 3; ++i)
        log(*backend, "lost");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(error("cannot write to log " + path("log"), "28 (No space left on device)")));
    log(*backend, "after");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(SystemLogMessage{LOG_INFO, "log " + path("log") +
                                                           " recovered after write error: 3 messages were dropped"}));
    log(*backend, "and on");
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
    EXPECT_EQ(read("log"), "before\nafter\nand on\n");
}

TEST_F(LogBackendRotatingTest, ReportsEveryRunOfFailures)
{
    const auto backend = make();
    for (int run = 0; run < 2; ++run) {
        SCOPED_TRACE(run);
        FileCalls calls;
        calls.fail(FileCalls::Writev, EIO);
        log(*backend, "lost");
        EXPECT_THAT(mSystemLog.take(),
                    ElementsAre(error("cannot write to log " + path("log"), "5 (Input/output error)")));
        log(*backend, "line");
        EXPECT_THAT(mSystemLog.take(),
                    ElementsAre(SystemLogMessage{
                        LOG_INFO, "log " + path("log") + " recovered after write error: 1 messages were dropped"}));
    }
}

TEST_F(LogBackendRotatingTest, AFailedWriteDoesNotCountTowardsTheLimit)
{
    const auto backend = make(10);
    FileCalls calls;
    calls.fail(FileCalls::Writev, ENOSPC);
    log(*backend, "lost line");
    log(*backend, "123456789");
    EXPECT_EQ(files(), (Files{{"log", "123456789\n"}}));
    EXPECT_EQ(mSystemLog.take().size(), 2U);
}

// A write that the disk has room for only in part

TEST_F(LogBackendRotatingTest, WritesTheRestOfAShortWrite)
{
    const auto backend = make();
    std::string expected;
    for (const std::size_t bytes : {0U, 1U, 3U, 7U, 8U}) {
        SCOPED_TRACE(bytes);
        FileCalls calls;
        calls.shortenNextWrite(bytes);
        log(*backend, "abcdefgh");
        EXPECT_THAT(calls.take(), ElementsAre("writev 8+1", "writev " + std::to_string(8 - bytes) + "+1"));
        expected += "abcdefgh\n";
        EXPECT_EQ(read("log"), expected);
    }
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
}

TEST_F(LogBackendRotatingTest, CountsBothWritesOfALineTowardsTheLimit)
{
    const auto backend = make(10);
    FileCalls calls;
    calls.shortenNextWrite(3);
    log(*backend, "abcdefgh");
    log(*backend, "");
    EXPECT_EQ(files(), (Files{{"log", "abcdefgh\n\n"}})) << "8 + 1 + 1 bytes fit";
    log(*backend, "");
    EXPECT_EQ(files(), (Files{{"log", "\n"}, {"log.1", "abcdefgh\n\n"}}));
}

TEST_F(LogBackendRotatingTest, AShortWriteEndsARunOfLostLines)
{
    const auto backend = make();
    FileCalls calls;
    calls.fail(FileCalls::Writev, ENOSPC);
    log(*backend, "lost");
    mSystemLog.take();
    calls.shortenNextWrite(3);
    log(*backend, "line");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(SystemLogMessage{LOG_INFO, "log " + path("log") +
                                                           " recovered after write error: 1 messages were dropped"}));
    EXPECT_EQ(read("log"), "line\n");
}

TEST_F(LogBackendRotatingTest, RemovesThePartOfALineThatCannotBeCompleted)
{
    const auto backend = make();
    log(*backend, "before");
    for (const std::size_t bytes : {0U, 1U, 4U}) {
        SCOPED_TRACE(bytes);
        FileCalls calls;
        calls.shortenNextWrite(bytes);
        calls.fail(FileCalls::Writev, ENOSPC, 1, 1);
        log(*backend, "lost");
        EXPECT_THAT(calls.take(),
                    ElementsAre("writev 4+1", "writev " + std::to_string(4 - bytes) + "+1", "ftruncate 7", "lseek"));
        EXPECT_EQ(read("log"), "before\n");
    }
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(error("cannot write to log " + path("log"), "28 (No space left on device)")))
        << "one run of failures";
    log(*backend, "after");
    EXPECT_EQ(read("log"), "before\nafter\n");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(SystemLogMessage{LOG_INFO, "log " + path("log") +
                                                           " recovered after write error: 3 messages were dropped"}));
}

TEST_F(LogBackendRotatingTest, TriesTheRestOnlyOnce)
{
    const auto backend = make();
    FileCalls calls;
    calls.shortenNextWrite(3);
    calls.shortenNextWrite(2);
    log(*backend, "abcdefgh");
    EXPECT_THAT(calls.take(), ElementsAre("writev 8+1", "writev 5+1", "ftruncate 0", "lseek"));
    EXPECT_EQ(read("log"), "");
    EXPECT_THAT(mSystemLog.take(), ElementsAre(error("cannot write to log " + path("log"), "5 (Input/output error)")));
}

TEST_F(LogBackendRotatingTest, ALineTornForGoodDoesNotCountTowardsTheLimit)
{
    const auto backend = make(10);
    FileCalls calls;
    calls.shortenNextWrite(5);
    calls.fail(FileCalls::Writev, ENOSPC, 1, 1);
    log(*backend, "lost line");
    log(*backend, "123456789");
    EXPECT_EQ(files(), (Files{{"log", "123456789\n"}}));
    mSystemLog.take();
}

TEST_F(LogBackendRotatingTest, OverwritesAPartThatCannotBeCutOff)
{
    const auto backend = make();
    log(*backend, "before");
    FileCalls calls;
    calls.shortenNextWrite(3);
    calls.fail(FileCalls::Writev, ENOSPC, 1, 1);
    calls.fail(FileCalls::Ftruncate, EIO);
    log(*backend, "lost");
    log(*backend, "after");
    EXPECT_EQ(read("log"), "before\nafter\n");
    EXPECT_EQ(mSystemLog.take().size(), 2U) << "the failed write and the recovery";
}

TEST_F(LogBackendRotatingTest, ALimitOnTheFileSizeTearsNoLine)
{
    const auto backend = make();
    struct rlimit before = {};
    ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &before), 0);
    const auto handler = std::signal(SIGXFSZ, SIG_IGN);
    struct rlimit limit = before;
    limit.rlim_cur = 8;
    ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &limit), 0);
    log(*backend, "12345");
    log(*backend, "67890");
    log(*backend, "lost");
    ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &before), 0);
    std::signal(SIGXFSZ, handler);
    EXPECT_EQ(read("log"), "12345\n");
    EXPECT_THAT(mSystemLog.take(), ElementsAre(error("cannot write to log " + path("log"), "27 (File too large)")));
    log(*backend, "on");
    EXPECT_EQ(read("log"), "12345\non\n");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(SystemLogMessage{LOG_INFO, "log " + path("log") +
                                                           " recovered after write error: 2 messages were dropped"}));
}

// The back-end and the rest of the log

TEST_F(LogBackendRotatingTest, KeepsTheNumberOfLostLinesAcrossARotation)
{
    const auto backend = make(4);
    FileCalls calls;
    log(*backend, "ab");
    calls.fail(FileCalls::Writev, ENOSPC);
    log(*backend, "");
    EXPECT_EQ(mSystemLog.take().size(), 1U);
    log(*backend, "cd");
    EXPECT_EQ(files(), (Files{{"log", "cd\n"}, {"log.1", "ab\n"}}));
    EXPECT_EQ(mSystemLog.take().size(), 1U) << "the count outlives the file";
}

TEST_F(LogBackendRotatingTest, WithoutMemoryOnlyTheTextOfTheErrorIsMissing)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const std::string line = "lost";
    for (std::size_t succeeding = 0; succeeding < 4; ++succeeding) {
        SCOPED_TRACE(succeeding);
        const auto backend = make();
        {
            FileCalls calls;
            calls.fail(FileCalls::Writev, ENOSPC);
            Allocations allocations;
            allocations.failAfter(succeeding);
            log(*backend, line);
        }
        const std::vector<SystemLogMessage> messages = mSystemLog.take();
        ASSERT_EQ(messages.size(), 1U);
        EXPECT_EQ(messages[0].priority, LOG_ERR);
        EXPECT_THAT(messages[0].text, StartsWith("cannot write to log " + path("log") + ": errno "));
    }
}

TEST_F(LogBackendRotatingTest, FileErrorsDoNotReachTheLogger)
{
    const CapturedLog captured;
    ASSERT_EQ(::symlink("/dev/full", path("log").c_str()), 0);
    QelLogger::get().addBackend(make());
    QelDebugContext(QelLogger::get(), LogLevel::Error) << "text";
    EXPECT_THAT(captured.lines(), ElementsAre("E: text"));
    EXPECT_EQ(mSystemLog.take().size(), 1U);
}

TEST_F(LogBackendRotatingTest, ReceivesTheLinesOfTheLogger)
{
    const CapturedLog captured;
    LogBackend::registerBackend(make());
    QelDebugContext(QelLogger::get(), LogLevel::Error) << "text";
    ASSERT_EQ(captured.rawLines().size(), 1U);
    EXPECT_EQ(read("log"), captured.rawLines()[0] + "\n");
}

} // namespace
} // namespace qel::test
