#include <qel/common/QelDebug.hpp>
#include <qel/common/QelDebugContext.hpp>
#include <qel/common/QelLogger.hpp>

#include "support/CapturedLog.hpp"
#include "support/RecordingLogBackend.hpp"

#include <cstdio>
#include <cstdlib>
#include <dlfcn.h>
#include <functional>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <thread>
#include <type_traits>
#include <unistd.h>
#include <utility>
#include <vector>

namespace qel::test {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

/// Calls a function when it is destroyed.
class FarewellBackend : public LogBackend {
public:
    explicit FarewellBackend(std::function<void()> farewell) : mFarewell(std::move(farewell)) {}
    ~FarewellBackend() override { mFarewell(); }
    void log(LogLevel::Level, const std::string&) override {}

private:
    const std::function<void()> mFarewell;
};

/// Loggers are never removed, so a test uses names of its own if it matters whether they exist.
class QelDebugTest : public ::testing::Test {
protected:
    QelDebugTest() { mDebug.resetLoggers(); }
    ~QelDebugTest() override { mDebug.resetLoggers(); }

    QelDebug& mDebug = QelDebug::globals();
};

TEST_F(QelDebugTest, AProcessHasOne)
{
    EXPECT_EQ(&QelDebug::globals(), &QelDebug::globals());
    EXPECT_FALSE(std::is_default_constructible_v<QelDebug>);
    EXPECT_FALSE(std::is_copy_constructible_v<QelDebug>);
    EXPECT_FALSE(std::is_copy_assignable_v<QelDebug>);
    EXPECT_FALSE(std::is_destructible_v<QelDebug>) << "only process exit destroys it";
}

TEST_F(QelDebugTest, ALoadedModuleFindsTheSameLoggers)
{
    void* const module = ::dlopen(QEL_LOGGER_MODULE, RTLD_NOW | RTLD_LOCAL);
    ASSERT_NE(module, nullptr) << ::dlerror();
    const auto root = reinterpret_cast<QelLogger* (*)()>(::dlsym(module, "rootLoggerOfModule"));
    const auto named = reinterpret_cast<QelLogger* (*)(const char*)>(::dlsym(module, "namedLoggerOfModule"));
    const auto registry = reinterpret_cast<QelDebug* (*)()>(::dlsym(module, "registryOfModule"));
    ASSERT_NE(root, nullptr);
    ASSERT_NE(named, nullptr);
    ASSERT_NE(registry, nullptr);
    EXPECT_EQ(root(), &QelLogger::get());
    EXPECT_EQ(registry(), &mDebug);
    QelLogger* const ofModule = named("of.module");
    EXPECT_EQ(ofModule, mDebug.tryGetLogger("of.module"));
    EXPECT_EQ(::dlclose(module), 0);
    EXPECT_EQ(mDebug.tryGetLogger("of.module"), ofModule) << "it outlives the module";
}

TEST_F(QelDebugTest, CreatesALoggerWithItsAncestors)
{
    QelLogger& logger = mDebug.getLogger("create.b.c");
    EXPECT_EQ(mDebug.tryGetLogger("create.b.c"), &logger);
    ASSERT_NE(mDebug.tryGetLogger("create.b"), nullptr);
    ASSERT_NE(mDebug.tryGetLogger("create"), nullptr);
    EXPECT_EQ(mDebug.tryGetLogger("create.b")->getName(), "create.b");
    EXPECT_EQ(mDebug.tryGetLogger("create")->getName(), "create");
    EXPECT_EQ(mDebug.tryGetLogger("b"), nullptr);
    EXPECT_EQ(mDebug.tryGetLogger("c"), nullptr);
    EXPECT_EQ(mDebug.tryGetLogger("b.c"), nullptr);
}

TEST_F(QelDebugTest, TheParentIsTheNameBeforeTheLastDot)
{
    QelLogger& logger = mDebug.getLogger("parents.b.c");
    const auto backend = std::make_shared<RecordingLogBackend>();
    mDebug.getLogger("parents.b").addBackend(backend);
    mDebug.getLogger("parents").addBackend(backend);
    mDebug.getLogger().addBackend(backend);
    logger.send(LogLevel::Error, "line");
    EXPECT_EQ(backend->lines().size(), 3U);
    mDebug.getLogger("parents").propagate(false);
    logger.send(LogLevel::Error, "line");
    EXPECT_EQ(backend->lines().size(), 5U);
    mDebug.getLogger("parents.b").propagate(false);
    logger.send(LogLevel::Error, "line");
    EXPECT_EQ(backend->lines().size(), 6U);
}

TEST_F(QelDebugTest, CreatesALoggerOnce)
{
    QelLogger& logger = mDebug.getLogger("once.b");
    EXPECT_EQ(&mDebug.getLogger("once.b"), &logger);
    QelLogger& parent = *mDebug.tryGetLogger("once");
    mDebug.getLogger("once.c");
    EXPECT_EQ(mDebug.tryGetLogger("once"), &parent);
    for (int i = 0; i < 100; ++i)
        mDebug.getLogger("once.n" + std::to_string(i));
    EXPECT_EQ(mDebug.tryGetLogger("once.b"), &logger) << "addresses do not change";
}

TEST_F(QelDebugTest, TryGetLoggerCreatesNothing)
{
    EXPECT_EQ(mDebug.tryGetLogger("never.b"), nullptr);
    EXPECT_EQ(mDebug.tryGetLogger("never.b"), nullptr);
    EXPECT_EQ(mDebug.tryGetLogger("never"), nullptr);
}

TEST_F(QelDebugTest, TheEmptyNameIsALoggerBelowTheRoot)
{
    QelLogger& empty = mDebug.getLogger("");
    EXPECT_NE(&empty, &mDebug.getLogger());
    EXPECT_EQ(empty.getName(), "");
    EXPECT_FALSE(empty.isRoot());
    EXPECT_EQ(mDebug.tryGetLogger(""), &empty);
    const CapturedLog log;
    QelDebugContext(empty, LogLevel::Error) << "text";
    EXPECT_THAT(log.lines(), ElementsAre("E: [] text"));
}

TEST_F(QelDebugTest, EveryDotSeparates)
{
    struct {
        const char* name;
        std::vector<const char*> ancestors; // from the nearest up
    } const rows[] = {
        {".dot", {""}}, {"dot.", {"dot"}}, {"dot2..b", {"dot2.", "dot2"}}, {".", {""}}, {"..", {".", ""}},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.name);
        mDebug.resetLoggers();
        QelLogger& logger = mDebug.getLogger(row.name);
        EXPECT_EQ(logger.getName(), row.name);
        const auto backend = std::make_shared<RecordingLogBackend>();
        mDebug.getLogger().addBackend(backend);
        for (const char* ancestor : row.ancestors) {
            ASSERT_NE(mDebug.tryGetLogger(ancestor), nullptr) << ancestor;
            mDebug.tryGetLogger(ancestor)->addBackend(backend);
        }
        logger.send(LogLevel::Error, "line");
        EXPECT_EQ(backend->lines().size(), row.ancestors.size() + 1);
        mDebug.tryGetLogger(row.ancestors.front())->propagate(false);
        backend->clear();
        logger.send(LogLevel::Error, "line");
        EXPECT_EQ(backend->lines().size(), 1U) << "the first ancestor is the parent";
    }
}

TEST_F(QelDebugTest, ResetReturnsEveryLoggerToItsInitialState)
{
    QelLogger& root = mDebug.getLogger();
    QelLogger& logger = mDebug.getLogger("reset.b");
    const auto backend = std::make_shared<RecordingLogBackend>();
    root.setLevel(LogLevel::Debug).addBackend(backend);
    logger.setLevel(LogLevel::Critical).propagate(false).addBackend(backend);

    mDebug.resetLoggers();
    EXPECT_THAT(root.getBackends(), IsEmpty());
    EXPECT_THAT(logger.getBackends(), IsEmpty());
    EXPECT_EQ(root.getEffectiveLevel(), LogLevel::Warn);
    EXPECT_EQ(logger.getEffectiveLevel(), LogLevel::Warn);
    root.setLevel(LogLevel::Info).addBackend(backend);
    EXPECT_EQ(logger.getEffectiveLevel(), LogLevel::Info) << "it inherits again";
    logger.send(LogLevel::Error, "line");
    EXPECT_THAT(backend->lines(), ElementsAre("line")) << "it propagates again, and the root only once";
    EXPECT_EQ(mDebug.tryGetLogger("reset.b"), &logger) << "loggers are never removed";
}

TEST_F(QelDebugTest, ResetDestroysBackendsOutsideTheLock)
{
    std::vector<std::string> farewells;
    const auto farewell = [&farewells](const char* text) {
        QelLogger::get("farewell.new").send(LogLevel::Error, "dropped");
        QelDebugContext(QelLogger::get(), LogLevel::Error) << "nor here";
        farewells.emplace_back(text);
    };
    mDebug.getLogger().addBackend(std::make_shared<FarewellBackend>([&] { farewell("root"); }));
    mDebug.getLogger("farewell").addBackend(std::make_shared<FarewellBackend>([&] { farewell("named"); }));
    mDebug.resetLoggers();
    EXPECT_THAT(farewells, ::testing::UnorderedElementsAre("root", "named")) << "before the reset returns";
    EXPECT_NE(mDebug.tryGetLogger("farewell.new"), nullptr);
}

TEST_F(QelDebugTest, ABackendWithAnotherOwnerSurvivesTheReset)
{
    bool gone = false;
    auto backend = std::make_shared<FarewellBackend>([&gone] { gone = true; });
    mDebug.getLogger().addBackend(backend);
    mDebug.resetLoggers();
    EXPECT_FALSE(gone);
    backend.reset();
    EXPECT_TRUE(gone);
}

TEST_F(QelDebugTest, ManyThreadsCreateEachLoggerOnce)
{
    constexpr int kThreads = 4;
    constexpr int kNames = 50;
    std::vector<std::vector<QelLogger*>> found(kThreads);
    std::vector<std::thread> threads;
    for (std::vector<QelLogger*>& loggers : found) {
        threads.emplace_back([&loggers] {
            for (int i = 0; i < kNames; ++i)
                loggers.push_back(&QelLogger::get("race.n" + std::to_string(i)));
        });
    }
    for (std::thread& thread : threads)
        thread.join();
    for (const std::vector<QelLogger*>& loggers : found)
        EXPECT_EQ(loggers, found[0]);
}

// Creation and destruction of the registry can only be observed in a process of its own.

using QelDebugDeathTest = QelDebugTest;

TEST_F(QelDebugDeathTest, ManyThreadsMayMakeTheFirstUse)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe"); // a fresh process, in which no logger exists yet
    const auto race = [] {
        constexpr int kThreads = 8;
        std::vector<QelLogger*> roots(kThreads);
        std::vector<std::thread> threads;
        for (QelLogger*& root : roots)
            threads.emplace_back([&root] { root = &QelLogger::get(); });
        for (std::thread& thread : threads)
            thread.join();
        bool same = true;
        for (const QelLogger* root : roots)
            same = same && root == &QelDebug::globals().getLogger();
        std::exit(same ? 0 : 1);
    };
    EXPECT_EXIT(race(), ::testing::ExitedWithCode(0), "");
}

TEST_F(QelDebugDeathTest, ExitDestroysTheBackendsBeforeTheLoggers)
{
    const auto exitWithBackend = [] {
        QelLogger::get("exit"); // found again below; the address sanitizer checks
        QelLogger::get().addBackend(std::make_shared<FarewellBackend>([] {
            QelLogger::get("exit.new").send(LogLevel::Error, "dropped");
            QelDebugContext(QelLogger::get("exit"), LogLevel::Error) << "nor here";
            std::fputs("farewell\n", stderr);
        }));
        std::exit(0);
    };
    EXPECT_EXIT(exitWithBackend(), ::testing::ExitedWithCode(0), "farewell");
}

} // namespace
} // namespace qel::test
