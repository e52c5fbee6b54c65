#include <qel/common/QelDebugContext.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <ctime>
#include <locale>
#include <pthread.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace qel {

namespace {

// Counts forks, so that a thread can see that its ids may be stale. Starts at 1: the zero-initialised prefix of a new
// thread is out of date.
std::atomic<std::uint64_t> sForkGeneration{1};

void noteFork() { sForkGeneration.fetch_add(1, std::memory_order_relaxed); }

/// Arranges for noteFork to run after every fork, in the parent and in the child.
/// @return false if that failed
bool watchForks()
{
    static const bool sWatching = ::pthread_atfork(nullptr, noteFork, noteFork) == 0;
    return sWatching;
}

/// The prefix of a thread's latest line. Most lines share their second and ids with the line before; breaking down the
/// time and asking for the ids costs several times as much as the rest of the line.
/// Plain zero-initialised data without a destructor: a thread-local object of this kind needs no guard.
struct Prefix {
    std::time_t second;
    bool hasTime;             // false if the clock failed
    std::uint64_t generation; // of the ids; 0 if they must not be reused
    long processId;
    long threadId;
    std::size_t length;
    char text[128]; // "[2026-03-01 17:04:09] (4711:4719) (E): ", complete but for the level
};

thread_local Prefix tPrefix;

constexpr std::size_t kLevelFromEnd = 4; // the level's letter precedes "): "

/// Reads the clock in force. A substitute may throw; the line then goes out without a time.
/// @return whether the clock gave a time
bool readClock(std::time_t& second) noexcept
{
    try {
        second = std::chrono::system_clock::to_time_t(TimeProvider::system());
        return true;
    } catch (...) {
        return false;
    }
}

void compose(Prefix& prefix, std::uint64_t generation)
{
    if (prefix.generation != generation) {
        prefix.generation = watchForks() ? generation : 0;
        prefix.processId = ::getpid();
        prefix.threadId = ::syscall(SYS_gettid); // glibc before 2.30 has no function for it
    }
    char time[64] = "";
    std::tm fields = {};
    if (prefix.hasTime && ::gmtime_r(&prefix.second, &fields) != nullptr) {
        std::strftime(time, sizeof(time), "%F %T", &fields);
    }
    const int length = std::snprintf(prefix.text, sizeof(prefix.text), "[%s] (%ld:%ld) (?): ", time, prefix.processId,
                                     prefix.threadId);
    prefix.length = static_cast<std::size_t>(length); // at most 63 + 2 * 20 + 13, which fits
}

const Prefix& currentPrefix(LogLevel::Level level) noexcept
{
    std::time_t second = 0;
    const bool hasTime = readClock(second);
    const std::uint64_t generation = sForkGeneration.load(std::memory_order_relaxed);
    Prefix& prefix = tPrefix;
    if (prefix.second != second || prefix.hasTime != hasTime || prefix.generation != generation) {
        prefix.second = second;
        prefix.hasTime = hasTime;
        compose(prefix, generation);
    }
    prefix.text[prefix.length - kLevelFromEnd] = LogLevel::getAbbreviatedName(level);
    return prefix;
}

} // namespace

QelDebugContext::QelDebugContext(QelLogger& logger, LogLevel::Level level) noexcept
    : CappedStringStream(kMaxLineBytes), mLogger(logger), mLevel(level)
{
    // Streams start with the global locale, whose grouping would turn 4711 into 4.711. Comparing is much cheaper than
    // imbuing, and the global locale is nearly always the classic one.
    const std::locale& classic = std::locale::classic();
    if (getloc() != classic) imbue(classic);

    const Prefix& prefix = currentPrefix(level);
    write(prefix.text, static_cast<std::streamsize>(prefix.length));
    if (logger.isRoot()) return;
    const std::string& name = logger.getName();
    put('[').write(name.data(), static_cast<std::streamsize>(name.size())).write("] ", 2);
}

QelDebugContext::~QelDebugContext() { mLogger.send(mLevel, pText()); }

} // namespace qel
