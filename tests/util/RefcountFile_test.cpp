#include <qel/common/util/RefcountFile.hpp>

#include <atomic>
#include <cerrno>
#include <fcntl.h>
#include <future>
#include <gtest/gtest.h>
#include <memory>
#include <optional>
#include <poll.h>
#include <stdexcept>
#include <sys/stat.h>
#include <thread>
#include <type_traits>
#include <unistd.h>
#include <utility>
#include <vector>

namespace qel {
namespace {

/// A pipe whose writing end the test gives away: the reading end shows whether the writing end is still open.
class WatchedPipe {
public:
    WatchedPipe()
    {
        if (::pipe2(mEnds, O_CLOEXEC) != 0) throw std::runtime_error("pipe2");
    }
    ~WatchedPipe()
    {
        ::close(mEnds[0]);
        if (!mGivenAway) ::close(mEnds[1]);
    }
    WatchedPipe(const WatchedPipe&) = delete;
    WatchedPipe& operator=(const WatchedPipe&) = delete;

    /// @return the writing end, which the caller owns from now on
    int giveAway()
    {
        mGivenAway = true;
        return mEnds[1];
    }

    bool writerIsOpen() const
    {
        struct pollfd entry = {mEnds[0], 0, 0};
        if (::poll(&entry, 1, 0) < 0) throw std::runtime_error("poll");
        return (entry.revents & POLLHUP) == 0;
    }

    /// @return whether the descriptor belongs to this pipe
    bool owns(int fd) const
    {
        struct stat mine = {};
        struct stat other = {};
        return ::fstat(mEnds[0], &mine) == 0 && ::fstat(fd, &other) == 0 && mine.st_ino == other.st_ino &&
               mine.st_dev == other.st_dev;
    }

    int reader() const { return mEnds[0]; }

private:
    int mEnds[2] = {-1, -1};
    bool mGivenAway = false;
};

TEST(RefcountFile, AGuardHasTheDescriptor)
{
    WatchedPipe pipe;
    const int fd = pipe.giveAway();
    RefcountFile file(fd);
    const RefcountFile::Guard guard(file);
    EXPECT_TRUE(guard.isValid());
    EXPECT_EQ(guard.getFd(), fd);
    EXPECT_EQ(::write(guard.getFd(), "x", 1), 1);
}

TEST(RefcountFile, DestroyingAGuardLeavesTheDescriptorOpen)
{
    WatchedPipe pipe;
    RefcountFile file(pipe.giveAway());
    {
        const RefcountFile::Guard guard(file);
    }
    EXPECT_TRUE(pipe.writerIsOpen());
    const RefcountFile::Guard again(file);
    EXPECT_TRUE(again.isValid());
}

TEST(RefcountFile, CloseWithoutGuardsClosesAtOnce)
{
    WatchedPipe pipe;
    RefcountFile file(pipe.giveAway());
    EXPECT_TRUE(pipe.writerIsOpen());
    file.close();
    EXPECT_FALSE(pipe.writerIsOpen());
}

TEST(RefcountFile, CloseWaitsForTheGuardThatHoldsTheDescriptor)
{
    WatchedPipe pipe;
    RefcountFile file(pipe.giveAway());
    {
        const RefcountFile::Guard guard(file);
        file.close();
        EXPECT_TRUE(pipe.writerIsOpen());
        EXPECT_TRUE(guard.isValid());
        EXPECT_EQ(::write(guard.getFd(), "x", 1), 1);
    }
    EXPECT_FALSE(pipe.writerIsOpen());
}

TEST(RefcountFile, TheLastOfSeveralGuardsCloses)
{
    WatchedPipe pipe;
    RefcountFile file(pipe.giveAway());
    std::optional<RefcountFile::Guard> first(std::in_place, file);
    std::optional<RefcountFile::Guard> second(std::in_place, file);
    file.close();
    first.reset();
    EXPECT_TRUE(pipe.writerIsOpen());
    second.reset();
    EXPECT_FALSE(pipe.writerIsOpen());
}

TEST(RefcountFile, AGuardMadeAfterCloseIsNotValid)
{
    WatchedPipe pipe;
    RefcountFile file(pipe.giveAway());
    {
        const RefcountFile::Guard before(file);
        file.close();
        {
            const RefcountFile::Guard after(file);
            EXPECT_FALSE(after.isValid());
            EXPECT_EQ(after.getFd(), -1);
        }
        // The guard without a descriptor must not have ended a use.
        EXPECT_TRUE(pipe.writerIsOpen());
        EXPECT_EQ(::write(before.getFd(), "x", 1), 1);
    }
    EXPECT_FALSE(pipe.writerIsOpen());
    const RefcountFile::Guard last(file);
    EXPECT_FALSE(last.isValid());
}

TEST(RefcountFile, ClosingTwiceIsHarmless)
{
    WatchedPipe pipe;
    const int fd = pipe.giveAway();
    RefcountFile file(fd);
    file.close();
    WatchedPipe other; // takes the free number
    EXPECT_TRUE(other.owns(fd));
    file.close();
    EXPECT_TRUE(other.owns(fd));
}

TEST(RefcountFile, ClosingTwiceUnderAGuardClosesOnce)
{
    WatchedPipe pipe;
    const int fd = pipe.giveAway();
    RefcountFile file(fd);
    {
        const RefcountFile::Guard guard(file);
        file.close();
        file.close();
        EXPECT_TRUE(pipe.writerIsOpen());
    }
    EXPECT_FALSE(pipe.writerIsOpen());
    WatchedPipe other;
    EXPECT_TRUE(other.owns(fd));
    file.close();
    EXPECT_TRUE(other.owns(fd));
}

TEST(RefcountFile, ANegativeDescriptorStartsClosedAndIsNeverClosed)
{
    errno = 0; // closing -1 would change it
    {
        RefcountFile file(-1);
        {
            const RefcountFile::Guard guard(file);
            EXPECT_FALSE(guard.isValid());
            EXPECT_EQ(guard.getFd(), -1);
        }
        file.close();
    }
    {
        RefcountFile file(-7);
        const RefcountFile::Guard guard(file);
        EXPECT_EQ(guard.getFd(), -1);
    }
    EXPECT_EQ(errno, 0);
}

/// Frees descriptor 0 for the length of a test.
class DescriptorZero {
public:
    DescriptorZero() : mSaved(::fcntl(0, F_DUPFD_CLOEXEC, 3)) { ::close(0); }
    ~DescriptorZero()
    {
        if (mSaved < 0) return;
        ::dup2(mSaved, 0);
        ::close(mSaved);
    }
    DescriptorZero(const DescriptorZero&) = delete;
    DescriptorZero& operator=(const DescriptorZero&) = delete;

private:
    const int mSaved;
};

TEST(RefcountFile, DescriptorZeroIsADescriptor)
{
    WatchedPipe pipe;
    const DescriptorZero zero;
    const int writer = pipe.giveAway();
    ASSERT_EQ(::dup2(writer, 0), 0);
    ASSERT_EQ(::close(writer), 0);
    RefcountFile file(0);
    {
        const RefcountFile::Guard guard(file);
        EXPECT_TRUE(guard.isValid());
        EXPECT_EQ(guard.getFd(), 0);
        file.close();
        EXPECT_TRUE(pipe.writerIsOpen());
    }
    EXPECT_FALSE(pipe.writerIsOpen());
}

TEST(RefcountFile, CopiesShareOneDescriptor)
{
    WatchedPipe pipe;
    RefcountFile file(pipe.giveAway());
    RefcountFile copy(file);
    const RefcountFile::Guard guard(copy);
    EXPECT_TRUE(guard.isValid());
    copy.close();
    const RefcountFile::Guard other(file);
    EXPECT_FALSE(other.isValid());
}

TEST(RefcountFile, DestroyingTheLastCopyCloses)
{
    WatchedPipe pipe;
    auto file = std::make_unique<RefcountFile>(pipe.giveAway());
    auto copy = std::make_unique<RefcountFile>(*file);
    file.reset();
    EXPECT_TRUE(pipe.writerIsOpen());
    copy.reset();
    EXPECT_FALSE(pipe.writerIsOpen());
}

TEST(RefcountFile, AssignmentReleasesTheOldDescriptor)
{
    WatchedPipe first;
    WatchedPipe second;
    RefcountFile file(first.giveAway());
    const RefcountFile other(second.giveAway());
    file = other;
    EXPECT_FALSE(first.writerIsOpen());
    EXPECT_TRUE(second.writerIsOpen());
}

TEST(RefcountFile, AMovedFromFileStaysUsable)
{
    WatchedPipe pipe;
    RefcountFile file(pipe.giveAway());
    RefcountFile target(std::move(file));
    const RefcountFile::Guard guard(file);
    EXPECT_TRUE(guard.isValid());
    file.close();
    EXPECT_TRUE(pipe.writerIsOpen());
}

TEST(RefcountFile, GuardAndBlockAreNotCopyable)
{
    EXPECT_FALSE(std::is_copy_constructible<RefcountFile::Guard>::value);
    EXPECT_FALSE(std::is_copy_assignable<RefcountFile::Guard>::value);
    EXPECT_FALSE(std::is_copy_constructible<RefcountFile::ControlBlock>::value);
    EXPECT_FALSE(std::is_copy_assignable<RefcountFile::ControlBlock>::value);
}

TEST(RefcountFileControlBlock, CountsUsesUntilTheLastOneAfterClose)
{
    WatchedPipe pipe;
    const int fd = pipe.giveAway();
    RefcountFile::ControlBlock block(fd);
    EXPECT_EQ(block.getFd(), fd);
    EXPECT_EQ(block.getFd(), fd);
    block.putFd();
    block.close();
    EXPECT_EQ(block.getFd(), -1);
    EXPECT_TRUE(pipe.writerIsOpen());
    block.putFd();
    EXPECT_FALSE(pipe.writerIsOpen());
}

TEST(RefcountFileControlBlock, TheDestructorCloses)
{
    WatchedPipe pipe;
    {
        const RefcountFile::ControlBlock block(pipe.giveAway());
        EXPECT_TRUE(pipe.writerIsOpen());
    }
    EXPECT_FALSE(pipe.writerIsOpen());
}

// ----------------------------------------------------------------------------------------------------------- threads

TEST(RefcountFileThreads, CloseDefersToTheGuardsOfOtherThreads)
{
    constexpr std::size_t kThreads = 4;
    WatchedPipe pipe;
    RefcountFile file(pipe.giveAway());
    std::promise<void> release;
    const std::shared_future<void> released(release.get_future());
    std::vector<std::promise<bool>> held(kThreads);
    std::vector<std::thread> threads;
    for (std::promise<bool>& mine : held) {
        threads.emplace_back([&file, &mine, released] {
            const RefcountFile::Guard guard(file);
            mine.set_value(guard.isValid());
            released.wait();
            EXPECT_EQ(::write(guard.getFd(), "x", 1), 1);
        });
    }
    for (std::promise<bool>& one : held) {
        EXPECT_TRUE(one.get_future().get());
    }
    file.close();
    EXPECT_TRUE(pipe.writerIsOpen());
    release.set_value();
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_FALSE(pipe.writerIsOpen());
    char written[kThreads + 1];
    EXPECT_EQ(::read(pipe.reader(), written, sizeof(written)), static_cast<ssize_t>(kThreads));
}

// One thread begins a use while another one closes. In either order, a use that got the descriptor finds it open, and
// it is closed once: a second close would leave EBADF in errno of its thread.
TEST(RefcountFileThreads, AUseThatBeginsDuringCloseGetsAnOpenDescriptorOrNone)
{
    constexpr int kRounds = 50000;
    const int device = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
    ASSERT_GE(device, 0);
    std::unique_ptr<RefcountFile::ControlBlock> block;
    std::atomic<int> started{0};  // rounds that both threads may run
    std::atomic<int> finished{0}; // rounds that the user has finished
    std::atomic<int> faults{0};
    std::thread user([&] {
        for (int round = 1; round <= kRounds; ++round) {
            while (started < round) {
                std::this_thread::yield();
            }
            errno = 0;
            const int fd = block->getFd();
            if (fd >= 0) {
                if (::fcntl(fd, F_GETFD) < 0) ++faults;
                block->putFd();
            }
            if (errno != 0) ++faults;
            finished = round;
        }
    });
    for (int round = 1; round <= kRounds; ++round) {
        const int fd = ::fcntl(device, F_DUPFD_CLOEXEC, 0);
        if (fd < 0) ++faults;
        block = std::make_unique<RefcountFile::ControlBlock>(fd);
        started = round;
        errno = 0;
        block->close();
        if (errno != 0) ++faults;
        while (finished < round) {
            std::this_thread::yield();
        }
        if (::fcntl(fd, F_GETFD) >= 0) ++faults; // must be closed now
    }
    user.join();
    EXPECT_EQ(faults, 0);
    EXPECT_EQ(::close(device), 0);
}

// Users make and destroy guards while one thread closes and another one keeps opening files, which get the number of
// the descriptor as soon as it is free. No user may ever see that number for another file.
TEST(RefcountFileThreads, NoUserSeesANumberThatBelongsToAnotherFile)
{
    constexpr int kUsers = 3;
    constexpr int kRounds = 20;
    for (int round = 0; round < kRounds; ++round) {
        WatchedPipe pipe;
        RefcountFile file(pipe.giveAway());
        std::atomic<int> busy{0};
        std::atomic<bool> done{false};
        std::atomic<int> strangers{0};
        std::vector<std::thread> threads;
        for (int user = 0; user < kUsers; ++user) {
            threads.emplace_back([&] {
                bool first = true;
                for (;;) {
                    const RefcountFile::Guard guard(file);
                    if (!guard.isValid()) return;
                    if (!pipe.owns(guard.getFd())) ++strangers;
                    if (first) ++busy;
                    first = false;
                }
            });
        }
        threads.emplace_back([&] {
            while (!done) {
                const int fd = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
                if (fd >= 0) ::close(fd);
            }
        });
        while (busy < kUsers) {
            std::this_thread::yield();
        }
        std::thread closer([&] { file.close(); });
        file.close();
        closer.join();
        for (int user = 0; user < kUsers; ++user) {
            threads[static_cast<std::size_t>(user)].join();
        }
        done = true;
        threads.back().join();
        ASSERT_EQ(strangers, 0) << "round " << round;
        ASSERT_FALSE(pipe.writerIsOpen()) << "round " << round;
    }
}

} // namespace
} // namespace qel
