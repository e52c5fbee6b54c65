#include <qel/common/QelMessage.hpp>

#include "support/Bytes.hpp"
#include "support/CallerIdScope.hpp"
#include "support/MessageProbe.hpp"
#include "support/RawFrame.hpp"

#include <algorithm>
#include <array>
#include <atomic>
#include <csignal>
#include <cstddef>
#include <cstdlib>
#include <gtest/gtest.h>
#include <memory>
#include <thread>
#include <vector>

#if defined(__x86_64__)
#include <x86intrin.h>
#endif

#if defined(__SANITIZE_THREAD__)
#define QEL_TEST_THREAD_SANITIZER
#elif defined(__has_feature)
#if __has_feature(thread_sanitizer)
#define QEL_TEST_THREAD_SANITIZER
#endif
#endif

namespace qel {
namespace {

using test::CallerIdScope;
using test::MessageProbe;
using test::RawFrame;

// Other tests draw ids in this process: the death test runs this one alone in a new process.
TEST(QelMessageCallerIdDeathTest, FirstOfAProcessIsTwo)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(
        {
            const bool right = QelMessage::generateNextUint32() == 2 && QelMessage::generateNextUint32() == 3;
            std::exit(right ? 42 : 1);
        },
        testing::ExitedWithCode(42), "");
}

TEST(QelMessageCallerId, IncrementsByOne)
{
    CallerIdScope scope(100);
    EXPECT_EQ(QelMessage::generateNextUint32(), 101U);
    EXPECT_EQ(QelMessage::generateNextUint32(), 102U);
}

TEST(QelMessageCallerId, WrapsToZero)
{
    CallerIdScope scope(0xFFFFFFFE);
    EXPECT_EQ(QelMessage::generateNextUint32(), 0xFFFFFFFFU);
    EXPECT_EQ(QelMessage::generateNextUint32(), 0U);
    EXPECT_EQ(QelMessage::generateNextUint32(), 1U);
}

TEST(QelMessageCallerId, IsNotDrawnByPlainMessages)
{
    CallerIdScope scope(100);
    QelMessage empty;
    QelMessage built(5, 0x6003, 0x0101, MsgResponseExpected);
    MessageProbe received(RawFrame::newForm().callerId(6).bytes());
    QelMessage copy(received);
    empty = copy;
    const std::unique_ptr<QelMessage> clone = copy.clone();
    received.pAllocData(10);
    EXPECT_EQ(scope.last(), 100U);
    EXPECT_EQ(built.getCallerId(), 5U);
    EXPECT_EQ(clone->getCallerId(), 6U);
}

TEST(QelMessageCallerId, IsUniqueAcrossThreads)
{
    static_assert(std::atomic<unsigned int>::is_always_lock_free, "ids are drawn without a lock");
    constexpr unsigned int kThreads = 4;
    constexpr unsigned int kIds = 2000;
    CallerIdScope scope(1000);
    std::vector<std::vector<unsigned int>> drawn(kThreads);
    std::vector<std::thread> threads;
    for (std::vector<unsigned int>& ids : drawn) {
        threads.emplace_back([&ids] {
            for (unsigned int i = 0; i < kIds; ++i)
                ids.push_back(QelMessage::generateNextUint32());
        });
    }
    for (std::thread& thread : threads)
        thread.join();

    std::vector<unsigned int> all;
    for (const std::vector<unsigned int>& ids : drawn) {
        EXPECT_TRUE(std::is_sorted(ids.begin(), ids.end()));
        all.insert(all.end(), ids.begin(), ids.end());
    }
    std::sort(all.begin(), all.end());
    ASSERT_EQ(all.size(), kThreads * kIds);
    for (unsigned int i = 0; i < all.size(); ++i)
        ASSERT_EQ(all[i], 1001 + i);
}

#if defined(__x86_64__) && !defined(QEL_TEST_THREAD_SANITIZER)

// The processor traps after every instruction of a draw, and the trap handler draws an id. This tests every point at
// which another thread could draw, independent of the scheduler. Not under the thread sanitizer, whose runtime must not
// be interrupted.

struct Interruptions {
    std::array<unsigned int, 1000> ids;
    std::size_t count;
};
Interruptions interruptions;

extern "C" void drawInATrap(int)
{
    if (interruptions.count < interruptions.ids.size()) {
        interruptions.ids[interruptions.count++] = QelMessage::generateNextUint32();
    }
}

TEST(QelMessageCallerId, IsUniqueWhenOtherDrawsInterruptEveryInstruction)
{
    constexpr unsigned long long kTrapFlag = 0x100;
    CallerIdScope scope(1000);
    QelMessage::generateNextUint32(); // the first call also binds the function, which must not be interrupted
    interruptions.count = 0;
    struct sigaction previous = {};
    struct sigaction action = {};
    action.sa_handler = &drawInATrap;
    ASSERT_EQ(::sigaction(SIGTRAP, &action, &previous), 0);

    __writeeflags(__readeflags() | kTrapFlag);
    const unsigned int interrupted = QelMessage::generateNextUint32();
    __writeeflags(__readeflags() & ~kTrapFlag);

    ASSERT_EQ(::sigaction(SIGTRAP, &previous, nullptr), 0);
    if (interruptions.count == 0) GTEST_SKIP() << "this machine does not trap";
    std::vector<unsigned int> all(interruptions.ids.begin(), interruptions.ids.begin() + interruptions.count);
    EXPECT_LT(all.size(), interruptions.ids.size());
    all.push_back(interrupted);
    std::sort(all.begin(), all.end());
    for (unsigned int i = 0; i < all.size(); ++i)
        EXPECT_EQ(all[i], 1002 + i);
    EXPECT_EQ(scope.last(), all.back());
}

#endif

} // namespace
} // namespace qel
