#include "proxy/FrameMatch.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"
#include "base/OptionChecks.hpp"
#include "base/UsageErrors.hpp"
#include "proxy/FrameNames.hpp"

#include <algorithm>
#include <cctype>
#include <stdexcept>

namespace qel::tool {

namespace {

using Value = QelMessageClassification::Value;

std::string lower(std::string text)
{
    std::transform(text.begin(), text.end(), text.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return text;
}

/// The name without the prefix that the library prints, in lower case: names are compared like this.
std::string bare(const std::string& name, const std::string& prefix)
{
    const std::string text = lower(name);
    return text.compare(0, prefix.size(), prefix) == 0 ? text.substr(prefix.size()) : text;
}

void takeFunction(const RuleSource& source, const RuleWord& word, FrameMatch& match)
{
    constexpr std::uint64_t kMax = 0xFFFF;
    if (const auto number = parseInteger(word.value); number && *number <= kMax) {
        match.function = static_cast<std::uint16_t>(*number);
        return;
    }
    const std::string name = bare(word.value, "qelmessagefunction");
    std::vector<std::string> names;
    for (const auto& one : namedFunctions()) {
        if (lower(one.second) == name) {
            match.function = one.first;
            return;
        }
        names.push_back(one.second);
    }
    refuseWord(source, word, "unknown function " + tool::quoted(word.value) + didYouMean(name, names));
}

void takeOperation(const RuleSource& source, const RuleWord& word, FrameMatch& match)
{
    constexpr std::uint64_t kMax = 0xFFFF;
    if (const auto number = parseInteger(word.value); number && *number <= kMax) {
        match.operation = static_cast<std::uint16_t>(*number);
        return;
    }
    const std::string name = bare(word.value, "qelmessageop");
    std::vector<std::string> names;
    for (const NamedOperation& one : namedOperations()) {
        if (lower(one.name) == name) {
            // An operation belongs to its function: its number alone may mean three operations.
            match.function = one.function;
            match.operation = one.operation;
            return;
        }
        names.push_back(one.name);
    }
    refuseWord(source, word, "unknown operation " + tool::quoted(word.value) + didYouMean(name, names));
}

void takeKind(const RuleSource& source, const RuleWord& word, FrameMatch& match)
{
    const std::string kind = lower(word.value);
    if (kind == "request") {
        match.kind = Value::Request;
    } else if (kind == "response") {
        match.kind = Value::Response;
    } else if (kind == "notice") {
        match.kind = Value::Async;
    } else {
        refuseWord(source, word,
                   "unknown kind " + tool::quoted(word.value) + ": request, response or notice" +
                       didYouMean(kind, {"request", "response", "notice"}));
    }
}

} // namespace

std::string didYouMean(const std::string& word, const std::vector<std::string>& candidates)
{
    // The nearest one is looked for without regard to case, and named as it is written.
    std::vector<std::string> all;
    all.reserve(candidates.size());
    for (const std::string& candidate : candidates)
        all.push_back(lower(candidate));
    const std::string guess = nearestWord(lower(word), all);
    for (std::size_t i = 0; i < all.size() && !guess.empty(); ++i) {
        if (all[i] == guess) return "; did you mean " + tool::quoted(candidates[i]) + "?";
    }
    return {};
}

bool FrameMatch::matchesFrame(const FrameView& view, std::uint64_t number) const noexcept
{
    if (!frame.contains(number)) return false;
    if (every > 1 && (number - std::max<std::uint64_t>(frame.first, 1)) % every != 0) return false;
    if (function && *function != view.function()) return false;
    if (operation && *operation != view.operation()) return false;
    return !kind || *kind == view.kind();
}

std::vector<RuleWord> wordsOf(const std::string& text)
{
    std::vector<RuleWord> words;
    constexpr const char* kBlanks = " \t\r";
    std::size_t at = text.find_first_not_of(kBlanks);
    while (at != std::string::npos) {
        const std::size_t end = std::min(text.find_first_of(kBlanks, at), text.size());
        const std::string whole = text.substr(at, end - at);
        const std::size_t equals = whole.find('=');
        RuleWord word;
        word.key = whole.substr(0, equals);
        word.hasValue = equals != std::string::npos;
        if (word.hasValue) word.value = whole.substr(equals + 1);
        word.column = at + 1;
        words.push_back(word);
        at = text.find_first_not_of(kBlanks, end);
    }
    return words;
}

void refuseWord(const RuleSource& source, const RuleWord& word, const std::string& reason)
{
    throw std::invalid_argument(source.place + ": " + reason + " (column " + std::to_string(word.column) + " of " +
                                tool::quoted(source.text) + ")");
}

bool takeMatchWord(const RuleSource& source, const RuleWord& word, FrameMatch& match)
{
    constexpr std::uint64_t kMax = std::numeric_limits<std::uint64_t>::max();
    if (word.key == "to-server" || word.key == "to-console") {
        if (word.hasValue) refuseWord(source, word, word.key + " takes no value");
        match.way = word.key == "to-server" ? Way::ToServer : Way::ToConsole;
        return true;
    }
    const std::vector<std::string>& words = matchWords();
    if (std::find(words.begin(), words.end(), word.key) == words.end()) return false;
    if (word.value.empty()) refuseWord(source, word, word.key + " needs a value");
    if (word.key == "function") takeFunction(source, word, match);
    if (word.key == "op" || word.key == "operation") takeOperation(source, word, match);
    if (word.key == "kind") takeKind(source, word, match);
    if (word.key == "frame") match.frame = rangeOf(source, word);
    if (word.key == "connection") match.connection = rangeOf(source, word);
    if (word.key == "every") match.every = numberOf(source, word, 1, kMax);
    return true;
}

const std::vector<std::string>& matchWords()
{
    static const std::vector<std::string> words{"to-server", "to-console", "function", "op",        "operation",
                                                "kind",      "frame",      "every",    "connection"};
    return words;
}

std::uint64_t numberOf(const RuleSource& source, const RuleWord& word, std::uint64_t min, std::uint64_t max)
{
    const auto number = parseInteger(word.value);
    if (number && *number >= min && *number <= max) return *number;
    const bool isOpen = max == std::numeric_limits<std::uint64_t>::max();
    const std::string range = isOpen
                                  ? " is not an integer of at least " + std::to_string(min)
                                  : " is not an integer in [" + std::to_string(min) + ", " + std::to_string(max) + "]";
    refuseWord(source, word, word.key + ": " + tool::quoted(word.value) + range);
}

NumberRange rangeOf(const RuleSource& source, const RuleWord& word)
{
    const std::size_t dots = word.value.find("..");
    const std::string first = word.value.substr(0, dots);
    const std::string last = dots == std::string::npos ? first : word.value.substr(dots + 2);
    const auto low = first.empty() ? std::optional<std::uint64_t>(1) : parseInteger(first);
    const auto high = last.empty() ? std::optional<std::uint64_t>(NumberRange().last) : parseInteger(last);
    const bool isEmpty = first.empty() && last.empty();
    if (isEmpty || !low || !high || *low < 1 || *low > *high) {
        refuseWord(source, word,
                   word.key + ": " + tool::quoted(word.value) + " is none of 3, 3..7, 3.. and ..7, counted from 1");
    }
    return {*low, *high};
}

void FrameFilter::add(const std::string& text)
{
    const RuleSource source{text, "--filter"};
    FrameMatch match;
    const std::vector<RuleWord> words = wordsOf(text);
    if (words.empty()) throw std::invalid_argument("--filter: it says nothing");
    for (const RuleWord& word : words) {
        if (takeMatchWord(source, word, match)) continue;
        refuseWord(source, word, "unknown word " + tool::quoted(word.key) + didYouMean(word.key, matchWords()));
    }
    mMatches.push_back(match);
}

bool FrameFilter::shows(const FrameView& frame, Way way, std::uint64_t connection, std::uint64_t number) const noexcept
{
    return mMatches.empty() || std::any_of(mMatches.begin(), mMatches.end(), [&](const FrameMatch& match) {
               return match.matchesFlow(way, connection) && match.matchesFrame(frame, number);
           });
}

} // namespace qel::tool
