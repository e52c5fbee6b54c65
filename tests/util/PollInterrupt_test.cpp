#include <qel/common/LogLevel.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/common/util/PosixError.hpp>

#include "support/CapturedLog.hpp"
#include "support/Loopback.hpp"
#include "support/SystemCalls.hpp"
#include "util/PollKit.hpp"

#include <cerrno>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <sys/eventfd.h>
#include <thread>
#include <type_traits>
#include <vector>

namespace qel {
namespace {

using test::CapturedLog;
using test::NoMoreDescriptors;
using test::Pipe;
using test::print;
using test::SystemCalls;
using test::ThrowsPosixError;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

static_assert(!std::is_copy_constructible<PollInterrupt>::value && !std::is_copy_assignable<PollInterrupt>::value, "");

bool isPending(const PollInterrupt& interrupt)
{
    return PollSet(interrupt.getPollFd()).poll().contains(interrupt.getPollFd());
}

TEST(PollInterrupt, IsIdleAfterConstruction)
{
    const PollInterrupt interrupt;
    EXPECT_GE(interrupt.getPollFd().mFd.fd, 0);
    EXPECT_EQ(interrupt.getPollFd().mFd.events, 0x39);
    EXPECT_FALSE(isPending(interrupt));
}

TEST(PollInterrupt, IsPendingFromInterruptToEoi)
{
    PollInterrupt interrupt;
    interrupt.interrupt();
    EXPECT_TRUE(isPending(interrupt));
    EXPECT_TRUE(isPending(interrupt)) << "polling does not consume it";
    interrupt.eoi();
    EXPECT_FALSE(isPending(interrupt));
    interrupt.interrupt();
    EXPECT_TRUE(isPending(interrupt));
}

TEST(PollInterrupt, EachInterruptAddsOne)
{
    PollInterrupt interrupt;
    const int fd = interrupt.getPollFd().mFd.fd;
    eventfd_t count = 0;
    interrupt.interrupt();
    ASSERT_EQ(::eventfd_read(fd, &count), 0);
    EXPECT_EQ(count, 1U);
    interrupt.interrupt();
    interrupt.interrupt();
    ASSERT_EQ(::eventfd_read(fd, &count), 0);
    EXPECT_EQ(count, 2U);
}

TEST(PollInterrupt, OneEoiConsumesAnyNumberOfInterrupts)
{
    PollInterrupt interrupt;
    interrupt.interrupt();
    interrupt.interrupt();
    interrupt.interrupt();
    interrupt.eoi();
    EXPECT_FALSE(isPending(interrupt));
}

TEST(PollInterrupt, EoiWithNothingPendingDoesNothing)
{
    CapturedLog log(LogLevel::Info);
    PollInterrupt interrupt;
    interrupt.eoi();
    interrupt.eoi();
    EXPECT_FALSE(isPending(interrupt));
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(PollInterrupt, IgnoresAFullCounter)
{
    CapturedLog log(LogLevel::Info);
    PollInterrupt interrupt;
    ASSERT_EQ(::eventfd_write(interrupt.getPollFd().mFd.fd, 0xFFFFFFFFFFFFFFFE), 0);
    interrupt.interrupt();
    EXPECT_TRUE(isPending(interrupt));
    EXPECT_THAT(log.lines(), IsEmpty());
    interrupt.eoi();
    EXPECT_FALSE(isPending(interrupt));
}

TEST(PollInterrupt, WakesAWaitingThread)
{
    const Pipe pipe;
    PollInterrupt interrupt;
    std::thread waker([&] { interrupt.interrupt(); });
    const PollResult result = (PollSet(PollFd(pipe.reader(), PollEvents::Read)) + interrupt.getPollFd()).wait();
    waker.join();
    EXPECT_TRUE(result.contains(interrupt.getPollFd()));
    EXPECT_FALSE(result.contains(PollFd(pipe.reader(), PollEvents::Read)));
    interrupt.eoi();
    EXPECT_FALSE(isPending(interrupt));
}

TEST(PollInterrupt, CanBeInterruptedByManyThreadsAtOnce)
{
    PollInterrupt interrupt;
    std::vector<std::thread> wakers;
    for (int i = 0; i < 4; ++i) {
        wakers.emplace_back([&] {
            for (int n = 0; n < 100; ++n)
                interrupt.interrupt();
        });
    }
    EXPECT_TRUE(PollSet(interrupt.getPollFd()).wait().contains(interrupt.getPollFd()));
    for (std::thread& waker : wakers)
        waker.join();
    interrupt.eoi();
    EXPECT_FALSE(isPending(interrupt));
}

TEST(PollInterrupt, ItsDescriptorIsNonBlockingAndCloseOnExec)
{
    const PollInterrupt interrupt;
    const int fd = interrupt.getPollFd().mFd.fd;
    EXPECT_NE(::fcntl(fd, F_GETFL) & O_NONBLOCK, 0);
    EXPECT_EQ(::fcntl(fd, F_GETFD), FD_CLOEXEC);
}

TEST(PollInterrupt, ClosesItsDescriptor)
{
    int fd = -1;
    {
        const PollInterrupt interrupt;
        fd = interrupt.getPollFd().mFd.fd;
        ASSERT_NE(::fcntl(fd, F_GETFD), -1);
    }
    EXPECT_EQ(::fcntl(fd, F_GETFD), -1);
    EXPECT_EQ(errno, EBADF);
}

TEST(PollInterrupt, WithoutADescriptorItThrowsOnlyWhenUsed)
{
    CapturedLog log(LogLevel::Info);
    std::unique_ptr<PollInterrupt> interrupt;
    {
        SystemCalls calls;
        calls.eventfd = [](unsigned int count, int flags) {
            const NoMoreDescriptors exhausted;
            return ::eventfd(count, flags);
        };
        interrupt = std::make_unique<PollInterrupt>();
    }
    EXPECT_THAT(log.lines(), IsEmpty());
    EXPECT_EQ(print(interrupt->getPollFd()), "(fd=-1, mask=0x0039, results=0x0000)");
    EXPECT_FALSE(isPending(*interrupt)) << "poll skips it";
    EXPECT_THAT([&] { interrupt->interrupt(); },
                ThrowsPosixError(EBADF, "eventfd write failed: 9 (Bad file descriptor)"));
    EXPECT_THAT([&] { interrupt->eoi(); }, ThrowsPosixError(EBADF, "eventfd read failed: 9 (Bad file descriptor)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: eventfd write failed: 9 (Bad file descriptor)",
                                         "E: eventfd read failed: 9 (Bad file descriptor)"));
}

TEST(PollInterrupt, ThrowsForADescriptorBelowMinusOne)
{
    CapturedLog log;
    QelLogger::get().addBackend(std::make_shared<test::ErrnoSpoilingLogBackend>());
    SystemCalls calls;
    calls.eventfd = [](unsigned int count, int flags) {
        EXPECT_EQ(count, 0U);
        EXPECT_EQ(flags, EFD_NONBLOCK | EFD_CLOEXEC);
        errno = EMFILE;
        return -2;
    };
    EXPECT_THAT([] { PollInterrupt(); }, ThrowsPosixError(EMFILE, "Failed to open eventfd: 24 (Too many open files)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to open eventfd: 24 (Too many open files)"));
}

} // namespace
} // namespace qel
