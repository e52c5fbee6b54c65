#include "LogBackendRotatingTest.hpp"
#include "support/Allocations.hpp"
#include "support/FileCalls.hpp"

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <unistd.h>

namespace qel::test {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

std::uint64_t sizeOf(const std::string& path)
{
    struct stat status = {};
    EXPECT_EQ(::stat(path.c_str(), &status), 0) << path;
    return static_cast<std::uint64_t>(status.st_size);
}

// Opening

TEST_F(LogBackendRotatingTest, KeepsFiveFiles) { EXPECT_EQ(LogBackendRotating::MAX_FILES_ALLOWED, 5U); }

TEST_F(LogBackendRotatingTest, CreatesItsFileAtOnce)
{
    const mode_t umaskBefore = ::umask(0);
    const auto backend = make();
    ::umask(umaskBefore);
    EXPECT_EQ(files(), (Files{{"log", ""}}));
    struct stat status = {};
    ASSERT_EQ(::stat(path("log").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777U, 0644U);
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
}

TEST_F(LogBackendRotatingTest, OpensForReadingAndWritingAndNotInAppendMode)
{
    FileCalls calls;
    const auto backend = make();
    char expected[64];
    std::snprintf(expected, sizeof(expected), "open log %x 644", static_cast<unsigned>(O_RDWR | O_CREAT | O_CLOEXEC));
    EXPECT_THAT(calls.take(), ElementsAre(expected, "lseek"));
}

TEST_F(LogBackendRotatingTest, AppendsToAnExistingFile)
{
    write("log", "before\n");
    const auto backend = make();
    log(*backend, "after");
    EXPECT_EQ(files(), (Files{{"log", "before\nafter\n"}}));
}

TEST_F(LogBackendRotatingTest, WritesEachLineAtOnce)
{
    const auto backend = make();
    log(*backend, "first");
    EXPECT_EQ(read("log"), "first\n");
    log(*backend, "second");
    EXPECT_EQ(read("log"), "first\nsecond\n");
}

TEST_F(LogBackendRotatingTest, WritesAnyByte)
{
    const std::string line("a\0b\nc\xFF", 6);
    const auto backend = make();
    log(*backend, line);
    EXPECT_EQ(read("log"), line + "\n");
}

TEST_F(LogBackendRotatingTest, PassesWarnAndAboveByDefault)
{
    LogBackendRotating backend(mDirectory.path(), "log", kRoomy);
    EXPECT_EQ(backend.getLogLevel(), LogLevel::Warn);
    backend.log(LogLevel::Info, "info");
    backend.log(LogLevel::Warn, "warn");
    EXPECT_EQ(read("log"), "warn\n");
}

TEST_F(LogBackendRotatingTest, TakesAThreshold)
{
    LogBackendRotating debug(LogLevel::Debug, mDirectory.path(), "log", kRoomy);
    EXPECT_EQ(debug.getLogLevel(), LogLevel::Debug);
    LogBackendRotating invalid(static_cast<LogLevel::Level>(7), mDirectory.path(), "other", kRoomy);
    EXPECT_EQ(invalid.getLogLevel(), LogLevel::Warn);
}

TEST_F(LogBackendRotatingTest, StripsSeparatorsOnlyAtTheEndOfTheWholePath)
{
    struct {
        const char* directory;
        const char* name;
        const char* path; // relative to the test's directory, which does not hold "missing"
    } const rows[] = {
        {"/missing", "a", "/missing/a"},    {"/missing/", "a", "/missing//a"}, {"/missing/", "a/", "/missing//a"},
        {"/missing", "a///", "/missing/a"}, {"/missing", "/a", "/missing//a"}, {"/missing", "b/a", "/missing/b/a"},
        {"//missing", "a", "//missing/a"},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(std::string(row.directory) + " " + row.name);
        const LogBackendRotating backend(mDirectory.path() + row.directory, row.name, kRoomy);
        EXPECT_THAT(mSystemLog.take(), ElementsAre(error("Failed to open log " + mDirectory.path() + row.path,
                                                         "2 (No such file or directory)")));
    }
}

TEST_F(LogBackendRotatingTest, AnEmptyNameMeansTheDirectoryWhichCannotBeOpened)
{
    const LogBackendRotating backend(mDirectory.path(), "", kRoomy);
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(error("Failed to open log " + mDirectory.path(), "21 (Is a directory)")));
}

TEST_F(LogBackendRotatingTest, ReportsAFileThatCannotBeOpenedAndDropsEveryLineSilently)
{
    write("file", "");
    ASSERT_EQ(::mkdir(path("directory").c_str(), 0755), 0);
    struct {
        const char* directory;
        const char* name;
        const char* error;
    } const rows[] = {
        {"/missing", "log", "2 (No such file or directory)"},
        {"/file", "log", "20 (Not a directory)"},
        {"", "directory", "21 (Is a directory)"},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.error);
        LogBackendRotating backend(mDirectory.path() + row.directory, row.name, kRoomy);
        EXPECT_THAT(
            mSystemLog.take(),
            ElementsAre(error("Failed to open log " + mDirectory.path() + row.directory + "/" + row.name, row.error)));
        FileCalls calls;
        log(backend, "line");
        log(backend, "line");
        EXPECT_THAT(calls.take(), IsEmpty());
        EXPECT_THAT(mSystemLog.take(), IsEmpty());
    }
}

TEST_F(LogBackendRotatingTest, ReportsADirectoryWithoutPermissionAndAProcessWithoutDescriptors)
{
    struct {
        int number;
        const char* error;
    } const rows[] = {{EACCES, "13 (Permission denied)"}, {EMFILE, "24 (Too many open files)"}};
    for (const auto& row : rows) {
        SCOPED_TRACE(row.error);
        FileCalls calls; // the tests may run as root, whom no permission stops
        calls.fail(FileCalls::Open, row.number);
        const auto backend = make();
        EXPECT_THAT(mSystemLog.take(), ElementsAre(error("Failed to open log " + path("log"), row.error)));
    }
}

TEST_F(LogBackendRotatingTest, DescriptorZeroIsADescriptor)
{
    // A daemon has closed its standard input, so its log file gets the number 0.
    const int standardInput = ::fcntl(STDIN_FILENO, F_DUPFD_CLOEXEC, 3);
    ASSERT_EQ(::close(STDIN_FILENO), standardInput < 0 ? -1 : 0);
    auto backend = make(12);
    EXPECT_NE(::fcntl(0, F_GETFD), -1) << "the log file has this number";
    log(*backend, "first");
    log(*backend, "second"); // rotates
    backend.reset();
    EXPECT_EQ(::fcntl(0, F_GETFD), -1) << "the destructor closes it";
    if (standardInput >= 0) {
        ::dup2(standardInput, STDIN_FILENO);
        ::close(standardInput);
    }
    EXPECT_EQ(files(), (Files{{"log", "second\n"}, {"log.1", "first\n"}}));
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
}

TEST_F(LogBackendRotatingTest, StaysClosedAfterAFailedOpen)
{
    LogBackendRotating backend(mDirectory.path() + "/late", "log", kRoomy);
    EXPECT_EQ(mSystemLog.take().size(), 1U);
    ASSERT_EQ(::mkdir(path("late").c_str(), 0755), 0);
    log(backend, "line");
    EXPECT_NE(::access(path("late/log").c_str(), F_OK), 0);
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
}

TEST_F(LogBackendRotatingTest, ReportsAFailedSeekAndClosesTheFile)
{
    ASSERT_EQ(::mkfifo(path("log").c_str(), 0600), 0);
    FileCalls calls;
    const auto backend = make();
    EXPECT_THAT(mSystemLog.take(), ElementsAre(error("Failed to seek log " + path("log"), "29 (Illegal seek)")));
    ASSERT_EQ(calls.take().back(), "close");
    log(*backend, "line");
    EXPECT_THAT(calls.take(), IsEmpty()) << "the line is dropped silently";
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
}

// Sizes and rotation

TEST_F(LogBackendRotatingTest, CutsALineLongerThanAFile)
{
    struct {
        std::size_t length;
        std::size_t written; // without the line end
    } const rows[] = {{8, 8}, {9, 9}, {10, 9}, {11, 9}, {1000, 9}};
    for (const auto& row : rows) {
        SCOPED_TRACE(row.length);
        const TemporaryDirectory directory;
        LogBackendRotating backend(LogLevel::Inherit, directory.path(), "log", 10);
        log(backend, std::string(row.length, 'x'));
        EXPECT_EQ(Utilities::readFile(directory.file("log")), std::string(row.written, 'x') + "\n");
        EXPECT_NE(::access(directory.file("log.1").c_str(), F_OK), 0) << "an empty file is not rotated";
    }
}

TEST_F(LogBackendRotatingTest, WritesALongLineCutIntoAFreshFile)
{
    const auto backend = make(100);
    log(*backend, "short");
    log(*backend, std::string(150, 'x'));
    EXPECT_EQ(files(), (Files{{"log", std::string(99, 'x') + "\n"}, {"log.1", "short\n"}}));
}

TEST_F(LogBackendRotatingTest, AFileReachesTheLimitAndNeverExceedsIt)
{
    const auto backend = make(10);
    log(*backend, "1234");
    log(*backend, "5678");
    EXPECT_EQ(files(), (Files{{"log", "1234\n5678\n"}}));
    log(*backend, "");
    EXPECT_EQ(files(), (Files{{"log", "\n"}, {"log.1", "1234\n5678\n"}}));
    log(*backend, "123456789");
    EXPECT_EQ(files(), (Files{{"log", "123456789\n"}, {"log.1", "\n"}, {"log.2", "1234\n5678\n"}}))
        << "one byte too many begins a new file";
}

TEST_F(LogBackendRotatingTest, CountsTheBytesOfAnExistingFile)
{
    write("log", "12345");
    const auto backend = make(10);
    log(*backend, "6789");
    EXPECT_EQ(files(), (Files{{"log", "123456789\n"}}));
    log(*backend, "x");
    EXPECT_EQ(files(), (Files{{"log", "x\n"}, {"log.1", "123456789\n"}}));
}

TEST_F(LogBackendRotatingTest, RotatesAnExistingFileAboveTheLimit)
{
    write("log", "this was written under a larger limit\n");
    const auto backend = make(10);
    EXPECT_EQ(files().size(), 1U) << "a line rotates, not the construction";
    log(*backend, "x");
    EXPECT_EQ(files(), (Files{{"log", "x\n"}, {"log.1", "this was written under a larger limit\n"}}));
}

TEST_F(LogBackendRotatingTest, KeepsTheFiveYoungestOfSevenFiles)
{
    const auto backend = make(2);
    for (char line = '1'; line <= '7'; ++line)
        log(*backend, std::string(1, line));
    EXPECT_EQ(files(), (Files{{"log", "7\n"}, {"log.1", "6\n"}, {"log.2", "5\n"}, {"log.3", "4\n"}, {"log.4", "3\n"}}));
    EXPECT_THAT(mSystemLog.take(), IsEmpty()) << "missing older files are normal";
}

TEST_F(LogBackendRotatingTest, WithALimitOfOneByteOnlyLineEndsFit)
{
    const auto backend = make(1);
    log(*backend, "a");
    EXPECT_EQ(files(), (Files{{"log", "\n"}}));
    log(*backend, "b");
    EXPECT_EQ(files(), (Files{{"log", "\n"}, {"log.1", "\n"}}));
}

TEST_F(LogBackendRotatingTest, SurvivesALimitOfZero)
{
    const auto backend = make(0);
    log(*backend, "a");
    log(*backend, "");
    EXPECT_TRUE(files().count("log"));
}

TEST_F(LogBackendRotatingTest, CountsFilesAboveFourGigabytes)
{
    constexpr off_t kFiveGigabytes = 5LL * 1024 * 1024 * 1024;
    write("log", "");
    ASSERT_EQ(::truncate(path("log").c_str(), kFiveGigabytes), 0); // sparse
    auto backend = make(static_cast<std::size_t>(kFiveGigabytes) + 2);
    log(*backend, "x");
    EXPECT_EQ(sizeOf(path("log")), static_cast<std::uint64_t>(kFiveGigabytes) + 2);
    log(*backend, "y");
    EXPECT_EQ(read("log"), "y\n");
    EXPECT_EQ(sizeOf(path("log.1")), static_cast<std::uint64_t>(kFiveGigabytes) + 2);
}

TEST_F(LogBackendRotatingTest, RotatesFromTheOldestDownAfterClosingTheFile)
{
    const auto backend = make(2);
    log(*backend, "a");
    FileCalls calls;
    log(*backend, "b");
    char open[64];
    std::snprintf(open, sizeof(open), "open log %x 644", static_cast<unsigned>(O_RDWR | O_CREAT | O_CLOEXEC | O_TRUNC));
    EXPECT_THAT(calls.take(),
                ElementsAre("fsync", "close", "rename log.3 log.4", "rename log.2 log.3", "rename log.1 log.2",
                            "rename log log.1", "unlink log", open, "lseek", "writev 1+1"));
}

TEST_F(LogBackendRotatingTest, DestructorFlushesAndClosesTheFile)
{
    auto backend = make();
    FileCalls calls;
    backend.reset();
    EXPECT_THAT(calls.take(), ElementsAre("fsync", "close"));
}

TEST_F(LogBackendRotatingTest, DestructorOfAClosedBackendCallsNothing)
{
    auto backend = std::make_unique<LogBackendRotating>(path("missing"), "log", kRoomy);
    mSystemLog.take();
    FileCalls calls;
    backend.reset();
    EXPECT_THAT(calls.take(), IsEmpty());
}

TEST_F(LogBackendRotatingTest, WritesLineAndLineEndInOneCall)
{
    const auto backend = make(10);
    FileCalls calls;
    log(*backend, "1234");
    EXPECT_THAT(calls.take(), ElementsAre("writev 4+1"));
    log(*backend, "");
    EXPECT_THAT(calls.take(), ElementsAre("writev 0+1"));
}

TEST_F(LogBackendRotatingTest, ALineCostsNoAllocation)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const auto backend = make();
    const std::string line(100, 'x');
    const Allocations allocations;
    log(*backend, line);
    EXPECT_EQ(allocations.count(), 0U);
}

TEST_F(LogBackendRotatingTest, ReportsAFailedMoveAndGoesOnRotating)
{
    const auto backend = make(2);
    for (char line = '1'; line <= '4'; ++line)
        log(*backend, std::string(1, line));
    ASSERT_EQ(::mkdir(path("log.4").c_str(), 0755), 0); // a file cannot replace a directory
    log(*backend, "5");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(error("Failed to rotate log file " + path("log.3"), "21 (Is a directory)")));
    EXPECT_EQ(files(),
              (Files{{"log", "5\n"}, {"log.1", "4\n"}, {"log.2", "3\n"}, {"log.3", "2\n"}, {"log.4", "<directory>"}}));
}

TEST_F(LogBackendRotatingTest, ReportsEveryFailedMove)
{
    write("log.1", "old\n");
    const auto backend = make(2);
    log(*backend, "a");
    FileCalls calls;
    calls.fail(FileCalls::Rename, EACCES, 4);
    log(*backend, "b");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(error("Failed to rotate log file " + path("log.3"), "13 (Permission denied)"),
                            error("Failed to rotate log file " + path("log.2"), "13 (Permission denied)"),
                            error("Failed to rotate log file " + path("log.1"), "13 (Permission denied)"),
                            error("Failed to rotate log file " + path("log"), "13 (Permission denied)")));
    EXPECT_EQ(files(), (Files{{"log", "b\n"}, {"log.1", "old\n"}})) << "the current file is emptied all the same";
}

TEST_F(LogBackendRotatingTest, TruncatesTheCurrentFileWhenItCanBeNeitherMovedNorRemoved)
{
    const auto backend = make(2);
    log(*backend, "a");
    FileCalls calls;
    calls.fail(FileCalls::Rename, EACCES, 1, 3);
    calls.fail(FileCalls::Unlink, EACCES);
    log(*backend, "b");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(error("Failed to rotate log file " + path("log"), "13 (Permission denied)")));
    EXPECT_EQ(files(), (Files{{"log", "b\n"}})) << "it is truncated when it is opened again";
}

TEST_F(LogBackendRotatingTest, IgnoresAFailedFlush)
{
    auto backend = make(2);
    log(*backend, "a");
    FileCalls calls;
    calls.fail(FileCalls::Fsync, EIO, 2);
    log(*backend, "b");
    backend.reset();
    EXPECT_EQ(files(), (Files{{"log", "b\n"}, {"log.1", "a\n"}}));
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
}

TEST_F(LogBackendRotatingTest, DropsEveryLineAfterAFailedReopen)
{
    ASSERT_EQ(::mkdir(path("here").c_str(), 0755), 0);
    LogBackendRotating backend(LogLevel::Inherit, path("here"), "log", 2);
    log(backend, "a");
    ASSERT_EQ(::rename(path("here").c_str(), path("gone").c_str()), 0);
    log(backend, "b");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(error("Failed to open log " + path("here/log"), "2 (No such file or directory)")))
        << "a file that no longer exists is not a failed move";

    ASSERT_EQ(::rename(path("gone").c_str(), path("here").c_str()), 0);
    FileCalls calls;
    log(backend, "c");
    log(backend, "d");
    EXPECT_THAT(calls.take(), IsEmpty());
    EXPECT_THAT(mSystemLog.take(), IsEmpty()) << "the lines are not counted as dropped";
    EXPECT_EQ(Utilities::readFile(path("here/log")), "a\n");
}

TEST_F(LogBackendRotatingTest, DropsEveryLineAfterAFailedSeekInARotation)
{
    const auto backend = make(2);
    log(*backend, "a");
    FileCalls calls;
    calls.fail(FileCalls::Lseek, EOVERFLOW);
    log(*backend, "b");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(error("Failed to seek log " + path("log"), "75 (Value too large for defined data type)")));
    EXPECT_EQ(calls.take().back(), "close");
    log(*backend, "c");
    EXPECT_THAT(calls.take(), IsEmpty());
    EXPECT_EQ(files(), (Files{{"log", ""}, {"log.1", "a\n"}}));
}

TEST_F(LogBackendRotatingTest, ClosesWithoutAnExceptionWhenARotationRunsOutOfMemory)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    // Long enough that the names of the files do not fit into strings without an allocation.
    const std::string name(100, 'n');
    const std::string line = "b";
    for (std::size_t succeeding = 0; succeeding < 4; ++succeeding) {
        SCOPED_TRACE(succeeding);
        const TemporaryDirectory directory;
        LogBackendRotating backend(LogLevel::Inherit, directory.path(), name, 2);
        log(backend, "a");
        {
            Allocations allocations;
            allocations.failAfter(succeeding);
            log(backend, line);
        }
        log(backend, "c");
        EXPECT_EQ(Utilities::readFile(directory.file(name)), "a\n");
        EXPECT_NE(::access(directory.file(name + ".1").c_str(), F_OK), 0);
        EXPECT_THAT(mSystemLog.take(), IsEmpty());
    }
}

} // namespace
} // namespace qel::test
