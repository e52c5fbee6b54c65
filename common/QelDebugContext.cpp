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

// Tells a thread that its ids may be stale. Starts at 1, so that a thread's first line finds its generation old.
std::atomic<std::uint64_t> sForkGeneration{1};

void noteFork() { sForkGeneration.fetch_add(1, std::memory_order_relaxed); }

/// Has noteFork called after every fork, on both sides of it. @return false if that could not be arranged
bool watchForks()
{
    static const bool sWatching = ::pthread_atfork(nullptr, noteFork, noteFork) == 0;
    return sWatching;
}

/// The prefix of a thread's latest line. Most lines fall into the same second as the one before and show the same ids,
/// and breaking down the time and asking for the ids costs several times the rest of the line.
/// Plain zero-initialised data without a destructor: a thread-local object of this kind needs no guard.
struct Prefix {
    std::time_t second;
    std::uint64_t generation; // of the ids; 0 when they must not be used again
    long processId;
    long threadId;
    std::size_t length;
    char text[128]; // "[2026-03-01 17:04:09] (4711:4719) (E): ", complete but for the level
};

thread_local Prefix tPrefix;

constexpr std::size_t kLevelFromEnd = 4; // the level's letter stands in front of "): "

void compose(Prefix& prefix, std::time_t second, std::uint64_t generation)
{
    if (prefix.generation != generation) {
        prefix.generation = watchForks() ? generation : 0;
        prefix.processId = ::getpid();
        prefix.threadId = ::syscall(SYS_gettid); // glibc before 2.30 has no function for it
    }
    prefix.second = second;
    char time[64] = "";
    std::tm fields = {};
    if (::gmtime_r(&second, &fields) != nullptr) std::strftime(time, sizeof(time), "%F %T", &fields);
    const int length = std::snprintf(prefix.text, sizeof(prefix.text), "[%s] (%ld:%ld) (?): ", time, prefix.processId,
                                     prefix.threadId);
    prefix.length = static_cast<std::size_t>(length); // at most 63 + 2 * 20 + 13, which fits
}

const Prefix& currentPrefix(LogLevel::Level level)
{
    const std::time_t second = std::chrono::system_clock::to_time_t(TimeProvider::system());
    const std::uint64_t generation = sForkGeneration.load(std::memory_order_relaxed);
    Prefix& prefix = tPrefix;
    if (prefix.second != second || prefix.generation != generation) compose(prefix, second, generation);
    prefix.text[prefix.length - kLevelFromEnd] = LogLevel::getAbbreviatedName(level);
    return prefix;
}

} // namespace

QelDebugContext::QelDebugContext(QelLogger& logger, LogLevel::Level level)
    : CappedStringStream(kMaxLineBytes), mLogger(logger), mLevel(level)
{
    // Streams start with the global locale, whose grouping would print 4.711 into numbers. Comparing is much cheaper
    // than imbuing, and nearly always the global locale is the classic one.
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
