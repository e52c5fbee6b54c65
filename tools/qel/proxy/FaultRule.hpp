#pragma once

#include "proxy/FrameMatch.hpp"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <istream>
#include <optional>
#include <string>
#include <vector>

namespace qel::tool {

/// What a rule does.
enum class Fault { Delay, Split, Join, Drop, Duplicate, Reorder, Corrupt, Cut, HalfClose, Reset, StopReading, Rate };

/// The bytes of a frame that a rule changes.
struct CorruptTarget {
    enum class Kind {
        FromStart,   ///< `offset` bytes from the first byte of the frame
        FromEnd,     ///< `offset` bytes before its end
        FromPayload, ///< `offset` bytes from the first byte of the payload
        Any,         ///< a byte that the seed decides
    };
    Kind kind = Kind::FromStart;
    std::size_t offset = 0;
    std::size_t width = 1; ///< bytes
    std::string name;      ///< as it was given
};

/// One fault: which frames, what happens to them, how often. Read from a text:
///
///     [to-server|to-console] [frame=3..] [op=GetQelTod] ... FAULT [p=0.1] [times=2]
///
/// docs/proxy.md has the words. Thread safety: a plain value.
struct FaultRule {
    using Time = std::chrono::nanoseconds;

    Fault fault = Fault::Drop;
    FrameMatch match;
    double probability = 1;
    std::uint64_t times = 0; ///< at most, in each direction of each connection; 0: no limit

    Time shortest{0}; ///< of a delay
    Time longest{0};
    Time within{0};                ///< how long join and reorder hold frames back
    Time pause{0};                 ///< of split: between the pieces; of stop-reading: its length, 0 for ever
    std::vector<std::size_t> cuts; ///< of split: where pieces end; empty: after every byte
    std::uint64_t count = 0;       ///< of join: frames; of duplicate: copies besides the frame itself
    CorruptTarget target;
    std::optional<std::uint64_t> value;       ///< of corrupt; none: the seed decides
    std::optional<std::uint64_t> afterFrames; ///< of the faults that end something
    std::optional<std::uint64_t> afterBytes;
    std::uint64_t bytesPerSecond = 0; ///< of rate

    std::string text; ///< as it was given

    /// True when it acts on single frames, which it therefore needs whole.
    bool needsFrames() const noexcept { return fault != Fault::Rate && !afterBytes; }
};

/// Reads a rule.
/// @throws std::invalid_argument  `--fault: unknown word "dropp"; did you mean "drop"? (column 11 of "to-server
/// dropp")`
FaultRule parseFaultRule(const RuleSource& source);

/// Reads a file of rules: one on each line; "#" begins a comment.
/// @param name  of the file, for messages
/// @throws std::invalid_argument  with the number of the line
std::vector<FaultRule> readFaultRules(std::istream& text, const std::string& name);

/// The rules of a run and what decides about chance. Thread safety: a plain value, which connections share.
struct FaultPlan {
    std::vector<FaultRule> rules;
    std::uint64_t seed = 0;
};

/// Random numbers that a seed determines: SplitMix64, the same on every machine. Each direction of each connection has
/// its own, so what happens in one does not depend on the timing of another.
/// Thread safety: one thread.
class FaultDice {
public:
    FaultDice(std::uint64_t seed, std::uint64_t connection, Way way) noexcept;

    std::uint64_t next() noexcept;
    /// In [0, count). @param count  more than 0
    std::uint64_t below(std::uint64_t count) noexcept { return next() % count; }
    /// @param probability  in [0, 1]
    bool comesTrue(double probability) noexcept;

private:
    std::uint64_t mState;
};

} // namespace qel::tool
