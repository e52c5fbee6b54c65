#include <qel/common/QelDebug.hpp>
#include <qel/common/QelDebugContext.hpp>
#include <qel/common/QelLogger.hpp>

#include "support/Allocations.hpp"
#include "support/RecordingLogBackend.hpp"
#include "support/ThrowingLogBackend.hpp"

#include <atomic>
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
using ::testing::IsEmpty;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

constexpr LogLevel::Level kAboveRange = static_cast<LogLevel::Level>(5);
constexpr LogLevel::Level kBelowRange = static_cast<LogLevel::Level>(-2);

/// Writes "<name>:<line>" to a list that several back-ends share, so that their order shows.
class OrderBackend : public LogBackend {
public:
    OrderBackend(std::string name, std::vector<std::string>& order) : mName(std::move(name)), mOrder(order) {}
    void log(LogLevel::Level, const std::string& line) override { mOrder.push_back(mName + ":" + line); }

private:
    const std::string mName;
    std::vector<std::string>& mOrder;
};

/// Every test starts and ends with loggers in their initial state. Loggers cannot be removed, so tests that need fresh
/// ones use names of their own.
class QelLoggerTest : public ::testing::Test {
protected:
    QelLoggerTest() { QelDebug::globals().resetLoggers(); }
    ~QelLoggerTest() override { QelDebug::globals().resetLoggers(); }

    std::shared_ptr<OrderBackend> order(const std::string& name)
    {
        return std::make_shared<OrderBackend>(name, mOrder);
    }

    std::vector<std::string> mOrder;
};

TEST_F(QelLoggerTest, TheRootIsAlwaysTheSame)
{
    EXPECT_EQ(&QelLogger::get(), &QelDebug::globals().getLogger());
    EXPECT_EQ(&QelLogger::get(), &QelLogger::get());
}

TEST_F(QelLoggerTest, ANamedLoggerIsThatOfTheRegistry)
{
    EXPECT_EQ(&QelLogger::get("named"), &QelDebug::globals().getLogger("named"));
    EXPECT_NE(&QelLogger::get("named"), &QelLogger::get());
}

TEST_F(QelLoggerTest, KnowsItsNameAndWhetherItIsTheRoot)
{
    EXPECT_EQ(QelLogger::get().getName(), "");
    EXPECT_TRUE(QelLogger::get().isRoot());
    EXPECT_EQ(QelLogger::get("a.b.c").getName(), "a.b.c");
    EXPECT_FALSE(QelLogger::get("a.b.c").isRoot());
}

TEST_F(QelLoggerTest, OnlyTheRegistryConstructsLoggers)
{
    EXPECT_FALSE(std::is_default_constructible_v<QelLogger::CtorPasskey>);
    EXPECT_FALSE(std::is_aggregate_v<QelLogger::CtorPasskey>) << "{} would initialise an aggregate";
    EXPECT_FALSE(std::is_copy_constructible_v<QelLogger>);
    EXPECT_FALSE(std::is_move_constructible_v<QelLogger>);
    EXPECT_FALSE(std::is_copy_assignable_v<QelLogger>);
}

TEST_F(QelLoggerTest, TheRootStartsAtWarn)
{
    const QelLogger& root = QelLogger::get();
    EXPECT_EQ(root.getEffectiveLevel(), LogLevel::Warn);
    EXPECT_FALSE(root.isLevelEnabled(LogLevel::Debug));
    EXPECT_FALSE(root.isLevelEnabled(LogLevel::Info));
    EXPECT_TRUE(root.isLevelEnabled(LogLevel::Warn));
    EXPECT_TRUE(root.isLevelEnabled(LogLevel::Error));
    EXPECT_TRUE(root.isLevelEnabled(LogLevel::Critical));
}

TEST_F(QelLoggerTest, EachLevelEnablesItselfAndHigherOnes)
{
    QelLogger& root = QelLogger::get();
    for (int threshold = LogLevel::Debug; threshold <= LogLevel::Max; ++threshold) {
        root.setLevel(static_cast<LogLevel::Level>(threshold));
        for (int level = LogLevel::Debug; level <= LogLevel::Max; ++level) {
            SCOPED_TRACE(std::to_string(threshold) + " " + std::to_string(level));
            EXPECT_EQ(root.isLevelEnabled(static_cast<LogLevel::Level>(level)), level >= threshold);
        }
    }
}

TEST_F(QelLoggerTest, TheEffectiveLevelFollowsTheNearestAncestorThatHasOne)
{
    QelLogger& child = QelLogger::get("x.y");
    QelLogger& parent = QelLogger::get("x");
    EXPECT_EQ(child.getEffectiveLevel(), LogLevel::Warn);
    QelLogger::get().setLevel(LogLevel::Debug);
    EXPECT_EQ(child.getEffectiveLevel(), LogLevel::Debug);
    EXPECT_TRUE(child.isLevelEnabled(LogLevel::Debug));
    parent.setLevel(LogLevel::Error);
    EXPECT_EQ(child.getEffectiveLevel(), LogLevel::Error);
    EXPECT_FALSE(child.isLevelEnabled(LogLevel::Warn));
    child.setLevel(LogLevel::Info);
    EXPECT_EQ(child.getEffectiveLevel(), LogLevel::Info);
    EXPECT_EQ(parent.getEffectiveLevel(), LogLevel::Error);
    child.setLevel(LogLevel::Inherit);
    EXPECT_EQ(child.getEffectiveLevel(), LogLevel::Error);
    parent.setLevel(LogLevel::Inherit);
    EXPECT_EQ(child.getEffectiveLevel(), LogLevel::Debug);
}

TEST_F(QelLoggerTest, InheritOnTheRootMeansWarn)
{
    QelLogger& root = QelLogger::get();
    root.setLevel(LogLevel::Inherit);
    EXPECT_EQ(root.getEffectiveLevel(), LogLevel::Warn);
    root.setLevel(LogLevel::Critical);
    root.setLevel(LogLevel::Inherit);
    EXPECT_EQ(root.getEffectiveLevel(), LogLevel::Warn);
}

TEST_F(QelLoggerTest, InvalidLevelsAreIgnored)
{
    QelLogger& root = QelLogger::get();
    root.setLevel(LogLevel::Error);
    root.setLevel(kAboveRange);
    root.setLevel(kBelowRange);
    EXPECT_EQ(root.getEffectiveLevel(), LogLevel::Error);
    QelLogger& named = QelLogger::get("x");
    named.setLevel(LogLevel::Info).setLevel(kAboveRange).setLevel(kBelowRange);
    EXPECT_EQ(named.getEffectiveLevel(), LogLevel::Info);
}

TEST_F(QelLoggerTest, SettersReturnTheLogger)
{
    QelLogger& logger = QelLogger::get("x");
    EXPECT_EQ(&logger.setLevel(LogLevel::Info), &logger);
    EXPECT_EQ(&logger.setLevel(kAboveRange), &logger);
    EXPECT_EQ(&logger.propagate(false), &logger);
    EXPECT_EQ(&QelLogger::get().propagate(true), &QelLogger::get());
}

TEST_F(QelLoggerTest, ADisabledCallAllocatesNothing)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    QelLogger& root = QelLogger::get();
    const Allocations allocations;
    EXPECT_FALSE(root.isLevelEnabled(LogLevel::Info));
    EXPECT_EQ(allocations.count(), 0U);
}

TEST_F(QelLoggerTest, ListsBackendsInTheOrderOfRegistration)
{
    QelLogger& logger = QelLogger::get("x");
    EXPECT_THAT(logger.getBackends(), IsEmpty());
    const auto first = order("first");
    const auto second = order("second");
    logger.addBackend(first);
    logger.addBackend(second);
    logger.addBackend(first);
    EXPECT_THAT(logger.getBackends(), ElementsAre(first, second, first));
    EXPECT_THAT(QelLogger::get().getBackends(), IsEmpty());
}

TEST_F(QelLoggerTest, TheListOfBackendsIsACopy)
{
    QelLogger& root = QelLogger::get();
    root.addBackend(order("first"));
    const std::vector<std::shared_ptr<const LogBackend>> before = root.getBackends();
    root.addBackend(order("second"));
    EXPECT_EQ(before.size(), 1U);
}

TEST_F(QelLoggerTest, RefusesANullBackend)
{
    EXPECT_THAT([] { QelLogger::get().addBackend(nullptr); }, ThrowsMessage<std::invalid_argument>(StrEq("backend")));
    EXPECT_THAT(QelLogger::get().getBackends(), IsEmpty());
}

TEST_F(QelLoggerTest, ALineReachesTheBackendsInOrderOncePerRegistration)
{
    QelLogger& root = QelLogger::get();
    const auto first = order("first");
    root.addBackend(first);
    root.addBackend(order("second"));
    root.addBackend(first);
    root.send(LogLevel::Error, "line");
    EXPECT_THAT(mOrder, ElementsAre("first:line", "second:line", "first:line"));
}

TEST_F(QelLoggerTest, BackendsReceiveTheLevelOfTheLine)
{
    const auto backend = std::make_shared<RecordingLogBackend>();
    QelLogger::get().addBackend(backend);
    QelLogger::get().send(LogLevel::Critical, "grave");
    QelLogger::get("x").send(LogLevel::Debug, "light");
    const std::vector<RecordingLogBackend::Entry> entries = backend->entries();
    ASSERT_EQ(entries.size(), 2U);
    EXPECT_EQ(entries[0].level, LogLevel::Critical);
    EXPECT_EQ(entries[0].line, "grave");
    EXPECT_EQ(entries[1].level, LogLevel::Debug);
    EXPECT_EQ(entries[1].line, "light");
}

TEST_F(QelLoggerTest, ALinePropagatesToTheRoot)
{
    QelLogger::get().addBackend(order("root"));
    QelLogger::get("x").addBackend(order("x"));
    QelLogger::get("x.y").addBackend(order("x.y"));
    QelLogger::get("x.z").addBackend(order("x.z"));
    QelLogger::get("x.y").send(LogLevel::Error, "line");
    EXPECT_THAT(mOrder, ElementsAre("x.y:line", "x:line", "root:line"));
}

TEST_F(QelLoggerTest, ALineStopsAtALoggerWithoutPropagation)
{
    QelLogger::get().addBackend(order("root"));
    QelLogger::get("x").addBackend(order("x"));
    QelLogger::get("x.y").addBackend(order("x.y"));
    QelLogger::get("x").propagate(false);
    QelLogger::get("x.y").send(LogLevel::Error, "1");
    EXPECT_THAT(mOrder, ElementsAre("x.y:1", "x:1"));
    mOrder.clear();
    QelLogger::get("x.y").propagate(false);
    QelLogger::get("x.y").send(LogLevel::Error, "2");
    EXPECT_THAT(mOrder, ElementsAre("x.y:2"));
    mOrder.clear();
    QelLogger::get("x.y").propagate(true);
    QelLogger::get("x").propagate(true);
    QelLogger::get("x.y").send(LogLevel::Error, "3");
    EXPECT_THAT(mOrder, ElementsAre("x.y:3", "x:3", "root:3"));
}

TEST_F(QelLoggerTest, PropagationOfTheRootIsIgnored)
{
    QelLogger::get().addBackend(order("root"));
    QelLogger::get().propagate(true);
    QelLogger::get().send(LogLevel::Error, "line");
    EXPECT_THAT(mOrder, ElementsAre("root:line"));
}

TEST_F(QelLoggerTest, SendIgnoresTheThresholdsOfLoggers)
{
    QelLogger::get().setLevel(LogLevel::Critical).addBackend(order("root"));
    QelLogger::get("x").setLevel(LogLevel::Critical).addBackend(order("x"));
    QelLogger::get("x").send(LogLevel::Debug, "line");
    EXPECT_THAT(mOrder, ElementsAre("x:line", "root:line"));
}

TEST_F(QelLoggerTest, WithoutBackendsALineIsDropped)
{
    QelLogger::get("x.y").send(LogLevel::Critical, "line");
    SUCCEED();
}

TEST_F(QelLoggerTest, AnExceptionOfABackendPassesThroughSendAndLeavesTheLoggersUsable)
{
    QelLogger::get().addBackend(std::make_shared<ThrowingLogBackend>());
    QelLogger::get().addBackend(order("after"));
    EXPECT_THAT([] { QelLogger::get().send(LogLevel::Error, "line"); },
                ThrowsMessage<std::runtime_error>(StrEq("back-end")));
    EXPECT_THAT(mOrder, IsEmpty()) << "the back-ends after it do not get the line";
    QelDebug::globals().resetLoggers();
    QelLogger::get().addBackend(order("next"));
    QelLogger::get().send(LogLevel::Error, "line");
    EXPECT_THAT(mOrder, ElementsAre("next:line")) << "the lock is free again";
}

TEST_F(QelLoggerTest, LinesOfAllThreadsReachEveryBackendWholeAndInTheSameOrder)
{
    const auto first = std::make_shared<RecordingLogBackend>();
    const auto second = std::make_shared<RecordingLogBackend>();
    QelLogger::get().addBackend(first);
    QelLogger::get("threads").addBackend(second);

    constexpr int kThreads = 4;
    constexpr int kLines = 100;
    std::vector<std::thread> threads;
    for (int number = 0; number < kThreads; ++number) {
        threads.emplace_back([number] {
            QelLogger& logger = QelLogger::get("threads.t" + std::to_string(number));
            const std::string text(200, static_cast<char>('a' + number));
            for (int i = 0; i < kLines; ++i)
                QelDebugContext(logger, LogLevel::Error) << text << i << '!';
        });
    }
    for (std::thread& thread : threads)
        thread.join();

    const std::vector<std::string> lines = first->lines();
    EXPECT_EQ(lines, second->lines());
    ASSERT_EQ(lines.size(), static_cast<std::size_t>(kThreads * kLines));
    int next[kThreads] = {};
    for (const std::string& line : lines) {
        const std::size_t start = line.find("[threads.t");
        ASSERT_NE(start, std::string::npos) << line;
        const int number = line.at(start + 10) - '0';
        ASSERT_GE(number, 0);
        ASSERT_LT(number, kThreads);
        const std::string text(200, static_cast<char>('a' + number));
        EXPECT_EQ(line.substr(start + 13), text + std::to_string(next[number]) + "!");
        ++next[number];
    }
}

/// Detects a second thread that enters while the first is still inside.
class ExclusiveBackend : public LogBackend {
public:
    void log(LogLevel::Level, const std::string&) override
    {
        if (mInside.exchange(true)) mOverlapped = true;
        std::this_thread::yield(); // lets other threads run
        mInside = false;
    }
    bool overlapped() const { return mOverlapped; }

private:
    std::atomic<bool> mInside{false};
    std::atomic<bool> mOverlapped{false};
};

TEST_F(QelLoggerTest, OneThreadAtATimeEntersABackend)
{
    const auto backend = std::make_shared<ExclusiveBackend>();
    QelLogger::get("exclusive").addBackend(backend);
    QelLogger::get("exclusive.child").addBackend(backend);
    std::vector<std::thread> threads;
    for (const char* name : {"exclusive", "exclusive", "exclusive.child", "exclusive.child"}) {
        threads.emplace_back([name] {
            QelLogger& logger = QelLogger::get(name);
            for (int i = 0; i < 500; ++i)
                logger.send(LogLevel::Error, "line");
        });
    }
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_FALSE(backend->overlapped());
}

/// Tests and sets levels while it receives a line, that is with the lock of the registry held.
class LevelChangingBackend : public LogBackend {
public:
    void log(LogLevel::Level, const std::string&) override
    {
        QelLogger& root = QelLogger::get();
        mWasEnabled = root.isLevelEnabled(LogLevel::Debug);
        root.setLevel(LogLevel::Debug).propagate(true);
        mIsEnabled = root.isLevelEnabled(LogLevel::Debug);
    }
    bool mWasEnabled = true;
    bool mIsEnabled = false;
};

TEST_F(QelLoggerTest, TestsAndSetsLevelsWithoutTheLock)
{
    const auto backend = std::make_shared<LevelChangingBackend>();
    QelLogger::get().addBackend(backend);
    QelLogger::get().send(LogLevel::Error, "line"); // returns: no deadlock
    EXPECT_FALSE(backend->mWasEnabled);
    EXPECT_TRUE(backend->mIsEnabled);
}

TEST_F(QelLoggerTest, EverythingMayChangeWhileOtherThreadsLog)
{
    std::atomic<bool> stop{false};
    std::atomic<int> running{0};
    std::vector<std::thread> threads;
    for (int number = 0; number < 2; ++number) {
        threads.emplace_back([&stop, &running, number] {
            QelLogger& logger = QelLogger::get(number == 0 ? "busy" : "busy.child");
            ++running;
            while (!stop) {
                if (logger.isLevelEnabled(LogLevel::Warn)) QelDebugContext(logger, LogLevel::Warn) << "line";
            }
        });
    }
    while (running < 2)
        std::this_thread::yield();
    const auto backend = std::make_shared<RecordingLogBackend>();
    for (int i = 0; i < 100; ++i) {
        QelLogger::get("busy").setLevel(i % 2 == 0 ? LogLevel::Debug : LogLevel::Critical).propagate(i % 3 == 0);
        QelLogger::get("busy.child").addBackend(backend);
        QelLogger::get().addBackend(backend);
        EXPECT_EQ(QelLogger::get("busy.child").getBackends().size(), 1U);
        EXPECT_NE(QelDebug::globals().tryGetLogger("busy"), nullptr);
        QelLogger::get("busy.n" + std::to_string(i));
        QelDebug::globals().resetLoggers();
    }
    stop = true;
    for (std::thread& thread : threads)
        thread.join();
}

} // namespace
} // namespace qel::test
