#pragma once

#include "proxy/FrameView.hpp"

#include <cstdint>
#include <limits>
#include <optional>
#include <string>
#include <vector>

namespace qel::tool {

/// Numbers from `first` to `last`, both included.
struct NumberRange {
    std::uint64_t first = 0;
    std::uint64_t last = std::numeric_limits<std::uint64_t>::max();

    bool contains(std::uint64_t number) const noexcept { return number >= first && number <= last; }
};

/// Which frames are meant: all of them, narrowed down by conditions that must hold together.
/// Thread safety: a plain value.
struct FrameMatch {
    std::optional<Way> way;
    NumberRange connection;  ///< counted from 1
    NumberRange frame;       ///< counted from 1 in its direction of its connection
    std::uint64_t every = 1; ///< of the frames in the range: the first and then each n-th
    std::optional<std::uint16_t> function;
    std::optional<std::uint16_t> operation;
    std::optional<QelMessageClassification::Value> kind;

    bool matchesFlow(Way flow, std::uint64_t connectionNumber) const noexcept
    {
        return (!way || *way == flow) && connection.contains(connectionNumber);
    }

    /// @param number  of the frame in its direction; the flow has been matched before
    bool matchesFrame(const FrameView& view, std::uint64_t number) const noexcept;

    /// True when the fields of a frame decide, so that there is no match without one.
    bool needsFrame() const noexcept { return function || operation || kind || every != 1 || hasFrameNumber(); }
    bool hasFrameNumber() const noexcept { return frame.first > 0 || frame.last != NumberRange().last; }
};

/// A text in words, and where it comes from: "--fault", or "faults.txt:3". For messages.
struct RuleSource {
    std::string text;
    std::string place;
};

/// One word of a rule: "op=GetQelTod" is the key "op" with a value, "drop" a key alone.
struct RuleWord {
    std::string key;
    std::string value;
    bool hasValue = false;
    std::size_t column = 0; ///< from 1
};

/// Divides a rule into its words, which blanks separate.
std::vector<RuleWord> wordsOf(const std::string& text);

/// @throws std::invalid_argument  `faults.txt:3: column 5: REASON in "TEXT"`
[[noreturn]] void refuseWord(const RuleSource& source, const RuleWord& word, const std::string& reason);

/// "; did you mean "drop"?", or an empty text when no candidate is near. Case does not count.
std::string didYouMean(const std::string& word, const std::vector<std::string>& candidates);

/// Takes a word that narrows a match: to-server, to-console, function=, op=, kind=, frame=, every=, connection=.
/// @return false: it is another word
/// @throws std::invalid_argument  its value is not valid
bool takeMatchWord(const RuleSource& source, const RuleWord& word, FrameMatch& match);

/// The words that takeMatchWord() knows, for hints.
const std::vector<std::string>& matchWords();

/// Reads an integer in [min, max] from the value of a word.
/// @throws std::invalid_argument
std::uint64_t numberOf(const RuleSource& source, const RuleWord& word, std::uint64_t min, std::uint64_t max);

/// Reads "3", "3..7", "3.." or "..7".
NumberRange rangeOf(const RuleSource& source, const RuleWord& word);

/// What --filter shows: a frame that one of the texts describes. All frames without any.
class FrameFilter {
public:
    /// Adds a text such as "to-server op=GetQelTod".
    /// @throws std::invalid_argument  says what is wrong, with the nearest word
    void add(const std::string& text);

    bool shows(const FrameView& frame, Way way, std::uint64_t connection, std::uint64_t number) const noexcept;

private:
    std::vector<FrameMatch> mMatches;
};

} // namespace qel::tool
