#include <qel/common/LogBackendStdout.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/Utilities.hpp>

#include "support/CapturedLog.hpp"
#include "support/TemporaryDirectory.hpp"

#include <cstdio>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

namespace qel::test {
namespace {

/// Redirects the standard output of the process to a file for its lifetime.
class StdoutInFile {
public:
    explicit StdoutInFile(const std::string& path)
    {
        std::fflush(stdout);
        mSaved = ::dup(STDOUT_FILENO);
        const int file = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
        if (mSaved < 0 || file < 0 || ::dup2(file, STDOUT_FILENO) < 0) ADD_FAILURE() << "cannot redirect the output";
        ::close(file);
    }
    ~StdoutInFile()
    {
        std::fflush(stdout);
        ::dup2(mSaved, STDOUT_FILENO);
        ::close(mSaved);
    }
    StdoutInFile(const StdoutInFile&) = delete;
    StdoutInFile& operator=(const StdoutInFile&) = delete;

private:
    int mSaved = -1;
};

TEST(LogBackendStdout, WritesTheLineAndALineEnd)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("output");
    {
        const StdoutInFile redirected(path);
        LogBackendStdout backend;
        backend.log(LogLevel::Warn, "first");
        backend.log(LogLevel::Critical, "");
        backend.log(LogLevel::Error, "two\nlines");
    }
    EXPECT_EQ(Utilities::readFile(path), "first\n\ntwo\nlines\n");
}

TEST(LogBackendStdout, CutsALineAtItsFirstNullByte)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("output");
    {
        const StdoutInFile redirected(path);
        LogBackendStdout().log(LogLevel::Warn, std::string("before\0after", 12));
    }
    EXPECT_EQ(Utilities::readFile(path), "before\n");
}

TEST(LogBackendStdout, FiltersByItsThreshold)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("output");
    {
        const StdoutInFile redirected(path);
        LogBackendStdout byDefault;
        byDefault.log(LogLevel::Info, "info");
        byDefault.log(LogLevel::Warn, "warn");
        LogBackendStdout everything(LogLevel::Inherit);
        everything.log(LogLevel::Debug, "debug");
        everything.setLogLevel(LogLevel::Critical);
        everything.log(LogLevel::Error, "error");
    }
    EXPECT_EQ(Utilities::readFile(path), "warn\ndebug\n");
}

TEST(LogBackendStdout, ReceivesTheLinesOfTheLogger)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("output");
    {
        const CapturedLog log;
        const StdoutInFile redirected(path);
        LogBackend::registerBackend(std::make_shared<LogBackendStdout>(LogLevel::Debug));
        QelLogger::get().send(LogLevel::Debug, "through the logger");
    }
    EXPECT_EQ(Utilities::readFile(path), "through the logger\n");
}

// The buffer of a stream can only be chosen before its first use, so these two tests run in a process of their own.

TEST(LogBackendStdout, DoesNotFlush)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("output");
    const auto logToFullyBufferedFile = [&path] {
        if (std::freopen(path.c_str(), "w", stdout) == nullptr) ::_exit(2);
        static char sBuffer[4096];
        if (std::setvbuf(stdout, sBuffer, _IOFBF, sizeof(sBuffer)) != 0) ::_exit(3);
        LogBackendStdout().log(LogLevel::Warn, "line");
        struct stat status = {};
        if (::stat(path.c_str(), &status) != 0 || status.st_size != 0) ::_exit(4);
        std::fflush(stdout);
        ::_exit(0);
    };
    EXPECT_EXIT(logToFullyBufferedFile(), ::testing::ExitedWithCode(0), "");
    EXPECT_EQ(Utilities::readFile(path), "line\n");
}

TEST(LogBackendStdout, IgnoresOutputErrors)
{
    const auto logToFullDevice = [] {
        if (std::freopen("/dev/full", "w", stdout) == nullptr) ::_exit(2);
        if (std::setvbuf(stdout, nullptr, _IONBF, 0) != 0) ::_exit(3);
        LogBackendStdout backend;
        backend.log(LogLevel::Warn, "lost");
        backend.log(LogLevel::Warn, "lost too");
        ::_exit(std::ferror(stdout) != 0 ? 0 : 4);
    };
    EXPECT_EXIT(logToFullDevice(), ::testing::ExitedWithCode(0), "");
}

} // namespace
} // namespace qel::test
