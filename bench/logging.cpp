#include <qel/common/LogBackend.hpp>
#include <qel/common/LogBackendRotating.hpp>
#include <qel/common/QelDebug.hpp>
#include <qel/common/QelDebugContext.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "Contest.hpp"

#include <cstring>
#include <fcntl.h>
#include <memory>
#include <mutex>
#include <spdlog/sinks/base_sink.h>
#include <spdlog/sinks/rotating_file_sink.h>
#include <spdlog/spdlog.h>
#include <string>
#include <sys/uio.h>
#include <thread>
#include <unistd.h>

namespace qel::bench {

namespace {

constexpr std::size_t kRotateSize = 64 * 1024 * 1024;
constexpr std::size_t kOlderFiles = 4;
constexpr int kLinesOfThread = 1000;
constexpr char kSamePrefix[] = "[%Y-%m-%d %H:%M:%S] (%P:%t) (%L): %v"; // what our lines begin with

/// Takes the finished line and drops it.
class DroppingBackend : public LogBackend {
public:
    void log(LogLevel::Level, const std::string& line) override { benchmark::DoNotOptimize(line.data()); }
};

/// Formats as every sink of spdlog that writes does, and drops the text.
template <typename Mutex>
class DroppingSink : public spdlog::sinks::base_sink<Mutex> {
protected:
    void sink_it_(const spdlog::details::log_msg& message) override
    {
        spdlog::memory_buf_t formatted;
        spdlog::sinks::base_sink<Mutex>::formatter_->format(message, formatted);
        benchmark::DoNotOptimize(formatted.data());
    }
    void flush_() override {}
};

/// Gives the root logger one back-end for as long as it lives.
class OurLog {
public:
    explicit OurLog(const std::shared_ptr<LogBackend>& backend)
    {
        QelDebug::globals().resetLoggers();
        QelLogger::get().setLevel(LogLevel::Info);
        QelLogger::get().addBackend(backend);
    }
    ~OurLog() { QelDebug::globals().resetLoggers(); }
    OurLog(const OurLog&) = delete;
    OurLog& operator=(const OurLog&) = delete;
};

void ourLine(unsigned int number)
{
    QelLogger& logger = QelLogger::get();
    if (!logger.isLevelEnabled(LogLevel::Error)) return;
    QelDebugContext line(logger, LogLevel::Error);
    line << "bad header MsgLength = " << hexFormat(number);
}

std::shared_ptr<spdlog::logger> spdLogger(spdlog::sink_ptr sink)
{
    auto logger = std::make_shared<spdlog::logger>("", std::move(sink));
    logger->set_pattern(kSamePrefix, spdlog::pattern_time_type::utc);
    logger->set_level(spdlog::level::info);
    logger->flush_on(spdlog::level::trace);
    return logger;
}

void spdLine(spdlog::logger& logger, unsigned int number) { logger.error("bad header MsgLength = 0x{:08X}", number); }

void disabledOurs(benchmark::State& state)
{
    const OurLog log(std::make_shared<DroppingBackend>());
    unsigned int number = 0;
    for (auto _ : state) {
        if (QelLogger::get().isLevelEnabled(LogLevel::Debug)) {
            QelDebugContext line(QelLogger::get(), LogLevel::Debug);
            line << "number " << number;
        }
        benchmark::DoNotOptimize(++number);
    }
}

void disabledSpdlog(benchmark::State& state)
{
    const auto before = spdlog::default_logger();
    spdlog::set_default_logger(spdLogger(std::make_shared<DroppingSink<std::mutex>>()));
    unsigned int number = 0;
    for (auto _ : state) {
        spdlog::debug("number {}", number);
        benchmark::DoNotOptimize(++number);
    }
    spdlog::set_default_logger(before);
}

void countOnly(benchmark::State& state)
{
    unsigned int number = 0;
    for (auto _ : state)
        benchmark::DoNotOptimize(++number);
}

void composeOurs(benchmark::State& state)
{
    const OurLog log(std::make_shared<DroppingBackend>());
    unsigned int number = 0;
    for (auto _ : state)
        ourLine(++number);
}

void composeSpdlog(benchmark::State& state)
{
    const auto logger = spdLogger(std::make_shared<DroppingSink<std::mutex>>());
    unsigned int number = 0;
    for (auto _ : state)
        spdLine(*logger, ++number);
}

// The text is ready: it only has to get into memory of its own.
void copyReadyLine(benchmark::State& state)
{
    const std::string ready = "[2026-03-01 17:04:09] (4711:4719) (E): bad header MsgLength = 0x00000001";
    for (auto _ : state) {
        std::string copy(ready);
        benchmark::DoNotOptimize(copy.data());
    }
}

void fileOurs(benchmark::State& state, const std::string& folder)
{
    const OurLog log(std::make_shared<LogBackendRotating>(LogLevel::Info, folder, "ours", kRotateSize));
    unsigned int number = 0;
    for (auto _ : state)
        ourLine(++number);
}

template <typename Sink>
std::shared_ptr<spdlog::logger> spdRotating(const std::string& folder)
{
    return spdLogger(std::make_shared<Sink>(folder + "/spdlog", kRotateSize, kOlderFiles));
}

void fileSpdlog(benchmark::State& state, const std::string& folder)
{
    const auto logger = spdRotating<spdlog::sinks::rotating_file_sink_mt>(folder);
    unsigned int number = 0;
    for (auto _ : state)
        spdLine(*logger, ++number);
}

// One gathered write of a line that is ready.
void fileFloor(benchmark::State& state, const std::string& folder)
{
    const std::string path = folder + "/floor";
    const int file = ::open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    std::string ready = "[2026-03-01 17:04:09] (4711:4719) (E): bad header MsgLength = 0x00000001";
    std::string end = "\n";
    iovec pieces[2] = {{ready.data(), ready.size()}, {end.data(), end.size()}};
    std::size_t written = 0;
    for (auto _ : state) {
        const ssize_t count = ::writev(file, pieces, 2);
        if (count < 0) state.SkipWithError("writev failed");
        written += static_cast<std::size_t>(count);
        if (written < kRotateSize) continue;
        // As little file as the contestants leave: what is measured is the writing, not a disk that fills.
        written = 0;
        if (::ftruncate(file, 0) != 0 || ::lseek(file, 0, SEEK_SET) != 0) state.SkipWithError("no rewind");
    }
    ::close(file);
}

/// Runs the work on two threads at once, kLinesOfThread times on each.
template <typename Work>
void onTwoThreads(benchmark::State& state, const Work& work)
{
    const auto lines = [&work] {
        for (unsigned int i = 0; i < kLinesOfThread; ++i)
            work(i);
    };
    for (auto _ : state) {
        std::thread other(lines);
        lines();
        other.join();
    }
}

void twoThreadsOurs(benchmark::State& state, const std::string& folder)
{
    const OurLog log(std::make_shared<LogBackendRotating>(LogLevel::Info, folder, "ours2", kRotateSize));
    onTwoThreads(state, [](unsigned int number) { ourLine(number); });
}

void twoThreadsSpdlog(benchmark::State& state, const std::string& folder)
{
    const auto logger = spdRotating<spdlog::sinks::rotating_file_sink_mt>(folder);
    onTwoThreads(state, [&logger](unsigned int number) { spdLine(*logger, number); });
}

Contest::Body in(const std::string& folder, void (*body)(benchmark::State&, const std::string&))
{
    return [folder, body](benchmark::State& state) { body(state, folder); };
}

} // namespace

void addLoggingContests(const std::string& memoryFolder, const std::string& diskFolder)
{
    contest("log: a call at a disabled level")
        .ours(disabledOurs)
        .floor("counting only", 0, countOnly)
        .peer("spdlog: a disabled call", 0.95, disabledSpdlog);
    contest("log: compose a line, hand it over")
        .ours(composeOurs)
        .floor("a copy of the ready line", 0, copyReadyLine)
        .peer("spdlog: format the same line", 0.72, composeSpdlog);
    contest("log: a line into the rotating file, tmpfs")
        .ours(in(memoryFolder, fileOurs))
        .floor("writev of a ready line", 0, in(memoryFolder, fileFloor))
        .peer("spdlog: flushing each line", 0.93, in(memoryFolder, fileSpdlog));
    contest("log: a line into the rotating file, disk")
        .ours(in(diskFolder, fileOurs))
        .floor("writev of a ready line", 0, in(diskFolder, fileFloor))
        .peer("spdlog: flushing each line", 1.0, in(diskFolder, fileSpdlog));
    contest("log: 2 x 1000 lines from two threads, tmpfs")
        .ours(in(memoryFolder, twoThreadsOurs))
        .peer("spdlog: flushing each line", 0.96, in(memoryFolder, twoThreadsSpdlog));
}

} // namespace qel::bench
