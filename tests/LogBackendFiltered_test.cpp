#include <qel/common/LogBackendFiltered.hpp>
#include <qel/common/QelLogger.hpp>

#include "support/CapturedLog.hpp"
#include "support/RecordingLogBackend.hpp"
#include "support/VirtualSlot.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <type_traits>
#include <vector>

namespace qel::test {
namespace {

using ::testing::ElementsAre;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

constexpr LogLevel::Level kAboveRange = static_cast<LogLevel::Level>(5);
constexpr LogLevel::Level kBelowRange = static_cast<LogLevel::Level>(-2);

class CollectingBackend : public LogBackendFiltered {
public:
    using LogBackendFiltered::LogBackendFiltered;

    /// @return the slot of pLog
    static std::size_t slotOfWrite() { return virtualSlot(&CollectingBackend::pLog); }

    std::vector<std::string> mLines;

private:
    void pLog(const std::string& line) override { mLines.push_back(line); }
};

/// Gives the back-end one line of each level and returns the letters of those that passed.
std::string passing(CollectingBackend& backend)
{
    backend.mLines.clear();
    for (int level = LogLevel::Debug; level <= LogLevel::Max; ++level) {
        const LogLevel::Level value = static_cast<LogLevel::Level>(level);
        backend.log(value, std::string(1, LogLevel::getAbbreviatedName(value)));
    }
    std::string letters;
    for (const std::string& line : backend.mLines)
        letters += line;
    return letters;
}

TEST(LogBackendFiltered, IsAbstract)
{
    EXPECT_TRUE(std::is_abstract_v<LogBackend>);
    EXPECT_TRUE(std::is_abstract_v<LogBackendFiltered>);
    EXPECT_TRUE(std::has_virtual_destructor_v<LogBackend>);
}

TEST(LogBackend, VirtualOperationsKeepTheirSlots)
{
    EXPECT_EQ(virtualSlot(&LogBackend::log), 2U) << "after the destructor";
}

TEST(LogBackendFiltered, VirtualOperationsKeepTheirSlots)
{
    EXPECT_EQ(virtualSlot(&LogBackendFiltered::log), 2U);
    EXPECT_EQ(CollectingBackend::slotOfWrite(), 3U);
}

TEST(LogBackendFiltered, PassesWarnAndAboveByDefault)
{
    CollectingBackend backend;
    EXPECT_EQ(backend.getLogLevel(), LogLevel::Warn);
    EXPECT_EQ(passing(backend), "WEC");
}

TEST(LogBackendFiltered, PassesLinesNotBelowItsThreshold)
{
    struct {
        LogLevel::Level threshold;
        const char* passing;
    } const rows[] = {
        {LogLevel::Inherit, "DIWEC"}, {LogLevel::Debug, "DIWEC"}, {LogLevel::Info, "IWEC"},
        {LogLevel::Warn, "WEC"},      {LogLevel::Error, "EC"},    {LogLevel::Critical, "C"},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(LogLevel::getName(row.threshold));
        CollectingBackend constructed(row.threshold);
        EXPECT_EQ(passing(constructed), row.passing);
        CollectingBackend set(LogLevel::Critical);
        set.setLogLevel(row.threshold);
        EXPECT_EQ(set.getLogLevel(), row.threshold);
        EXPECT_EQ(passing(set), row.passing);
    }
}

TEST(LogBackendFiltered, ThresholdInheritPassesALineOfLevelInherit)
{
    CollectingBackend backend(LogLevel::Inherit);
    backend.log(LogLevel::Inherit, "line");
    EXPECT_THAT(backend.mLines, ElementsAre("line"));
}

TEST(LogBackendFiltered, IgnoresAnInvalidThreshold)
{
    CollectingBackend backend(LogLevel::Error);
    backend.setLogLevel(kAboveRange);
    EXPECT_EQ(backend.getLogLevel(), LogLevel::Error);
    backend.setLogLevel(kBelowRange);
    EXPECT_EQ(backend.getLogLevel(), LogLevel::Error);
    EXPECT_EQ(passing(backend), "EC");
}

TEST(LogBackendFiltered, StartsAtWarnWhenBuiltWithAnInvalidThreshold)
{
    EXPECT_EQ(CollectingBackend(kAboveRange).getLogLevel(), LogLevel::Warn);
    EXPECT_EQ(CollectingBackend(kBelowRange).getLogLevel(), LogLevel::Warn);
}

TEST(LogBackendFiltered, PassesTheLineUnchanged)
{
    const std::string line("a\0b\nc", 5);
    CollectingBackend backend;
    backend.log(LogLevel::Warn, line);
    EXPECT_THAT(backend.mLines, ElementsAre(line));
}

TEST(LogBackendFiltered, TheThresholdMayChangeWhileOtherThreadsLog)
{
    const CapturedLog log;
    const auto backend = std::make_shared<CollectingBackend>();
    QelLogger::get().addBackend(backend);
    constexpr int kLines = 500;
    std::thread logging([] {
        for (int i = 0; i < kLines; ++i)
            QelLogger::get().send(LogLevel::Critical, "line");
    });
    for (int i = 0; i < kLines; ++i) {
        backend->setLogLevel(i % 2 == 0 ? LogLevel::Debug : LogLevel::Critical);
        EXPECT_GE(backend->getLogLevel(), LogLevel::Debug);
    }
    logging.join();
    EXPECT_EQ(backend->mLines.size(), static_cast<std::size_t>(kLines)) << "a Critical line passes all the time";
}

TEST(LogBackend, RegistersWithTheRootLogger)
{
    const CapturedLog log;
    const auto backend = std::make_shared<RecordingLogBackend>();
    LogBackend::registerBackend(backend);
    ASSERT_EQ(QelLogger::get().getBackends().size(), 2U);
    EXPECT_EQ(QelLogger::get().getBackends()[1], backend);
    QelLogger::get().send(LogLevel::Debug, "to everybody");
    EXPECT_THAT(backend->lines(), ElementsAre("to everybody"));
}

TEST(LogBackend, RefusesToRegisterNull)
{
    const CapturedLog log;
    EXPECT_THAT([] { LogBackend::registerBackend(nullptr); }, ThrowsMessage<std::invalid_argument>(StrEq("backend")));
    EXPECT_EQ(QelLogger::get().getBackends().size(), 1U);
}

TEST(LogBackend, TheLoggerSharesOwnership)
{
    const CapturedLog log;
    auto backend = std::make_shared<RecordingLogBackend>();
    const std::weak_ptr<RecordingLogBackend> watch = backend;
    LogBackend::registerBackend(std::move(backend));
    EXPECT_FALSE(watch.expired());
}

} // namespace
} // namespace qel::test
