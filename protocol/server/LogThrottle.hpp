#pragma once

#include <qel/common/LogLevel.hpp>
#include <qel/common/util/Mutex.hpp>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace qel::protocol {

/// Counts the log lines about each peer, and holds back those that repeat themselves too often: a peer must not be able
/// to push the lines about the others out of the log.
///
/// Lines about one peer that differ in numbers only are of one kind. The first kBurst lines of a kind go out at once,
/// and one more for each second without any. Further lines are counted; once a second report() sums them up. Lines at
/// Debug always go out.
///
/// A sum names the partitions ("partition=N") of the lines that it stands for, so that none of them goes unsaid.
///
/// Memory is bounded: the partitions of a sum beyond kMaxPartitions are its "others", the kinds of a peer beyond
/// kMaxKinds count as one, and so do the peers beyond kMaxPeers.
///
/// The clock is TimeProvider::steady(). Thread safety: any thread.
class LogThrottle {
public:
    static constexpr unsigned int kBurst = 10;
    static constexpr std::size_t kMaxKinds = 8;
    static constexpr std::size_t kMaxPeers = 128;
    static constexpr std::size_t kMaxPartitions = 256;
    static constexpr std::chrono::seconds kPeriod{1};

    using TimePoint = std::chrono::steady_clock::time_point;

    /// The lines of one thread that are about one peer, as long as it exists. The latest scope of a thread counts.
    /// Thread safety: belongs to the thread that made it.
    class Scope {
    public:
        /// @param throttle, peer  borrowed; `peer` is the name in report()
        Scope(LogThrottle& throttle, const std::string& peer) noexcept;
        ~Scope();
        Scope(const Scope&) = delete;
        Scope& operator=(const Scope&) = delete;

    private:
        friend class LogThrottle;

        LogThrottle& mThrottle;
        const std::string& mPeer;
        Scope* const mOuter;
    };

    /// @param onHeldBack  called, with the locks of logger and throttle held, when getNextReport() has become earlier;
    ///                    must not throw or log
    explicit LogThrottle(std::function<void()> onHeldBack);
    ~LogThrottle();
    LogThrottle(const LogThrottle&) = delete;
    LogThrottle& operator=(const LogThrottle&) = delete;

    /// Asks the scope of the calling thread.
    /// @param line  complete, as back-ends get it
    /// @return whether the line is to go out; true without a scope. True too if there is no memory to count it
    static bool admits(LogLevel::Level level, const std::string& line) noexcept;

    /// When report() has something to log; TimePoint::max(): nothing is held back.
    TimePoint getNextReport() const;

    /// Logs a line for each kind of lines that were held back for kPeriod: how many, and the last of them.
    void report();

    /// The same for all that were held back, at the end.
    void reportAll();

private:
    struct Kind {
        std::uint64_t hash = 0;
        unsigned int credit = kBurst; ///< lines that may go out at once
        TimePoint since;              ///< of the latest change of the credit, or of the first line held back
        std::uint64_t heldBack = 0;
        LogLevel::Level level = LogLevel::Debug;
        std::string lastLine;              ///< of those held back
        std::set<unsigned int> partitions; ///< of those held back
        bool hasOthers = false;            ///< there were more of them than kMaxPartitions
    };
    using Kinds = std::vector<Kind>;

    bool pAdmits(const std::string& peer, LogLevel::Level level, const std::string& line);
    Kinds& pKindsOfLocked(const std::string& peer, TimePoint now) QEL_REQUIRES(mMutex);
    static Kind& pKindOf(Kinds& kinds, std::uint64_t hash, TimePoint now);
    static void pNotePartition(Kind& kind, std::optional<unsigned int> partition);
    static void pRefill(Kind& kind, TimePoint now);
    void pForgetIdleLocked(TimePoint now) QEL_REQUIRES(mMutex);
    void pReport(TimePoint until);

    const std::function<void()> mOnHeldBack;

    mutable Mutex mMutex;
    std::map<std::string, Kinds> mPeers QEL_GUARDED_BY(mMutex);
    TimePoint mNextReport QEL_GUARDED_BY(mMutex) = TimePoint::max();
};

} // namespace qel::protocol
