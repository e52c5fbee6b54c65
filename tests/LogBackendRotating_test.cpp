#include <qel/common/LogBackendRotating.hpp>
#include <qel/common/QelDebugContext.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/Utilities.hpp>

#include "support/Allocations.hpp"
#include "support/CapturedLog.hpp"
#include "support/CapturedSystemLog.hpp"
#include "support/FileCalls.hpp"
#include "support/TemporaryDirectory.hpp"

#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <dirent.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <map>
#include <memory>
#include <string>
#include <sys/resource.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>
#include <vector>

namespace qel::test {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::StartsWith;

using Files = std::map<std::string, std::string>; // content by name

constexpr std::size_t kRoomy = 1000000;

bool isDirectory(const std::string& path)
{
    struct stat status = {};
    return ::lstat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

bool isLink(const std::string& path)
{
    struct stat status = {};
    return ::lstat(path.c_str(), &status) == 0 && S_ISLNK(status.st_mode);
}

std::uint64_t sizeOf(const std::string& path)
{
    struct stat status = {};
    EXPECT_EQ(::stat(path.c_str(), &status), 0) << path;
    return static_cast<std::uint64_t>(status.st_size);
}

/// A directory for the log files of one test, and what the back-end tells the system log about them.
class LogBackendRotatingTest : public ::testing::Test {
protected:
    std::string path(const std::string& name) const { return mDirectory.file(name); }

    void write(const std::string& name, const std::string& content) { Utilities::writeFile(path(name), content); }
    std::string read(const std::string& name) const { return Utilities::readFile(path(name)); }

    /// The content of the regular files; directories and links show as "<directory>" and "<link>".
    Files files() const
    {
        Files found;
        DIR* const directory = ::opendir(mDirectory.path().c_str());
        if (directory == nullptr) return found;
        while (const struct dirent* const entry = ::readdir(directory)) {
            const std::string name = entry->d_name;
            if (name == "." || name == "..") continue;
            if (isDirectory(path(name))) {
                found[name] = "<directory>";
            } else if (isLink(path(name))) {
                found[name] = "<link>";
            } else {
                found[name] = read(name);
            }
        }
        ::closedir(directory);
        return found;
    }

    /// A back-end that lets everything through and writes to "log".
    std::unique_ptr<LogBackendRotating> make(std::size_t rotateSize = kRoomy) const
    {
        return std::make_unique<LogBackendRotating>(LogLevel::Inherit, mDirectory.path(), "log", rotateSize);
    }

    static void log(LogBackendRotating& backend, const std::string& line) { backend.log(LogLevel::Error, line); }

    /// A message to the system log that ends in ": errno " and the error.
    static SystemLogMessage error(const std::string& text, const std::string& error)
    {
        return {LOG_ERR, text + ": errno " + error};
    }

    TemporaryDirectory mDirectory;
    CapturedSystemLog mSystemLog;
};

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

TEST_F(LogBackendRotatingTest, LinesArriveWithoutDelay)
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

TEST_F(LogBackendRotatingTest, PassesFromWarnUpUnlessTold)
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

TEST_F(LogBackendRotatingTest, NothingReopensItOnceItIsClosed)
{
    LogBackendRotating backend(mDirectory.path() + "/late", "log", kRoomy);
    EXPECT_EQ(mSystemLog.take().size(), 1U);
    ASSERT_EQ(::mkdir(path("late").c_str(), 0755), 0);
    log(backend, "line");
    EXPECT_NE(::access(path("late/log").c_str(), F_OK), 0);
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
}

TEST_F(LogBackendRotatingTest, ReportsAFileThatCannotBeSoughtAndClosesIt)
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

TEST_F(LogBackendRotatingTest, CutsALineThatAFileCannotHold)
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

TEST_F(LogBackendRotatingTest, AFileMayReachTheLimitExactlyAndNotPassIt)
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

TEST_F(LogBackendRotatingTest, CountsWhatAnExistingFileHolds)
{
    write("log", "12345");
    const auto backend = make(10);
    log(*backend, "6789");
    EXPECT_EQ(files(), (Files{{"log", "123456789\n"}}));
    log(*backend, "x");
    EXPECT_EQ(files(), (Files{{"log", "x\n"}, {"log.1", "123456789\n"}}));
}

TEST_F(LogBackendRotatingTest, RotatesAnExistingFileThatIsTooLargeAlready)
{
    write("log", "this was written under a larger limit\n");
    const auto backend = make(10);
    EXPECT_EQ(files().size(), 1U) << "not before a line comes";
    log(*backend, "x");
    EXPECT_EQ(files(), (Files{{"log", "x\n"}, {"log.1", "this was written under a larger limit\n"}}));
}

TEST_F(LogBackendRotatingTest, SevenFullFilesLeaveTheFiveYoungest)
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

TEST_F(LogBackendRotatingTest, KnowsFilesBeyondFourGigabytes)
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

TEST_F(LogBackendRotatingTest, EndsWithFlushingAndClosingItsFile)
{
    auto backend = make();
    FileCalls calls;
    backend.reset();
    EXPECT_THAT(calls.take(), ElementsAre("fsync", "close"));
}

TEST_F(LogBackendRotatingTest, AClosedOneEndsWithoutATouchOnAnyFile)
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

TEST_F(LogBackendRotatingTest, AFailingMoveIsReportedAndTheRotationCarriesOn)
{
    const auto backend = make(2);
    for (char line = '1'; line <= '4'; ++line)
        log(*backend, std::string(1, line));
    ASSERT_EQ(::mkdir(path("log.4").c_str(), 0755), 0); // no file can be moved onto a directory
    log(*backend, "5");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(error("Failed to rotate log file " + path("log.3"), "21 (Is a directory)")));
    EXPECT_EQ(files(),
              (Files{{"log", "5\n"}, {"log.1", "4\n"}, {"log.2", "3\n"}, {"log.3", "2\n"}, {"log.4", "<directory>"}}));
}

TEST_F(LogBackendRotatingTest, EveryFailingMoveIsReported)
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
    EXPECT_EQ(files(), (Files{{"log", "b\n"}, {"log.1", "old\n"}})) << "the current file begins anew all the same";
}

TEST_F(LogBackendRotatingTest, AFailingLastMoveLosesTheCurrentFileThoughItCannotBeRemovedEither)
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

TEST_F(LogBackendRotatingTest, AFailingFlushIsIgnored)
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

TEST_F(LogBackendRotatingTest, AFailedReopenClosesItForEver)
{
    ASSERT_EQ(::mkdir(path("here").c_str(), 0755), 0);
    LogBackendRotating backend(LogLevel::Inherit, path("here"), "log", 2);
    log(backend, "a");
    ASSERT_EQ(::rename(path("here").c_str(), path("gone").c_str()), 0);
    log(backend, "b");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(error("Failed to open log " + path("here/log"), "2 (No such file or directory)")))
        << "files that are not there any more are no failed moves";

    ASSERT_EQ(::rename(path("gone").c_str(), path("here").c_str()), 0);
    FileCalls calls;
    log(backend, "c");
    log(backend, "d");
    EXPECT_THAT(calls.take(), IsEmpty());
    EXPECT_THAT(mSystemLog.take(), IsEmpty()) << "nor are the lines counted as dropped";
    EXPECT_EQ(Utilities::readFile(path("here/log")), "a\n");
}

TEST_F(LogBackendRotatingTest, AFailedSeekAfterARotationClosesItForEverToo)
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

TEST_F(LogBackendRotatingTest, RunningOutOfMemoryInARotationClosesItWithoutAnException)
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

// Failed writes

TEST_F(LogBackendRotatingTest, AFullDiskIsReportedOnceForARunOfLostLines)
{
    ASSERT_EQ(::symlink("/dev/full", path("log").c_str()), 0);
    const auto backend = make();
    for (int i = 0; i < 3; ++i)
        log(*backend, "line");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(error("cannot write to log " + path("log"), "28 (No space left on device)")));
}

TEST_F(LogBackendRotatingTest, TheFirstWriteThatSucceedsAgainReportsHowManyLinesWereLost)
{
    const auto backend = make();
    log(*backend, "before");
    FileCalls calls;
    calls.fail(FileCalls::Writev, ENOSPC, 3);
    for (int i = 0; i < 3; ++i)
        log(*backend, "lost");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(error("cannot write to log " + path("log"), "28 (No space left on device)")));
    log(*backend, "after");
    EXPECT_THAT(mSystemLog.take(),
                ElementsAre(SystemLogMessage{LOG_INFO, "log " + path("log") +
                                                           " recovered after write error: 3 messages were dropped"}));
    log(*backend, "and on");
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
    EXPECT_EQ(read("log"), "before\nafter\nand on\n");
}

TEST_F(LogBackendRotatingTest, EveryRunOfFailuresIsReportedAnew)
{
    const auto backend = make();
    for (int run = 0; run < 2; ++run) {
        SCOPED_TRACE(run);
        FileCalls calls;
        calls.fail(FileCalls::Writev, EIO);
        log(*backend, "lost");
        EXPECT_THAT(mSystemLog.take(),
                    ElementsAre(error("cannot write to log " + path("log"), "5 (Input/output error)")));
        log(*backend, "line");
        EXPECT_THAT(mSystemLog.take(),
                    ElementsAre(SystemLogMessage{
                        LOG_INFO, "log " + path("log") + " recovered after write error: 1 messages were dropped"}));
    }
}

TEST_F(LogBackendRotatingTest, AFailedWriteDoesNotCountTowardsTheLimit)
{
    const auto backend = make(10);
    FileCalls calls;
    calls.fail(FileCalls::Writev, ENOSPC);
    log(*backend, "lost line");
    log(*backend, "123456789");
    EXPECT_EQ(files(), (Files{{"log", "123456789\n"}}));
    EXPECT_EQ(mSystemLog.take().size(), 2U);
}

TEST_F(LogBackendRotatingTest, AShortWriteIsASuccessOfSoManyBytes)
{
    const auto backend = make(10);
    FileCalls calls;
    calls.shortenNextWrite(3);
    log(*backend, "abcdefgh");
    log(*backend, "123456");
    EXPECT_EQ(files(), (Files{{"log", "abc123456\n"}})) << "3 + 6 + 1 bytes fit";
    log(*backend, "");
    EXPECT_EQ(files(), (Files{{"log", "\n"}, {"log.1", "abc123456\n"}}));
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
}

TEST_F(LogBackendRotatingTest, ALimitOnTheFileSizeCutsALineAndFailsTheNext)
{
    const auto backend = make();
    struct rlimit before = {};
    ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &before), 0);
    const auto handler = std::signal(SIGXFSZ, SIG_IGN);
    struct rlimit limit = before;
    limit.rlim_cur = 8;
    ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &limit), 0);
    log(*backend, "12345");
    log(*backend, "67890");
    log(*backend, "lost");
    ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &before), 0);
    std::signal(SIGXFSZ, handler);
    EXPECT_EQ(read("log"), "12345\n67");
    EXPECT_THAT(mSystemLog.take(), ElementsAre(error("cannot write to log " + path("log"), "27 (File too large)")));
    log(*backend, "on");
    EXPECT_EQ(read("log"), "12345\n67on\n");
    EXPECT_EQ(mSystemLog.take().size(), 1U);
}

TEST_F(LogBackendRotatingTest, ALostLineBeforeARotationIsReportedAfterIt)
{
    const auto backend = make(4);
    FileCalls calls;
    log(*backend, "ab");
    calls.fail(FileCalls::Writev, ENOSPC);
    log(*backend, "");
    EXPECT_EQ(mSystemLog.take().size(), 1U);
    log(*backend, "cd");
    EXPECT_EQ(files(), (Files{{"log", "cd\n"}, {"log.1", "ab\n"}}));
    EXPECT_EQ(mSystemLog.take().size(), 1U) << "the count outlives the file";
}

TEST_F(LogBackendRotatingTest, RunningOutOfMemoryCostsTheTextOfTheErrorAtMost)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const std::string line = "lost";
    for (std::size_t succeeding = 0; succeeding < 4; ++succeeding) {
        SCOPED_TRACE(succeeding);
        const auto backend = make();
        {
            FileCalls calls;
            calls.fail(FileCalls::Writev, ENOSPC);
            Allocations allocations;
            allocations.failAfter(succeeding);
            log(*backend, line);
        }
        const std::vector<SystemLogMessage> messages = mSystemLog.take();
        ASSERT_EQ(messages.size(), 1U);
        EXPECT_EQ(messages[0].priority, LOG_ERR);
        EXPECT_THAT(messages[0].text, StartsWith("cannot write to log " + path("log") + ": errno "));
    }
}

TEST_F(LogBackendRotatingTest, ItsTroubleNeverReachesTheLogger)
{
    const CapturedLog captured;
    ASSERT_EQ(::symlink("/dev/full", path("log").c_str()), 0);
    QelLogger::get().addBackend(make());
    QelDebugContext(QelLogger::get(), LogLevel::Error) << "text";
    EXPECT_THAT(captured.lines(), ElementsAre("E: text"));
    EXPECT_EQ(mSystemLog.take().size(), 1U);
}

TEST_F(LogBackendRotatingTest, GetsTheLinesOfTheLogger)
{
    const CapturedLog captured;
    LogBackend::registerBackend(make());
    QelDebugContext(QelLogger::get(), LogLevel::Error) << "text";
    ASSERT_EQ(captured.rawLines().size(), 1U);
    EXPECT_EQ(read("log"), captured.rawLines()[0] + "\n");
}

// Healing what an interrupted rotation left behind

struct RepairCase {
    const char* name;
    // In place of content: "<directory>"; "<link>", to nowhere; ">name", a link to that; "=name", a second name of
    // that.
    Files before;
    Files after; // with the current file created when it is missing
};

void PrintTo(const RepairCase& repair, std::ostream* os) { *os << repair.name; }

class LogBackendRotatingRepair : public LogBackendRotatingTest, public ::testing::WithParamInterface<RepairCase> {
protected:
    void arrange(const Files& wanted)
    {
        for (const auto& [name, content] : wanted) {
            if (content == "<directory>") {
                ASSERT_EQ(::mkdir(path(name).c_str(), 0755), 0);
            } else if (content == "<link>") {
                ASSERT_EQ(::symlink("nowhere/at/all", path(name).c_str()), 0);
            } else if (content[0] == '>') {
                ASSERT_EQ(::symlink(content.c_str() + 1, path(name).c_str()), 0);
            } else if (content[0] == '=') {
                ASSERT_EQ(::link(path(content.substr(1)).c_str(), path(name).c_str()), 0);
            } else {
                write(name, content);
            }
        }
    }
};

TEST_P(LogBackendRotatingRepair, LeavesFilesWithoutAGap)
{
    arrange(GetParam().before);
    const auto backend = make();
    EXPECT_EQ(files(), GetParam().after);
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
}

std::string nameOfCase(const ::testing::TestParamInfo<RepairCase>& repair) { return repair.param.name; }

INSTANTIATE_TEST_SUITE_P(
    Cases, LogBackendRotatingRepair,
    ::testing::Values(
        RepairCase{"NothingThere", {}, {{"log", ""}}},
        RepairCase{"NoGap",
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "2"}, {"log.3", "3"}, {"log.4", "4"}},
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "2"}, {"log.3", "3"}, {"log.4", "4"}}},
        RepairCase{"CurrentOnly", {{"log", "0"}}, {{"log", "0"}}},
        RepairCase{"GapInTheMiddle",
                   {{"log", "0"}, {"log.2", "2"}, {"log.3", "3"}},
                   {{"log", "0"}, {"log.1", "2"}, {"log.2", "3"}}},
        RepairCase{"CurrentMissing", {{"log.1", "1"}}, {{"log", "1"}}},
        RepairCase{"CurrentMissingOfAll",
                   {{"log.1", "1"}, {"log.2", "2"}, {"log.3", "3"}, {"log.4", "4"}},
                   {{"log", "1"}, {"log.1", "2"}, {"log.2", "3"}, {"log.3", "4"}}},
        RepairCase{"OldestOnly", {{"log.4", "4"}}, {{"log", "4"}}},
        RepairCase{"CurrentAndOldest", {{"log", "0"}, {"log.4", "4"}}, {{"log", "0"}, {"log.1", "4"}}},
        RepairCase{"SeveralGaps", {{"log.1", "1"}, {"log.3", "3"}}, {{"log", "1"}, {"log.1", "3"}}},
        RepairCase{"BeyondTheOldestIsNotOurs", {{"log", "0"}, {"log.5", "5"}}, {{"log", "0"}, {"log.5", "5"}}},
        RepairCase{
            "OtherNamesAreNotOurs", {{"logs", "x"}, {"log.1x", "y"}}, {{"log", ""}, {"logs", "x"}, {"log.1x", "y"}}},
        RepairCase{"SecondNameOfTheCurrentFile",
                   {{"log", "0"}, {"log.1", "=log"}, {"log.2", "2"}},
                   {{"log", "0"}, {"log.1", "2"}}},
        RepairCase{"SecondNameOfTheOldestFile",
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "2"}, {"log.3", "3"}, {"log.4", "=log.3"}},
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "2"}, {"log.3", "3"}}},
        RepairCase{"SecondNameAfterAGap",
                   {{"log.1", "1"}, {"log.2", "=log.1"}, {"log.3", "3"}},
                   {{"log", "1"}, {"log.1", "3"}}},
        RepairCase{
            "SecondNameAcrossAGap", {{"log", "0"}, {"log.2", "=log"}, {"log.3", "3"}}, {{"log", "0"}, {"log.1", "3"}}},
        RepairCase{"ThirdName",
                   {{"log", "0"}, {"log.1", "=log"}, {"log.2", "=log"}, {"log.3", "3"}},
                   {{"log", "0"}, {"log.1", "3"}}},
        RepairCase{"SecondNameThatIsNoNeighbourStays",
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "=log"}},
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "0"}}},
        RepairCase{"ALinkIsAGap",
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "<link>"}, {"log.3", "3"}},
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "3"}}},
        RepairCase{"ALinkToAFileIsAGapToo",
                   {{"log", "0"}, {"log.1", ">other"}, {"log.2", "2"}, {"other", "x"}},
                   {{"log", "0"}, {"log.1", "2"}, {"other", "x"}}},
        RepairCase{"ALinkToTheCurrentFileIsNoSecondNameOfIt",
                   {{"log", "0"}, {"log.1", ">log"}},
                   {{"log", "0"}, {"log.1", "<link>"}}},
        RepairCase{"ALinkInPlaceOfTheCurrentFileIsReplaced", {{"log", "<link>"}, {"log.1", "1"}}, {{"log", "1"}}},
        RepairCase{
            "ALinkWithNothingAfterItStays", {{"log", "0"}, {"log.1", "<link>"}}, {{"log", "0"}, {"log.1", "<link>"}}},
        RepairCase{"ADirectoryIsAGapThatStopsTheRepair",
                   {{"log", "0"}, {"log.1", "<directory>"}, {"log.2", "2"}, {"log.4", "4"}},
                   {{"log", "0"}, {"log.1", "<directory>"}, {"log.2", "2"}, {"log.4", "4"}}},
        RepairCase{"ADirectoryAfterAGapIsPassedOver",
                   {{"log", "0"}, {"log.2", "<directory>"}, {"log.3", "3"}},
                   {{"log", "0"}, {"log.1", "3"}, {"log.2", "<directory>"}}}),
    nameOfCase);

TEST_F(LogBackendRotatingTest, TheNewestOlderFileIsAppendedToWhenTheCurrentOneIsMissing)
{
    write("log.1", "1\n");
    const auto backend = make();
    log(*backend, "next");
    EXPECT_EQ(files(), (Files{{"log", "1\nnext\n"}}));
}

TEST_F(LogBackendRotatingTest, ADirectoryInPlaceOfTheCurrentFileStopsTheRepairAndTheOpening)
{
    ASSERT_EQ(::mkdir(path("log").c_str(), 0755), 0);
    write("log.1", "1");
    const auto backend = make();
    EXPECT_EQ(files(), (Files{{"log", "<directory>"}, {"log.1", "1"}}));
    EXPECT_THAT(mSystemLog.take(), ElementsAre(error("Failed to open log " + path("log"), "21 (Is a directory)")))
        << "what stopped the repair is not reported";
}

TEST_F(LogBackendRotatingTest, AFailingMoveStopsTheRepairSilently)
{
    write("log", "0");
    write("log.2", "2");
    write("log.3", "3");
    FileCalls calls;
    calls.fail(FileCalls::Rename, EACCES);
    const auto backend = make();
    EXPECT_EQ(files(), (Files{{"log", "0"}, {"log.2", "2"}, {"log.3", "3"}}));
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
}

TEST_F(LogBackendRotatingTest, AFailingRemovalStopsTheRepairSilently)
{
    write("log", "0");
    ASSERT_EQ(::link(path("log").c_str(), path("log.1").c_str()), 0);
    write("log.3", "3");
    FileCalls calls;
    calls.fail(FileCalls::Unlink, EACCES);
    const auto backend = make();
    EXPECT_EQ(files(), (Files{{"log", "0"}, {"log.1", "0"}, {"log.3", "3"}}));
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
}

TEST_F(LogBackendRotatingTest, RepairsBeforeOpening)
{
    write("log.1", "1");
    FileCalls calls;
    const auto backend = make();
    EXPECT_EQ(calls.take().front(), "rename log.1 log");
}

TEST_F(LogBackendRotatingTest, DoesNotRepairOnRotation)
{
    const auto backend = make(2);
    log(*backend, "a");
    log(*backend, "b");
    log(*backend, "c");
    ASSERT_EQ(::unlink(path("log.1").c_str()), 0);
    log(*backend, "d");
    EXPECT_EQ(files(), (Files{{"log", "d\n"}, {"log.1", "c\n"}, {"log.3", "a\n"}}));
}

} // namespace
} // namespace qel::test
