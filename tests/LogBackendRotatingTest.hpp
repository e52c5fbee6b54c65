#pragma once

#include <qel/common/LogBackendRotating.hpp>
#include <qel/common/Utilities.hpp>

#include "support/CapturedSystemLog.hpp"
#include "support/TemporaryDirectory.hpp"

#include <cstddef>
#include <dirent.h>
#include <gtest/gtest.h>
#include <map>
#include <memory>
#include <string>
#include <sys/stat.h>
#include <syslog.h>

/// @file
/// What the tests of the rotating back-end share.

namespace qel::test {

using Files = std::map<std::string, std::string>; // content by name

constexpr std::size_t kRoomy = 1000000; // a limit that no test reaches

inline bool isDirectory(const std::string& path)
{
    struct stat status = {};
    return ::lstat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

inline bool isLink(const std::string& path)
{
    struct stat status = {};
    return ::lstat(path.c_str(), &status) == 0 && S_ISLNK(status.st_mode);
}

/// A directory for the log files of one test, and what the back-end reports about them to the system log.
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

    /// A back-end that passes every level and writes to "log".
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

} // namespace qel::test
