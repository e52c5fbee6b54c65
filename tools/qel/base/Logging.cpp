#include "base/Logging.hpp"

#include <qel/common/LogBackendFiltered.hpp>
#include <qel/common/LogBackendRotating.hpp>
#include <qel/common/Utilities.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/UniqueFd.hpp>
#include <qel/protocol/LogBackendThrottled.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"
#include "base/OptionChecks.hpp"
#include "base/TerminalMode.hpp"
#include "base/UsageErrors.hpp"

#include <algorithm>
#include <array>
#include <cctype>
#include <cerrno>
#include <cstring>
#include <exception>
#include <fcntl.h>
#include <filesystem>
#include <memory>
#include <sstream>
#include <sys/uio.h>
#include <system_error>
#include <unistd.h>
#include <utility>

namespace qel::tool {

namespace {

/// Lines to standard error: standard output belongs to what the commands print. Output errors are ignored. It allocates
/// nothing, since an exception in a back-end ends the process.
class LogBackendStderr final : public LogBackendFiltered {
public:
    LogBackendStderr() : LogBackendFiltered(LogLevel::Inherit) {}

private:
    void pLog(const std::string& line) noexcept override
    {
        const char* const lineEnd = lineEndOf(STDERR_FILENO);
        // One call for each line, so that lines of several processes on a terminal do not mix.
        std::array<iovec, 2> pieces{
            {{const_cast<char*>(line.data()), line.size()}, {const_cast<char*>(lineEnd), std::strlen(lineEnd)}}};
        while (pieces.back().iov_len > 0) {
            const ssize_t written = ::writev(STDERR_FILENO, pieces.data(), static_cast<int>(pieces.size()));
            if (written < 0 && errno != EINTR) return;
            if (written > 0) pSkip(pieces, static_cast<std::size_t>(written));
        }
    }

    /// Leaves what has not been written: a full pipe takes a part of a line.
    static void pSkip(std::array<iovec, 2>& pieces, std::size_t written) noexcept
    {
        for (iovec& piece : pieces) {
            const std::size_t taken = std::min(written, piece.iov_len);
            piece.iov_base = static_cast<char*>(piece.iov_base) + taken;
            piece.iov_len -= taken;
            written -= taken;
        }
    }
};

/// Stricter than LogLevel::parse(), which accepts text after a number, and "inherit".
bool isLevel(const std::string& text)
{
    try {
        const LogLevel::Level level = LogLevel::parse(text);
        const bool isName = std::isalpha(static_cast<unsigned char>(text.front())) != 0;
        return level != LogLevel::Inherit && (isName || text.size() == 1);
    } catch (const std::exception&) {
        return false;
    }
}

std::string checkLevel(std::string& text)
{
    if (isLevel(text)) return {};
    const std::string guess = nearestWord(text, {"debug", "info", "warn", "error", "critical"});
    return tool::quoted(text) + " is not a log level: debug, info, warn, error or critical" +
           (guess.empty() ? "" : "; did you mean " + tool::quoted(guess) + "?");
}

std::string checkDirectory(std::string& name)
{
    std::error_code error; // ignored: what cannot be examined is not a directory to write to
    return std::filesystem::is_directory(name, error) ? std::string() : tool::quoted(name) + " is not a directory";
}

std::string describeLevels(const LogOptions& options)
{
    const std::string usual = Utilities::lowercase(LogLevel::getName(options.usual));
    return "Log lines of this level and above: debug, info, warn, error or critical (default: " +
           (options.quiet ? "no log; with --log-dir " + usual : usual) + ")";
}

/// The back-end drops lines silently when it cannot open its file, so check that first.
void requireWritable(const std::string& path)
{
    const UniqueFd file(::open(path.c_str(), O_WRONLY | O_APPEND | O_NONBLOCK | O_CLOEXEC));
    const PosixErrorCode error = errno;
    if (file.get() < 0) throw FileIOError(error, "cannot write the log " + path);
}

/// No peer of "qel serve" may push the lines about the others out of the log.
void registerThrottled(std::shared_ptr<LogBackend> backend)
{
    LogBackend::registerBackend(std::make_shared<LogBackendThrottled>(std::move(backend)));
}

} // namespace

void addLogOptions(CLI::App& app, LogOptions& options)
{
    app.add_option("--log-dir", options.directory,
                   "Write the log to files in this directory, at most five, instead of standard error")
        ->type_name("DIR")
        ->check(CLI::Validator(checkDirectory, ""));
    app.add_option("--log-level", options.level, describeLevels(options))
        ->type_name("LEVEL")
        ->check(CLI::Validator(checkLevel, ""));
    app.add_option("--log-size", options.fileBytes, "Maximum size of one log file")
        ->type_name("BYTES")
        ->transform(integerIn(4096, std::uint64_t{1} << 40))
        ->capture_default_str();
}

void startLogging(const LogOptions& options, const std::string& name)
{
    if (options.quiet && options.directory.empty() && options.level.empty()) return;
    QelLogger::get().setLevel(options.level.empty() ? options.usual : LogLevel::parse(options.level));
    if (options.directory.empty()) {
        registerThrottled(std::make_shared<LogBackendStderr>());
    } else {
        registerThrottled(
            std::make_shared<LogBackendRotating>(LogLevel::Inherit, options.directory, name, options.fileBytes));
        requireWritable(options.directory + "/" + name);
    }
}

} // namespace qel::tool
