// The fakes of the kit keep their own contracts: a wrong fake makes every test that uses it worthless.

#include <qel/common/LogLevel.hpp>
#include <qel/common/QelDebugContext.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "support/Allocations.hpp"
#include "support/Bytes.hpp"
#include "support/CapturedLog.hpp"
#include "support/RecordingLogBackend.hpp"
#include "support/ScriptedStream.hpp"
#include "support/SettableClock.hpp"
#include "support/TemporaryDirectory.hpp"
#include "support/ThrowingLogBackend.hpp"

#include <atomic>
#include <cerrno>
#include <chrono>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <new>
#include <stdexcept>
#include <string>
#include <sys/stat.h>
#include <thread>
#include <vector>

using namespace std::chrono_literals;
using namespace qel::test;
using qel::StreamIOException;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::StrEq;
using testing::ThrowsMessage;

namespace {

std::vector<char> text(const std::string& characters) { return {characters.begin(), characters.end()}; }

std::string readUpTo(ScriptedStream& stream, std::size_t length)
{
    std::string buffer(length, '?');
    buffer.resize(stream.read(&buffer[0], length));
    return buffer;
}

void expectReadFails(ScriptedStream& stream, const char* why)
{
    char buffer[1];
    EXPECT_THAT([&] { stream.read(buffer, 1); }, ThrowsMessage<StreamIOException>(StrEq(why)));
}

TEST(ScriptedStreamTest, OneReadNeverGoesBeyondOneChunk)
{
    ScriptedStream stream;
    stream.deliver(text("abc")).deliver(text("de"));
    EXPECT_EQ(readUpTo(stream, 10), "abc");
    EXPECT_EQ(readUpTo(stream, 10), "de");
    EXPECT_THAT(stream.reads(), ElementsAre(10U, 10U));
}

TEST(ScriptedStreamTest, KeepsTheRestOfAChunkForTheNextRead)
{
    ScriptedStream stream;
    stream.deliver(text("abc")).deliver(text("de"));
    EXPECT_EQ(stream.bytesLeft(), 5U);
    EXPECT_EQ(readUpTo(stream, 2), "ab");
    EXPECT_EQ(stream.bytesRead(), 2U);
    EXPECT_EQ(stream.bytesLeft(), 3U);
    EXPECT_EQ(readUpTo(stream, 2), "c");
    EXPECT_EQ(readUpTo(stream, 2), "de");
    EXPECT_EQ(stream.bytesLeft(), 0U);
}

TEST(ScriptedStreamTest, DeliversOneByOne)
{
    ScriptedStream stream;
    stream.deliverOneByOne(text("abc"));
    EXPECT_EQ(readUpTo(stream, 10), "a");
    EXPECT_EQ(readUpTo(stream, 10), "b");
    EXPECT_EQ(readUpTo(stream, 10), "c");
}

TEST(ScriptedStreamTest, EveryReadAfterTheEndReturnsZero)
{
    ScriptedStream stream;
    stream.deliver(text("a")).end();
    EXPECT_EQ(readUpTo(stream, 10), "a");
    EXPECT_EQ(readUpTo(stream, 10), "");
    EXPECT_EQ(readUpTo(stream, 10), "");
}

TEST(ScriptedStreamTest, FailsOnceAndContinuesTheScript)
{
    ScriptedStream stream;
    stream.deliver(text("a")).fail("first").fail("second").deliver(text("b"));
    EXPECT_EQ(readUpTo(stream, 10), "a");
    expectReadFails(stream, "first");
    expectReadFails(stream, "second");
    EXPECT_EQ(readUpTo(stream, 10), "b");
}

TEST(ScriptedStreamTest, ReadingBeyondTheScriptIsALogicError)
{
    ScriptedStream stream;
    char buffer[1];
    EXPECT_THROW(stream.read(buffer, 1), std::logic_error);
    EXPECT_THROW(stream.fill(buffer, 1), std::logic_error);
}

TEST(ScriptedStreamTest, EmptyChunkIsRefused)
{
    ScriptedStream stream;
    EXPECT_THROW(stream.deliver({}), std::logic_error);
}

TEST(ScriptedStreamTest, RecordsFillsAndPerformsThemByReads)
{
    ScriptedStream stream;
    stream.deliver(text("ab")).deliver(text("cd"));
    char buffer[3];
    stream.fill(buffer, 3);
    EXPECT_EQ(std::string(buffer, 3), "abc");
    stream.fill(buffer, 0);
    EXPECT_THAT(stream.fills(), ElementsAre(3U, 0U));
    EXPECT_THAT(stream.reads(), ElementsAre(3U, 1U));
}

TEST(ScriptedStreamTest, RecordsEachWrite)
{
    ScriptedStream stream;
    stream.write("abc", 3);
    stream.write("", 0);
    stream.write("de", 2);
    EXPECT_THAT(stream.writes(), ElementsAre(text("abc"), text(""), text("de")));
    EXPECT_EQ(stream.written(), text("abcde"));
}

TEST(ScriptedStreamTest, WriteFailsAtTheGivenByte)
{
    ScriptedStream stream;
    stream.failWriteAt(5, "broken");
    stream.write("abc", 3);
    stream.write("de", 2); // the byte at 5 is not among these
    EXPECT_THAT([&] { stream.write("f", 1); }, ThrowsMessage<StreamIOException>(StrEq("broken")));
    EXPECT_THAT([&] { stream.write("g", 1); }, ThrowsMessage<StreamIOException>(StrEq("broken")));
    EXPECT_EQ(stream.written(), text("abcde"));
}

TEST(ScriptedStreamTest, AFailedWriteRecordsItsFirstPart)
{
    ScriptedStream stream;
    stream.failWriteAt(2, "broken");
    EXPECT_THAT([&] { stream.write("abc", 3); }, ThrowsMessage<StreamIOException>(StrEq("broken")));
    EXPECT_THAT(stream.writes(), ElementsAre(text("ab")));
    EXPECT_THROW(stream.failWriteAt(1, "too late"), std::logic_error);
}

TEST(ScriptedStreamTest, RecordsDeadlinesPerDirection)
{
    ScriptedStream stream;
    stream.setReadDeadline(5ms);
    stream.setReadDeadline(-1ms);
    stream.setWriteDeadline(7ms);
    EXPECT_THAT(stream.readDeadlines(), ElementsAre(5ms, -1ms));
    EXPECT_THAT(stream.writeDeadlines(), ElementsAre(7ms));
}

TEST(ScriptedStreamTest, ClosedStreamNeitherReadsNorWrites)
{
    ScriptedStream stream;
    stream.deliver(text("abc"));
    stream.close();
    stream.close();
    EXPECT_EQ(stream.closeCount(), 2U);
    expectReadFails(stream, "closed");
    EXPECT_THAT([&] { stream.write("a", 1); }, ThrowsMessage<StreamIOException>(StrEq("closed")));
    EXPECT_THAT(stream.writes(), IsEmpty());
}

TEST(BytesTest, ConvertsNumbersToBytesAndBytesToDigits)
{
    EXPECT_THAT(bytes({0, 0x7F, 0x80, 0xFF}), ElementsAre('\0', '\x7F', '\x80', '\xFF'));
    EXPECT_THROW(bytes({256}), std::invalid_argument);
    EXPECT_EQ(hex(bytes({0, 0x7F, 0x80, 0xFF})), "007F80FF");
    EXPECT_EQ(hex(nullptr, 0), "");
}

TEST(BytesTest, HeapCopyHoldsTheSameBytesElsewhere)
{
    const std::vector<char> original = bytes({1, 2, 3});
    const std::unique_ptr<char[]> copy = heapCopy(original);
    EXPECT_NE(copy.get(), original.data());
    EXPECT_EQ(hex(copy.get(), 3), "010203");
    EXPECT_NE(heapCopy(nullptr, 0), nullptr);
}

TEST(CapturedLogTest, ShowsLevelAndTextOfEachLine)
{
    const CapturedLog log;
    qel::QelDebugContext(qel::QelLogger::get(), qel::LogLevel::Error) << "went wrong";
    qel::QelDebugContext(qel::QelLogger::get(), qel::LogLevel::Debug) << "looked closely";
    EXPECT_THAT(log.lines(), ElementsAre("E: went wrong", "D: looked closely"));
    ASSERT_EQ(log.rawLines().size(), 2U);
    EXPECT_EQ(log.rawLines()[0].front(), '[');
}

TEST(CapturedLogTest, ForgetsLinesWhenCleared)
{
    CapturedLog log;
    qel::QelDebugContext(qel::QelLogger::get(), qel::LogLevel::Error) << "went wrong";
    log.clear();
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(CapturedLogTest, SetsTheLevelUntilItsDestruction)
{
    {
        const CapturedLog log(qel::LogLevel::Error);
        EXPECT_TRUE(qel::QelLogger::get().isLevelEnabled(qel::LogLevel::Error));
        EXPECT_FALSE(qel::QelLogger::get().isLevelEnabled(qel::LogLevel::Warn));
    }
    {
        const CapturedLog log;
        EXPECT_TRUE(qel::QelLogger::get().isLevelEnabled(qel::LogLevel::Debug));
        EXPECT_THAT(log.lines(), IsEmpty());
    }
    EXPECT_FALSE(qel::QelLogger::get().isLevelEnabled(qel::LogLevel::Debug));
}

TEST(RecordingLogBackendTest, KeepsLevelAndLineUntilCleared)
{
    RecordingLogBackend backend;
    backend.log(qel::LogLevel::Debug, "first");
    backend.log(qel::LogLevel::Critical, "second");
    ASSERT_EQ(backend.entries().size(), 2U);
    EXPECT_EQ(backend.entries()[0].level, qel::LogLevel::Debug);
    EXPECT_EQ(backend.entries()[1].level, qel::LogLevel::Critical);
    EXPECT_THAT(backend.lines(), ElementsAre("first", "second"));
    backend.clear();
    EXPECT_THAT(backend.lines(), IsEmpty());
}

TEST(ThrowingLogBackendTest, ThrowsOnEveryLine)
{
    ThrowingLogBackend backend;
    EXPECT_THAT([&] { backend.log(qel::LogLevel::Debug, "line"); },
                ThrowsMessage<std::runtime_error>(StrEq("back-end")));
}

TEST(SettableClockTest, AdvancesOnlyWhenTold)
{
    SettableClock clock;
    const auto system = qel::TimeProvider::system();
    const auto steady = qel::TimeProvider::steady();
    EXPECT_EQ(qel::TimeProvider::system(), system);
    EXPECT_EQ(qel::TimeProvider::steady(), steady);
    clock.advance(5s);
    EXPECT_EQ(qel::TimeProvider::system() - system, 5s);
    EXPECT_EQ(qel::TimeProvider::steady() - steady, 5s);
    clock.setSteady(std::chrono::steady_clock::time_point(7s));
    EXPECT_EQ(qel::TimeProvider::steady().time_since_epoch(), 7s);
    EXPECT_EQ(qel::TimeProvider::system() - system, 5s);
    clock.setSystem(std::chrono::system_clock::time_point(9s));
    EXPECT_EQ(qel::TimeProvider::system().time_since_epoch(), 9s);
}

TEST(SettableClockTest, CountsReadsOfTheSteadyClock)
{
    SettableClock clock;
    EXPECT_EQ(clock.steadyReads(), 0U);
    qel::TimeProvider::steady();
    qel::TimeProvider::steady();
    qel::TimeProvider::system();
    EXPECT_EQ(clock.steadyReads(), 2U);
}

TEST(SettableClockTest, RestoresRealTimeAtTheEnd)
{
    {
        SettableClock clock;
        clock.setSteady(std::chrono::steady_clock::time_point::min());
        EXPECT_EQ(qel::TimeProvider::steady(), std::chrono::steady_clock::time_point::min());
    }
    const auto before = std::chrono::steady_clock::now();
    EXPECT_GE(qel::TimeProvider::steady(), before);
}

bool exists(const std::string& path)
{
    struct stat status;
    return ::lstat(path.c_str(), &status) == 0;
}

TEST(TemporaryDirectoryTest, IsFreshAndGoneWithItsFilesAtTheEnd)
{
    std::string path;
    {
        const TemporaryDirectory directory;
        const TemporaryDirectory other;
        path = directory.path();
        EXPECT_NE(path, other.path());
        EXPECT_EQ(path.front(), '/');
        EXPECT_EQ(directory.file("a.log"), path + "/a.log");
        EXPECT_TRUE(exists(path));
        EXPECT_FALSE(exists(directory.file("a.log")));
        std::ofstream(directory.file("a.log")) << "text";
        EXPECT_TRUE(exists(directory.file("a.log")));
    }
    EXPECT_FALSE(exists(path));
}

// Called by name: the compiler may leave out a new expression.
void allocateAndRelease() { ::operator delete(::operator new(1)); }

TEST(AllocationsTest, CountsEachBlockFromItsConstructionOn)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    allocateAndRelease();
    const Allocations allocations;
    EXPECT_EQ(allocations.count(), 0U);
    allocateAndRelease();
    ::operator delete[](::operator new[](100));
    EXPECT_EQ(allocations.count(), 2U);
}

TEST(AllocationsTest, DoesNotAffectOtherThreads)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    std::atomic<bool> start{false};
    std::atomic<bool> done{false};
    std::atomic<bool> failed{false};
    std::thread other([&] {
        while (!start)
            std::this_thread::yield();
        try {
            allocateAndRelease();
        } catch (const std::bad_alloc&) {
            failed = true;
        }
        done = true;
    });
    {
        Allocations allocations;
        allocations.failAll();
        start = true;
        while (!done)
            std::this_thread::yield();
        allocations.succeedAgain();
        EXPECT_EQ(allocations.count(), 0U);
    }
    other.join();
    EXPECT_FALSE(failed);
}

TEST(AllocationsTest, ExemptAllocationsNeitherCountNorFail)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    bool failed = false;
    bool failedAfterwards = false;
    std::size_t count = 0;
    {
        Allocations allocations;
        allocations.failAll();
        try {
            const Allocations::Exempt exempt;
            allocateAndRelease();
        } catch (const std::bad_alloc&) {
            failed = true;
        }
        count = allocations.count();
        try {
            allocateAndRelease();
        } catch (const std::bad_alloc&) {
            failedAfterwards = true;
        }
    }
    EXPECT_FALSE(failed);
    EXPECT_EQ(count, 0U);
    EXPECT_TRUE(failedAfterwards);
}

TEST(AllocationsTest, LetsSomeSucceedBeforeItFails)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    unsigned succeeded = 0;
    unsigned failed = 0;
    {
        Allocations allocations;
        allocations.failAfter(2);
        for (int i = 0; i < 5; ++i) {
            try {
                allocateAndRelease();
                ++succeeded;
            } catch (const std::bad_alloc&) {
                ++failed;
            }
        }
    }
    EXPECT_EQ(succeeded, 2U);
    EXPECT_EQ(failed, 3U);
}

TEST(AllocationsTest, ChangesErrnoWhileItCounts)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    int before = 0;
    int exempted = 0;
    int counted = 0;
    {
        const Allocations allocations;
        errno = 5;
        before = errno;
        {
            const Allocations::Exempt exempt;
            allocateAndRelease();
            exempted = errno;
        }
        allocateAndRelease();
        counted = errno;
    }
    errno = 5;
    allocateAndRelease();
    EXPECT_EQ(errno, 5);
    EXPECT_EQ(before, 5);
    EXPECT_EQ(exempted, 5);
    EXPECT_EQ(counted, Allocations::kErrno);
}

TEST(AllocationsTest, FailsUntilToldToSucceedOrGone)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    bool failed = false;
    bool failedAgain = false;
    {
        Allocations allocations;
        allocations.failAll();
        try {
            allocateAndRelease();
        } catch (const std::bad_alloc&) {
            failed = true;
        }
        allocations.succeedAgain();
        allocateAndRelease();
        allocations.failAll();
        try {
            allocateAndRelease();
        } catch (const std::bad_alloc&) {
            failedAgain = true;
        }
    }
    allocateAndRelease();
    EXPECT_TRUE(failed);
    EXPECT_TRUE(failedAgain);
}

} // namespace
