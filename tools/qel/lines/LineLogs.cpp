#include "lines/LineLogs.hpp"

#include "base/OptionChecks.hpp"

#include <algorithm>
#include <filesystem>
#include <system_error>

namespace qel::tool {

std::string directoryProblem(const std::string& name)
{
    std::error_code error; // ignored: what cannot be examined is not a directory to write to
    if (std::filesystem::is_directory(name, error)) return {};
    return "\"" + name + "\" is not a directory";
}

void addLineLogOptions(CLI::App& command, LineLogOptions& options)
{
    command
        .add_option("--line-log", options.directory,
                    "Log the output of each partition in this directory: NAME.raw has the bytes, NAME.log lines of "
                    "text with their times; each with four older files")
        ->type_name("DIR")
        ->check(CLI::Validator([](const std::string& name) { return directoryProblem(name); }, ""));
    command.add_option("--line-log-size", options.fileBytes, "Maximum size of one file of --line-log")
        ->type_name("BYTES")
        ->transform(integerIn(4096, std::uint64_t{1} << 40))
        ->capture_default_str();
}

std::shared_ptr<protocol::SerialTap> LineLogs::open(std::uint16_t partition, const std::string& name,
                                                    const std::string& directory)
{
    if (directory.empty()) return nullptr;
    const std::string fileName = LineLog::fileName(partition, name);
    const std::string path = (std::filesystem::path(directory) / fileName).string();
    mLogs.erase(std::remove_if(mLogs.begin(), mLogs.end(), [](const Entry& entry) { return entry.log.expired(); }),
                mLogs.end());
    for (const Entry& entry : mLogs) {
        if (entry.path == path) return entry.log.lock();
    }
    auto log = std::make_shared<LineLog>(directory, fileName, mFileBytes);
    mLogs.push_back({path, log});
    return log;
}

void LineLogs::rotate()
{
    for (const Entry& entry : mLogs) {
        const std::shared_ptr<LineLog> log = entry.log.lock();
        if (log != nullptr) log->rotate();
    }
}

} // namespace qel::tool
