// The private function that writes every log line of the library.
#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "LogLine.hpp"
#include "support/CapturedLog.hpp"
#include "support/RecordingLogBackend.hpp"
#include "support/ThrowingClock.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <ostream>
#include <stdexcept>

namespace qel::test {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

/// Counts how often it is printed.
class PrintCounter {
public:
    unsigned prints() const { return mPrints; }

    friend std::ostream& operator<<(std::ostream& os, const PrintCounter& counter)
    {
        ++counter.mPrints;
        return os << "counter";
    }

private:
    mutable unsigned mPrints = 0;
};

TEST(LogLine, WritesItsPartsAsOneLineOfTheGivenLevel)
{
    const CapturedLog log;
    const auto backend = std::make_shared<RecordingLogBackend>();
    QelLogger::get().addBackend(backend);
    logLine(LogLevel::Error, "bad length = ", hexFormat(0x1FU), ", and ", 31);
    logLine(LogLevel::Debug, "alone");
    EXPECT_THAT(log.lines(), ElementsAre("E: bad length = 0x0000001F, and 1F", "D: alone"));
    ASSERT_EQ(backend->entries().size(), 2U);
    EXPECT_EQ(backend->entries()[0].level, LogLevel::Error);
    EXPECT_EQ(backend->entries()[1].level, LogLevel::Debug);
}

TEST(LogLine, GoesToTheRootLogger)
{
    const CapturedLog log;
    const auto named = std::make_shared<RecordingLogBackend>();
    QelLogger::get("log.line").addBackend(named);
    logLine(LogLevel::Critical, "text");
    EXPECT_THAT(log.lines(), ElementsAre("C: text"));
    EXPECT_THAT(named->lines(), IsEmpty());
}

TEST(LogLine, FormatsNothingBelowTheThreshold)
{
    const CapturedLog log(LogLevel::Warn);
    const PrintCounter counter;
    logLine(LogLevel::Debug, counter);
    logLine(LogLevel::Info, counter);
    EXPECT_EQ(counter.prints(), 0U);
    EXPECT_THAT(log.lines(), IsEmpty());

    logLine(LogLevel::Warn, counter);
    EXPECT_EQ(counter.prints(), 1U);
    EXPECT_THAT(log.lines(), ElementsAre("W: counter"));
}

/// Cannot be printed.
struct Unprintable {
    friend std::ostream& operator<<(std::ostream&, const Unprintable&) { throw std::runtime_error("unprintable"); }
};

TEST(LogLine, APartThatCannotBePrintedEndsTheLine)
{
    const CapturedLog log;
    EXPECT_NO_THROW(logLine(LogLevel::Error, "before ", Unprintable(), " after"));
    EXPECT_THAT(log.lines(), ElementsAre("E: before "));
}

TEST(LogLine, AFailingClockDoesNotReplaceTheExceptionThatTheLineBelongsTo)
{
    const CapturedLog log;
    ThrowingClock clock;
    clock.failAfter(0);
    const char frame[40] = {};
    EXPECT_THAT([&] { QelMessage(frame, sizeof(frame)); },
                ThrowsMessage<QelMessageValidationException>(StrEq("i_buffer bad eyecatcher")));
    ASSERT_EQ(log.lines().size(), 1U);
    EXPECT_THAT(log.lines()[0], ::testing::StartsWith("E: bad eyecatcher = "));
}

} // namespace
} // namespace qel::test
