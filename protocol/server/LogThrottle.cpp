#include "server/LogThrottle.hpp"

#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Logging.hpp>

#include <algorithm>
#include <cctype>
#include <charconv>
#include <utility>

namespace qel::protocol {

namespace {

/// Where the peers beyond the limit are counted.
constexpr const char* kOtherPeers = "other peers";

/// The hash of the kinds beyond the limit.
constexpr std::uint64_t kOtherKinds = 0;

constexpr std::size_t kMaxLastLine = 200;

thread_local LogThrottle::Scope* tScope = nullptr;

/// The text of a line without its prefix: "[2026-03-01 17:04:09] (4711:4719) (W): [qel] text" gives "text".
std::string textOf(const std::string& line)
{
    constexpr const char* kEndOfPrefix = "): ";
    constexpr const char* kName = "[qel] ";
    const std::size_t end = line.find(kEndOfPrefix);
    std::size_t begin = end == std::string::npos ? 0 : end + std::char_traits<char>::length(kEndOfPrefix);
    if (line.compare(begin, std::char_traits<char>::length(kName), kName) == 0) {
        begin += std::char_traits<char>::length(kName);
    }
    return line.substr(begin, kMaxLastLine);
}

bool isSeparator(char character)
{
    return std::isspace(static_cast<unsigned char>(character)) != 0 || character == ',' || character == '"';
}

/// A hash (FNV-1a) of the words of a text that have no digit in them.
std::uint64_t kindOf(LogLevel::Level level, const std::string& text)
{
    std::uint64_t hash = 14695981039346656037U;
    const auto add = [&hash](unsigned char byte) { hash = (hash ^ byte) * 1099511628211U; };
    add(static_cast<unsigned char>(level));
    auto word = text.begin();
    while (word != text.end()) {
        const auto end = std::find_if(word, text.end(), isSeparator);
        const bool hasDigit =
            std::any_of(word, end, [](unsigned char character) { return std::isdigit(character) != 0; });
        if (!hasDigit) std::for_each(word, end, add);
        add(' ');
        word = end == text.end() ? end : end + 1;
    }
    return std::max<std::uint64_t>(hash, kOtherKinds + 1);
}

/// The number after the last " partition=" of a line: what a peer calls itself comes before it.
std::optional<unsigned int> partitionOf(const std::string& line)
{
    constexpr const char* kWord = " partition=";
    const std::size_t found = line.rfind(kWord);
    if (found == std::string::npos) return std::nullopt;
    const char* const digits = line.data() + found + std::char_traits<char>::length(kWord);
    unsigned int number = 0;
    const auto read = std::from_chars(digits, line.data() + line.size(), number);
    if (read.ec != std::errc()) return std::nullopt;
    return number;
}

/// " (partitions 1, 2 and others)"; empty without any.
std::string listOf(const std::set<unsigned int>& partitions, bool hasOthers)
{
    if (partitions.empty()) return {};
    std::string list;
    for (const unsigned int partition : partitions)
        list += (list.empty() ? "" : ", ") + std::to_string(partition);
    return (partitions.size() == 1 ? " (partition " : " (partitions ") + list + (hasOthers ? " and others)" : ")");
}

} // namespace

LogThrottle::Scope::Scope(LogThrottle& throttle, const std::string& peer) noexcept
    : mThrottle(throttle), mPeer(peer), mOuter(tScope)
{
    tScope = this;
}

LogThrottle::Scope::~Scope() { tScope = mOuter; }

LogThrottle::LogThrottle(std::function<void()> onHeldBack) : mOnHeldBack(std::move(onHeldBack)) {}

LogThrottle::~LogThrottle() = default;

bool LogThrottle::admits(LogLevel::Level level, const std::string& line) noexcept
{
    if (tScope == nullptr || level <= LogLevel::Debug) return true;
    try {
        return tScope->mThrottle.pAdmits(tScope->mPeer, level, line);
    } catch (const std::exception&) {
        return true;
    }
}

LogThrottle::TimePoint LogThrottle::getNextReport() const
{
    const MutexLock lock(mMutex);
    return mNextReport;
}

void LogThrottle::report() { pReport(TimeProvider::steady() - kPeriod); }

void LogThrottle::reportAll() { pReport(TimePoint::max()); }

bool LogThrottle::pAdmits(const std::string& peer, LogLevel::Level level, const std::string& line)
{
    const auto now = TimeProvider::steady();
    std::string text = textOf(line);
    const std::uint64_t hash = kindOf(level, text);
    const MutexLock lock(mMutex);
    Kind& kind = pKindOf(pKindsOfLocked(peer, now), hash, now);
    pRefill(kind, now);
    if (kind.heldBack == 0 && kind.credit > 0) {
        --kind.credit;
        return true;
    }
    pNotePartition(kind, partitionOf(line));
    if (kind.heldBack == 0) kind.since = now;
    ++kind.heldBack;
    kind.level = level;
    kind.lastLine = std::move(text);
    if (kind.since + kPeriod < mNextReport) {
        mNextReport = kind.since + kPeriod;
        mOnHeldBack();
    }
    return false;
}

void LogThrottle::pNotePartition(Kind& kind, std::optional<unsigned int> partition)
{
    if (!partition || kind.partitions.count(*partition) != 0) return;
    if (kind.partitions.size() < kMaxPartitions) {
        kind.partitions.insert(*partition);
    } else {
        kind.hasOthers = true;
    }
}

LogThrottle::Kinds& LogThrottle::pKindsOfLocked(const std::string& peer, TimePoint now)
{
    const auto found = mPeers.find(peer);
    if (found != mPeers.end()) return found->second;
    if (mPeers.size() >= kMaxPeers) pForgetIdleLocked(now);
    return mPeers[mPeers.size() < kMaxPeers ? peer : kOtherPeers];
}

LogThrottle::Kind& LogThrottle::pKindOf(Kinds& kinds, std::uint64_t hash, TimePoint now)
{
    const auto find = [&kinds](std::uint64_t wanted) {
        return std::find_if(kinds.begin(), kinds.end(), [wanted](const Kind& kind) { return kind.hash == wanted; });
    };
    auto found = find(hash);
    if (found == kinds.end() && kinds.size() >= kMaxKinds) {
        hash = kOtherKinds;
        found = find(hash);
    }
    if (found != kinds.end()) return *found;
    kinds.emplace_back();
    kinds.back().hash = hash;
    kinds.back().since = now;
    return kinds.back();
}

/// While lines are held back there is nothing to refill: report() comes first.
void LogThrottle::pRefill(Kind& kind, TimePoint now)
{
    if (kind.heldBack > 0 || now < kind.since + kPeriod) return;
    const auto periods = static_cast<std::uint64_t>((now - kind.since) / kPeriod);
    kind.credit = static_cast<unsigned int>(std::min<std::uint64_t>(kBurst, kind.credit + periods));
    kind.since += kPeriod * periods;
}

/// Forgets the peers that are as good as new.
void LogThrottle::pForgetIdleLocked(TimePoint now)
{
    for (auto peer = mPeers.begin(); peer != mPeers.end();) {
        Kinds& kinds = peer->second;
        std::for_each(kinds.begin(), kinds.end(), [now](Kind& kind) { pRefill(kind, now); });
        const bool isIdle = std::all_of(kinds.begin(), kinds.end(),
                                        [](const Kind& kind) { return kind.heldBack == 0 && kind.credit == kBurst; });
        peer = isIdle ? mPeers.erase(peer) : std::next(peer);
    }
}

/// Logs after the lock is released: the logger's lock comes before it.
void LogThrottle::pReport(TimePoint until)
{
    struct Line {
        LogLevel::Level level;
        std::uint64_t count;
        std::string peer;
        std::string partitions;
        std::string last;
    };
    std::vector<Line> lines;
    {
        const auto now = TimeProvider::steady();
        const MutexLock lock(mMutex);
        mNextReport = TimePoint::max();
        for (auto& [peer, kinds] : mPeers) {
            for (Kind& kind : kinds) {
                if (kind.heldBack == 0) continue;
                if (kind.since > until) {
                    mNextReport = std::min(mNextReport, kind.since + kPeriod);
                    continue;
                }
                lines.push_back({kind.level, kind.heldBack, peer, listOf(kind.partitions, kind.hasOthers),
                                 std::move(kind.lastLine)});
                kind.partitions.clear();
                kind.hasOthers = false;
                kind.heldBack = 0;
                kind.credit = 1;
                kind.since = now;
            }
        }
    }
    for (const Line& line : lines)
        logLine(line.level, line.peer, ": ", line.count, " more lines like this one", line.partitions, ": ", line.last);
}

} // namespace qel::protocol
