#include <qel/common/QelDebug.hpp>
#include <qel/common/QelDebugContext.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/Utilities.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "support/Allocations.hpp"
#include "support/CalendarFailure.hpp"
#include "support/CapturedLog.hpp"
#include "support/GroupingLocale.hpp"
#include "support/ProcessIdCalls.hpp"
#include "support/SettableClock.hpp"
#include "support/ThrowingClock.hpp"
#include "support/ThrowingLogBackend.hpp"
#include "support/TimeZoneScope.hpp"

#include <chrono>
#include <csignal>
#include <ctime>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <locale>
#include <memory>
#include <string>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

namespace qel::test {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using std::chrono::system_clock;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::StartsWith;

constexpr std::time_t kExampleTime = 1772384649; // 2026-03-01 17:04:09 UTC
constexpr const char* kExampleText = "[2026-03-01 17:04:09] ";

/// "(<process id>:<thread id>) " of the calling thread, asked from the system.
std::string idsOfThisThread()
{
    return "(" + std::to_string(::getpid()) + ":" + std::to_string(::syscall(SYS_gettid)) + ") ";
}

/// The line that a context of the root logger makes on the calling thread.
std::string lineOfThisThread()
{
    const CapturedLog log;
    {
        QelDebugContext(QelLogger::get(), LogLevel::Error) << "text";
    }
    const std::vector<std::string> lines = log.rawLines();
    return lines.size() == 1 ? lines[0] : "not one line";
}

class QelDebugContextTest : public ::testing::Test {
protected:
    QelDebugContextTest() { mClock.setSystem(system_clock::from_time_t(kExampleTime)); }

    SettableClock mClock;
    CapturedLog mLog;
};

TEST_F(QelDebugContextTest, ALineBeginsWithTimeIdsAndLevel)
{
    QelDebugContext(QelLogger::get(), LogLevel::Error) << "text";
    EXPECT_THAT(mLog.rawLines(), ElementsAre(kExampleText + idsOfThisThread() + "(E): text"));
}

TEST_F(QelDebugContextTest, ALineOfANamedLoggerShowsTheName)
{
    QelDebugContext(QelLogger::get("a.b.c"), LogLevel::Info) << "text";
    EXPECT_THAT(mLog.rawLines(), ElementsAre(kExampleText + idsOfThisThread() + "(I): [a.b.c] text"));
}

TEST_F(QelDebugContextTest, EachLevelShowsItsLetter)
{
    for (const int level : {-1, 0, 1, 2, 3, 4, 7}) {
        QelDebugContext(QelLogger::get(), static_cast<LogLevel::Level>(level)) << level;
    }
    EXPECT_THAT(mLog.lines(), ElementsAre("^: -1", "D: 0", "I: 1", "W: 2", "E: 3", "C: 4", "?: 7"));
}

TEST_F(QelDebugContextTest, SendsItsLineWithItsLevelWhenDestroyedAndNotBefore)
{
    const auto backend = std::make_shared<RecordingLogBackend>();
    QelLogger::get().addBackend(backend);
    {
        QelDebugContext line(QelLogger::get(), LogLevel::Critical);
        line << "in ";
        line << "parts " << 3;
        EXPECT_THAT(mLog.lines(), IsEmpty());
    }
    EXPECT_THAT(mLog.lines(), ElementsAre("C: in parts 3"));
    ASSERT_EQ(backend->entries().size(), 1U);
    EXPECT_EQ(backend->entries()[0].level, LogLevel::Critical);
}

TEST_F(QelDebugContextTest, SendsTheBarePrefixWhenNothingIsWritten)
{
    {
        const QelDebugContext line(QelLogger::get(), LogLevel::Warn);
    }
    EXPECT_THAT(mLog.rawLines(), ElementsAre(kExampleText + idsOfThisThread() + "(W): "));
}

TEST_F(QelDebugContextTest, DoesNotTestTheLevel)
{
    QelLogger::get().setLevel(LogLevel::Critical);
    QelDebugContext(QelLogger::get(), LogLevel::Debug) << "text";
    EXPECT_THAT(mLog.lines(), ElementsAre("D: text"));
}

TEST_F(QelDebugContextTest, SendsToTheGivenLogger)
{
    const auto backend = std::make_shared<RecordingLogBackend>();
    QelLogger::get("given").propagate(false).addBackend(backend);
    QelDebugContext(QelLogger::get("given"), LogLevel::Error) << "text";
    EXPECT_EQ(backend->lines().size(), 1U);
    EXPECT_THAT(mLog.lines(), IsEmpty());
}

TEST_F(QelDebugContextTest, CanBeWrittenToInOneExpression)
{
    Utilities::ref(QelDebugContext(QelLogger::get(), LogLevel::Error)) << hexFormat(0x1F) << " text";
    EXPECT_THAT(mLog.lines(), ElementsAre("E: 0x0000001F text"));
}

TEST_F(QelDebugContextTest, ALineMayHoldLineEndsAndNullBytes)
{
    const char bytes[] = {'a', 'b'};
    QelDebugContext(QelLogger::get(), LogLevel::Error) << "dump:\n"
                                                       << HexDumpFormatter(bytes, 2, false) << std::string("\0end", 4);
    EXPECT_THAT(mLog.lines(), ElementsAre(std::string("E: dump:\n 6162\n\n\0end", 20)));
}

TEST_F(QelDebugContextTest, StartsEveryLineWithAFreshStream)
{
    QelDebugContext(QelLogger::get(), LogLevel::Error) << std::hex << std::uppercase << 255;
    QelDebugContext(QelLogger::get(), LogLevel::Error) << 255;
    EXPECT_THAT(mLog.lines(), ElementsAre("E: FF", "E: 255"));
}

TEST_F(QelDebugContextTest, OneLineMayBeWrittenWhileAnotherIsOpen)
{
    {
        QelDebugContext outer(QelLogger::get(), LogLevel::Error);
        outer << "outer ";
        QelDebugContext(QelLogger::get("inner"), LogLevel::Debug) << "text";
        outer << "text";
    }
    EXPECT_THAT(mLog.rawLines(), ElementsAre(kExampleText + idsOfThisThread() + "(D): [inner] text",
                                             kExampleText + idsOfThisThread() + "(E): outer text"));
}

// The cap

TEST_F(QelDebugContextTest, ALineHoldsAtMost32767BytesPrefixIncluded)
{
    QelDebugContext(QelLogger::get(), LogLevel::Error) << std::string(40000, 'x');
    ASSERT_EQ(mLog.rawLines().size(), 1U);
    const std::string line = mLog.rawLines()[0];
    const std::string prefix = kExampleText + idsOfThisThread() + "(E): ";
    EXPECT_EQ(line.size(), 32767U);
    EXPECT_TRUE(line == prefix + std::string(32767 - prefix.size(), 'x'));
}

TEST_F(QelDebugContextTest, ManySmallWritesEndAtTheCapToo)
{
    {
        QelDebugContext line(QelLogger::get(), LogLevel::Error);
        for (int i = 0; i < 40000; ++i)
            line << 'x';
    }
    ASSERT_EQ(mLog.rawLines().size(), 1U);
    EXPECT_EQ(mLog.rawLines()[0].size(), 32767U);
}

TEST_F(QelDebugContextTest, ALineThatExactlyFitsIsNotCut)
{
    const std::size_t room = 32767 - (kExampleText + idsOfThisThread() + "(E): ").size();
    {
        QelDebugContext line(QelLogger::get(), LogLevel::Error);
        line << std::string(room - 1, 'x') << 'y';
        EXPECT_TRUE(line.good());
        line << 'z';
        EXPECT_TRUE(line.bad());
        line << "more";
    }
    ASSERT_EQ(mLog.rawLines().size(), 1U);
    EXPECT_EQ(mLog.rawLines()[0].size(), 32767U);
    EXPECT_EQ(mLog.rawLines()[0].back(), 'y');
}

TEST_F(QelDebugContextTest, ANameThatFillsTheLineIsCutLikeText)
{
    QelDebugContext(QelLogger::get(std::string(40000, 'n')), LogLevel::Error) << "text";
    ASSERT_EQ(mLog.rawLines().size(), 1U);
    EXPECT_EQ(mLog.rawLines()[0].size(), 32767U);
    EXPECT_EQ(mLog.rawLines()[0].back(), 'n');
}

// The time

TEST_F(QelDebugContextTest, TheTimeIsReadForEachLine)
{
    const std::string rest = idsOfThisThread() + "(E): text";
    const auto expect = [&](const char* time) {
        mLog.clear();
        {
            QelDebugContext(QelLogger::get(), LogLevel::Error) << "text";
        }
        EXPECT_THAT(mLog.rawLines(), ElementsAre("[" + std::string(time) + "] " + rest));
    };
    expect("2026-03-01 17:04:09");
    mClock.advance(milliseconds(999));
    expect("2026-03-01 17:04:09");
    mClock.advance(milliseconds(1));
    expect("2026-03-01 17:04:10");
    mClock.advance(-seconds(10)); // the clock is set back
    expect("2026-03-01 17:04:00");
    mClock.advance(-seconds(4 * 60 + 1));
    expect("2026-03-01 16:59:59");
    mClock.advance(seconds(1));
    expect("2026-03-01 17:00:00");
}

TEST_F(QelDebugContextTest, TheTimeIsUtcWithoutFractionAndZone)
{
    struct {
        std::time_t time;
        const char* text;
    } const rows[] = {
        {0, "[1970-01-01 00:00:00] "},          {-1, "[1969-12-31 23:59:59] "},
        {951782400, "[2000-02-29 00:00:00] "},  {1709251199, "[2024-02-29 23:59:59] "},
        {1709251200, "[2024-03-01 00:00:00] "}, {4102444799, "[2099-12-31 23:59:59] "},
        {7258118400, "[2200-01-01 00:00:00] "},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.text);
        mLog.clear();
        mClock.setSystem(system_clock::from_time_t(row.time));
        {
            QelDebugContext(QelLogger::get(), LogLevel::Error) << "text";
        }
        ASSERT_EQ(mLog.rawLines().size(), 1U);
        EXPECT_THAT(mLog.rawLines()[0], StartsWith(row.text + idsOfThisThread()));
    }
}

TEST_F(QelDebugContextTest, TheTimeIgnoresTheZoneOfTheProcess)
{
    const TimeZoneScope zone("XYZ-05:30");
    mClock.advance(seconds(1)); // a second that no line has shown yet
    {
        QelDebugContext(QelLogger::get(), LogLevel::Error) << "text";
    }
    ASSERT_EQ(mLog.rawLines().size(), 1U);
    EXPECT_THAT(mLog.rawLines()[0], StartsWith("[2026-03-01 17:04:10] "));
}

TEST(QelDebugContext, ShowsTheTimeOfTheClockInForce)
{
    const CapturedLog log;
    const auto timeOfALine = [&log] {
        {
            QelDebugContext(QelLogger::get(), LogLevel::Error) << "text";
        }
        return log.rawLines().back().substr(0, 22);
    };
    const auto realTime = [] {
        // The same clock: time(2) reads a coarser one, which reaches a new second up to a timer tick later.
        const std::time_t now = system_clock::to_time_t(system_clock::now());
        std::tm fields = {};
        ::gmtime_r(&now, &fields);
        char text[32];
        std::strftime(text, sizeof(text), "[%Y-%m-%d %H:%M:%S] ", &fields);
        return std::string(text);
    };
    const auto expectRealTime = [&] {
        const std::string before = realTime();
        const std::string shown = timeOfALine();
        EXPECT_GE(shown, before);
        EXPECT_LE(shown, realTime());
    };
    expectRealTime();
    {
        SettableClock clock;
        clock.setSystem(system_clock::from_time_t(kExampleTime));
        EXPECT_EQ(timeOfALine(), kExampleText);
    }
    expectRealTime();
}

TEST(QelDebugContext, ReadsTheClockOncePerLine)
{
    const CapturedLog log;
    const SettableClock clock;
    for (unsigned i = 1; i <= 3; ++i) {
        {
            QelDebugContext(QelLogger::get(), LogLevel::Error) << "text";
        }
        EXPECT_EQ(clock.systemReads(), i);
    }
    EXPECT_EQ(clock.steadyReads(), 0U);
}

TEST(QelDebugContext, ATimeThatCannotBeBrokenDownIsLeftOut)
{
    const CapturedLog log;
    SettableClock clock; // a second that no other test has shown
    clock.setSystem(system_clock::from_time_t(kExampleTime + 86400));
    {
        const CalendarFailure failure;
        QelDebugContext(QelLogger::get(), LogLevel::Error) << "text";
    }
    EXPECT_THAT(log.rawLines(), ElementsAre("[] " + idsOfThisThread() + "(E): text"));
}

TEST(QelDebugContext, AClockThatThrowsLeavesTheTimeOut)
{
    const CapturedLog log;
    ThrowingClock clock; // the epoch, when it works
    clock.failOnceAfter(1);
    for (int i = 0; i < 3; ++i) {
        EXPECT_NO_THROW(QelDebugContext(QelLogger::get(), LogLevel::Error) << i);
    }
    clock.failAfter(0);
    for (int i = 3; i < 5; ++i) {
        EXPECT_NO_THROW(QelDebugContext(QelLogger::get(), LogLevel::Error) << i);
    }
    const std::string rest = idsOfThisThread() + "(E): ";
    EXPECT_THAT(log.rawLines(),
                ElementsAre("[1970-01-01 00:00:00] " + rest + "0", "[] " + rest + "1",
                            "[1970-01-01 00:00:00] " + rest + "2", "[] " + rest + "3", "[] " + rest + "4"));
}

// The ids

TEST_F(QelDebugContextTest, EachThreadShowsItsOwnId)
{
    const std::string ids = idsOfThisThread();
    {
        QelDebugContext(QelLogger::get(), LogLevel::Error) << "main";
    }
    std::string idsOfOther;
    std::thread other([&] {
        idsOfOther = idsOfThisThread();
        QelDebugContext(QelLogger::get(), LogLevel::Error) << "other";
    });
    other.join();
    {
        QelDebugContext(QelLogger::get(), LogLevel::Error) << "main";
    }
    EXPECT_NE(ids, idsOfOther);
    EXPECT_THAT(mLog.rawLines(), ElementsAre(kExampleText + ids + "(E): main", kExampleText + idsOfOther + "(E): other",
                                             kExampleText + ids + "(E): main"));
}

/// Runs a check in a forked child and gives its answer.
template <typename Check>
bool holdsInChild(Check check)
{
    const pid_t child = ::fork();
    if (child == 0) ::_exit(check() ? 0 : 1);
    int status = -1;
    return child > 0 && ::waitpid(child, &status, 0) == child && WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

bool showsOwnIds() { return lineOfThisThread().find("] " + idsOfThisThread() + "(E): text") != std::string::npos; }

TEST(QelDebugContextFork, AChildShowsItsOwnIdsAfterItsParentHasLogged)
{
    const SettableClock clock; // all lines fall into one second, so nothing but the fork renews the prefix
    ASSERT_TRUE(showsOwnIds());
    EXPECT_TRUE(holdsInChild(showsOwnIds));
    EXPECT_TRUE(showsOwnIds()) << "the parent afterwards";
}

TEST(QelDebugContextFork, AGrandchildShowsItsOwnIdsToo)
{
    const SettableClock clock;
    ASSERT_TRUE(showsOwnIds());
    EXPECT_TRUE(holdsInChild([] { return showsOwnIds() && holdsInChild(showsOwnIds) && showsOwnIds(); }));
    EXPECT_TRUE(showsOwnIds());
}

TEST(QelDebugContextFork, AChildOfAnotherThreadShowsItsOwnIds)
{
    const SettableClock clock;
    ASSERT_TRUE(showsOwnIds());
    bool shown = false;
    std::thread other([&shown] { shown = showsOwnIds() && holdsInChild(showsOwnIds) && showsOwnIds(); });
    other.join();
    EXPECT_TRUE(shown);
    EXPECT_TRUE(showsOwnIds());
}

/// Writes a line. @return how often it asked for the id of the process
unsigned processIdCallsOfALine()
{
    const unsigned before = processIdCalls();
    {
        QelDebugContext(QelLogger::get(), LogLevel::Error) << "text";
    }
    return processIdCalls() - before;
}

TEST(QelDebugContextFork, IdsAreReusedUntilAForkAndReadAgainInParentAndChild)
{
    const SettableClock clock;
    const CapturedLog log;
    processIdCallsOfALine();
    EXPECT_EQ(processIdCallsOfALine(), 0U);
    EXPECT_TRUE(holdsInChild([] { return processIdCallsOfALine() == 1 && processIdCallsOfALine() == 0; }));
    EXPECT_EQ(processIdCallsOfALine(), 1U);
    EXPECT_EQ(processIdCallsOfALine(), 0U);
}

// The locale

TEST_F(QelDebugContextTest, NumbersIgnoreTheGlobalLocale)
{
    const GroupingLocale grouping;
    mClock.advance(seconds(1)); // so that the prefix, too, is composed under that locale
    {
        QelDebugContext line(QelLogger::get(), LogLevel::Error);
        EXPECT_EQ(line.getloc(), std::locale::classic());
        line << 4711 << ' ' << 0.5 << ' ' << decFormat(1234567) << ' ' << hexFormat(0x12345678);
    }
    EXPECT_THAT(mLog.rawLines(),
                ElementsAre("[2026-03-01 17:04:10] " + idsOfThisThread() + "(E): 4711 0.5 1234567 0x12345678"));
}

// Costs and failures

TEST_F(QelDebugContextTest, AShortLineCostsOneAllocation)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    QelDebug::globals().resetLoggers(); // the recording back-end allocates
    {
        QelDebugContext(QelLogger::get(), LogLevel::Error) << "the first line of a thread may cost more";
    }
    const Allocations allocations;
    {
        QelDebugContext(QelLogger::get(), LogLevel::Error) << "bad length = " << hexFormat(0x1F);
    }
    EXPECT_LE(allocations.count(), 1U);
}

TEST_F(QelDebugContextTest, WithoutMemoryTheLineIsEmpty)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    QelDebug::globals().resetLoggers();
    {
        Allocations allocations;
        allocations.failAll();
        QelDebugContext line(QelLogger::get(), LogLevel::Error);
        line << "text";
        allocations.succeedAgain();
        EXPECT_EQ(line.str(), "");
    }
}

TEST_F(QelDebugContextTest, KeepsThePartOfTheLineThatThereIsMemoryFor)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    QelDebug::globals().resetLoggers();
    const std::string text(300, 'x'); // more than a line has room for at first
    {
        Allocations allocations;
        allocations.failAfter(1);
        QelDebugContext line(QelLogger::get(), LogLevel::Error);
        line << text;
        allocations.succeedAgain();
        EXPECT_TRUE(line.bad());
        EXPECT_EQ(line.str(), kExampleText + idsOfThisThread() + "(E): ");
    }
}

TEST(QelDebugContextDeathTest, AnExceptionOfABackendEndsTheProcess)
{
    const CapturedLog log;
    QelLogger::get().addBackend(std::make_shared<ThrowingLogBackend>());
    EXPECT_EXIT(QelDebugContext(QelLogger::get(), LogLevel::Error) << "text", ::testing::KilledBySignal(SIGABRT),
                "back-end");
}

} // namespace
} // namespace qel::test
