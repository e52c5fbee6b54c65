#include "proxy/FaultRule.hpp"

#include <qel/common/QelMessage.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"
#include "base/OptionChecks.hpp"

#include <algorithm>
#include <cctype>
#include <cmath>
#include <cstdlib>
#include <stdexcept>
#include <utility>

namespace qel::tool {

namespace {

using Time = FaultRule::Time;

constexpr std::uint64_t kNoLimit = std::numeric_limits<std::uint64_t>::max();
constexpr Time kUsualHold = std::chrono::milliseconds(100);
constexpr std::uint64_t kMaxFrames = 64; // that a rule holds or adds: memory is bounded

struct FaultWord {
    const char* word;
    Fault fault;
    bool needsValue;
};
constexpr FaultWord kFaults[] = {
    {"delay", Fault::Delay, true},
    {"split", Fault::Split, true},
    {"join", Fault::Join, true},
    {"drop", Fault::Drop, false},
    {"duplicate", Fault::Duplicate, false},
    {"reorder", Fault::Reorder, false},
    {"corrupt", Fault::Corrupt, true},
    {"cut", Fault::Cut, false},
    {"half-close", Fault::HalfClose, false},
    {"reset", Fault::Reset, false},
    {"stop-reading", Fault::StopReading, false},
    {"rate", Fault::Rate, true},
};

/// The words that only some faults have.
struct DetailWord {
    const char* word;
    std::vector<Fault> faults;
};
const std::vector<DetailWord>& detailWords()
{
    static const std::vector<DetailWord> words{
        {"within", {Fault::Join, Fault::Reorder}},
        {"pause", {Fault::Split}},
        {"for", {Fault::StopReading}},
        {"value", {Fault::Corrupt}},
        {"after", {Fault::Cut, Fault::HalfClose, Fault::Reset, Fault::StopReading}},
    };
    return words;
}

struct Field {
    const char* name;
    std::size_t offset;
    std::size_t width;
};
constexpr Field kFields[] = {
    {"mDesc", 0, 3},       {"mHeaderVersion", 3, 1}, {"mMsgLength", 4, 4},     {"mCallerId", 8, 4},
    {"mFunction", 12, 2},  {"mFlags", 14, 1},        {"mPadLength", 15, 1},    {"mDataLength", 16, 4},
    {"mOperation", 20, 2}, {"mStatus", 22, 2},       {"mStatusDetail", 24, 2}, {"mReserved2", 26, 2},
    {"mReserved3", 28, 4},
};

std::vector<std::string> allWords()
{
    std::vector<std::string> words = matchWords();
    for (const FaultWord& word : kFaults)
        words.emplace_back(word.word);
    for (const DetailWord& word : detailWords())
        words.emplace_back(word.word);
    words.insert(words.end(), {"p", "times", "frames", "bytes"});
    return words;
}

/// "10ms", "2s", "500us". @return none for anything else
std::optional<Time> timeIn(const std::string& text, const std::string& usualUnit)
{
    if (text.empty() || std::isdigit(static_cast<unsigned char>(text[0])) == 0) return std::nullopt;
    // from_chars() for double is not in every standard library that we support.
    char* rest = nullptr;
    const double number = std::strtod(text.c_str(), &rest);
    const std::string unit = *rest == '\0' ? usualUnit : std::string(rest);
    double seconds = 0;
    if (unit == "us") seconds = number / 1e6;
    if (unit == "ms") seconds = number / 1e3;
    if (unit == "s") seconds = number;
    constexpr double kDay = 86400;
    const bool isKnown = unit == "us" || unit == "ms" || unit == "s";
    if (!isKnown || !std::isfinite(number) || seconds > kDay) return std::nullopt;
    return std::chrono::duration_cast<Time>(std::chrono::duration<double>(seconds));
}

/// Reads one rule.
class RuleReader {
public:
    explicit RuleReader(const RuleSource& source) : mSource(source), mWords(wordsOf(source.text)) {}

    FaultRule read()
    {
        mRule.text = mSource.text;
        for (mAt = 0; mAt < mWords.size(); ++mAt)
            pTake(mWords[mAt]);
        if (mFault == nullptr) {
            std::string all;
            for (const FaultWord& word : kFaults)
                all += (all.empty() ? "" : ", ") + std::string(word.word);
            throw std::invalid_argument(mSource.place + ": no fault is named in " + tool::quoted(mSource.text) + ": " +
                                        all);
        }
        pCheckDetails();
        return mRule;
    }

private:
    void pTake(const RuleWord& word)
    {
        if (takeMatchWord(mSource, word, mRule.match)) return;
        const auto* const fault =
            std::find_if(std::begin(kFaults), std::end(kFaults), [&](const auto& one) { return word.key == one.word; });
        if (fault != std::end(kFaults)) return pTakeFault(word, *fault);
        if (word.key == "p") return pTakeProbability(word);
        if (word.key == "times") {
            mRule.times = numberOf(mSource, word, 1, kNoLimit);
            return;
        }
        const auto& details = detailWords();
        const auto detail =
            std::find_if(details.begin(), details.end(), [&](const auto& one) { return word.key == one.word; });
        if (detail != details.end()) {
            mDetails.emplace_back(&*detail, word);
            if (word.key == "after") ++mAt; // its frames= or bytes=
            return;
        }
        if (word.key == "frames" || word.key == "bytes") {
            refuseWord(mSource, word,
                       word.key + "= follows \"after\"" +
                           (word.key == "frames" ? "; to select frames, write frame=" : ""));
        }
        refuseWord(mSource, word, "unknown word " + tool::quoted(word.key) + didYouMean(word.key, allWords()));
    }

    void pTakeFault(const RuleWord& word, const FaultWord& fault)
    {
        if (mFault != nullptr) {
            refuseWord(mSource, word,
                       std::string("a rule has one fault, and this one has ") + mFault->word + ": write two rules");
        }
        mFault = &fault;
        mRule.fault = fault.fault;
        if (fault.needsValue && word.value.empty()) refuseWord(mSource, word, word.key + " needs a value");
        if (word.hasValue && !fault.needsValue && fault.fault != Fault::Duplicate)
            refuseWord(mSource, word, word.key + " takes no value");
        switch (fault.fault) {
        case Fault::Delay:
            return pTakeDelay(word);
        case Fault::Split:
            return pTakeSplit(word);
        case Fault::Join:
            mRule.count = numberOf(mSource, word, 2, kMaxFrames);
            mRule.within = kUsualHold;
            return;
        case Fault::Duplicate:
            mRule.count = word.hasValue ? numberOf(mSource, word, 1, kMaxFrames) : 1;
            return;
        case Fault::Reorder:
            mRule.within = kUsualHold;
            return;
        case Fault::Corrupt:
            return pTakeTarget(word);
        case Fault::Rate:
            return pTakeRate(word);
        default:
            return;
        }
    }

    Time pTime(const RuleWord& word, const std::string& text, const std::string& usualUnit = {})
    {
        const auto time = timeIn(text, usualUnit);
        if (time) return *time;
        refuseWord(mSource, word,
                   word.key + ": " + tool::quoted(text) + " is not a time such as 10ms, 2s or 500us, a day at most");
    }

    void pTakeDelay(const RuleWord& word)
    {
        const std::size_t dash = word.value.find('-');
        const std::string last = dash == std::string::npos ? word.value : word.value.substr(dash + 1);
        mRule.longest = pTime(word, last);
        // The unit of "10-50ms" is written once.
        const std::size_t unit = std::min(last.find_first_not_of("0123456789."), last.size());
        mRule.shortest = pTime(word, word.value.substr(0, dash), last.substr(unit));
        if (mRule.shortest > mRule.longest) refuseWord(mSource, word, "delay: the longest time is the second one");
    }

    void pTakeSplit(const RuleWord& word)
    {
        if (word.value == "each-byte") return;
        std::size_t at = 0;
        while (at <= word.value.size()) {
            const std::size_t comma = std::min(word.value.find(',', at), word.value.size());
            const auto place = parseInteger(word.value.substr(at, comma - at));
            const bool isRising = place && *place > (mRule.cuts.empty() ? 0 : mRule.cuts.back());
            if (!isRising) {
                refuseWord(mSource, word,
                           "split: " + tool::quoted(word.value) +
                               " is neither each-byte nor a rising list such as 3,9" +
                               didYouMean(word.value, {"each-byte"}));
            }
            mRule.cuts.push_back(static_cast<std::size_t>(*place));
            at = comma + 1;
        }
    }

    void pTakeTarget(const RuleWord& word)
    {
        CorruptTarget& target = mRule.target;
        target.name = word.value;
        if (word.value == "any") {
            target.kind = CorruptTarget::Kind::Any;
            return;
        }
        const std::string payload = "payload";
        if (word.value.compare(0, payload.size(), payload) == 0) {
            const std::string rest = word.value.substr(payload.size());
            const auto offset = rest.empty() ? std::optional<std::uint64_t>(0) : parseInteger(rest.substr(1));
            if (offset && (rest.empty() || rest[0] == '+')) {
                target.kind = CorruptTarget::Kind::FromPayload;
                target.offset = static_cast<std::size_t>(*offset);
                return;
            }
        }
        const bool isFromEnd = word.value.size() > 1 && word.value[0] == '-';
        if (const auto offset = parseInteger(word.value.substr(isFromEnd ? 1 : 0))) {
            if (isFromEnd && *offset == 0) refuseWord(mSource, word, "corrupt: the last byte is -1");
            target.kind = isFromEnd ? CorruptTarget::Kind::FromEnd : CorruptTarget::Kind::FromStart;
            target.offset = static_cast<std::size_t>(*offset);
            return;
        }
        std::vector<std::string> names{"payload", "any"};
        for (const Field& field : kFields) {
            if (word.value == field.name) {
                target.offset = field.offset;
                target.width = field.width;
                return;
            }
            names.emplace_back(field.name);
        }
        refuseWord(mSource, word,
                   "corrupt: " + tool::quoted(word.value) +
                       " is neither an offset such as 22 or -1, nor payload+2, nor any, nor a field" +
                       didYouMean(word.value, names));
    }

    void pTakeRate(const RuleWord& word)
    {
        std::string digits = word.value;
        std::uint64_t unit = 1;
        if (digits.back() == 'k') unit = 1000;
        if (digits.back() == 'M') unit = 1000 * 1000;
        if (unit > 1) digits.pop_back();
        constexpr std::uint64_t kMax = 1000 * 1000 * 1000;
        const auto number = parseInteger(digits);
        if (!number || *number < 1 || *number > kMax / unit) {
            refuseWord(mSource, word,
                       "rate: " + tool::quoted(word.value) +
                           " is not a number of bytes a second such as 500, 64k or 2M, 1000M at most");
        }
        mRule.bytesPerSecond = *number * unit;
    }

    void pTakeProbability(const RuleWord& word)
    {
        char* rest = nullptr;
        const double number = std::strtod(word.value.c_str(), &rest);
        const bool isNumber = !word.value.empty() && *rest == '\0';
        if (!isNumber || !(number > 0 && number <= 1))
            refuseWord(mSource, word, "p: " + tool::quoted(word.value) + " is not a probability above 0, 1 at most");
        mRule.probability = number;
    }

    void pCheckDetails()
    {
        for (const auto& [detail, word] : mDetails) {
            if (std::find(detail->faults.begin(), detail->faults.end(), mRule.fault) == detail->faults.end())
                refuseWord(mSource, word, std::string(mFault->word) + " has no " + tool::quoted(word.key));
            if (word.key == "within") mRule.within = pTime(word, word.value);
            if (word.key == "pause" || word.key == "for") mRule.pause = pTime(word, word.value);
            if (word.key == "value") mRule.value = pValue(word);
            if (word.key == "after") pTakeAfter(word);
        }
        const bool limitsBytes = mRule.fault == Fault::Rate || mRule.afterBytes;
        const bool drawsOnce = mRule.fault != Fault::Rate;
        if (limitsBytes && mRule.match.needsFrame())
            throw std::invalid_argument(mSource.place + ": " + tool::quoted(mSource.text) +
                                        " counts bytes, so only a direction and a connection can select");
        if (!drawsOnce && (mRule.probability < 1 || mRule.times > 0))
            throw std::invalid_argument(mSource.place + ": rate has neither p= nor times=");
    }

    std::uint64_t pValue(const RuleWord& word)
    {
        const std::uint64_t max = (std::uint64_t{1} << 8 * mRule.target.width) - 1;
        return numberOf(mSource, word, 0, max);
    }

    void pTakeAfter(const RuleWord& after)
    {
        const auto next = std::find_if(mWords.begin(), mWords.end(),
                                       [&](const RuleWord& word) { return word.column == after.column; }) +
                          1;
        const bool isKnown = next != mWords.end() && (next->key == "frames" || next->key == "bytes");
        if (!isKnown || after.hasValue)
            refuseWord(mSource, after, "after what? Write after frames=3 or after bytes=100");
        const std::uint64_t count = numberOf(mSource, *next, 1, kNoLimit);
        (next->key == "frames" ? mRule.afterFrames : mRule.afterBytes) = count;
    }

    const RuleSource& mSource;
    const std::vector<RuleWord> mWords;
    std::size_t mAt = 0;
    FaultRule mRule;
    const FaultWord* mFault = nullptr;
    std::vector<std::pair<const DetailWord*, RuleWord>> mDetails; // what they mean depends on the fault
};

} // namespace

FaultRule parseFaultRule(const RuleSource& source) { return RuleReader(source).read(); }

std::vector<FaultRule> readFaultRules(std::istream& text, const std::string& name)
{
    std::vector<FaultRule> rules;
    std::string line;
    for (std::size_t number = 1; std::getline(text, line); ++number) {
        line = line.substr(0, line.find('#'));
        const std::size_t last = line.find_last_not_of(" \t\r");
        if (last == std::string::npos) continue;
        rules.push_back(parseFaultRule({line.substr(0, last + 1), name + ":" + std::to_string(number)}));
    }
    return rules;
}

FaultDice::FaultDice(std::uint64_t seed, std::uint64_t connection, Way way) noexcept : mState(seed)
{
    constexpr std::uint64_t kSpread = 0xD1342543DE82EF95; // odd: different connections begin at different places
    mState = next() ^ (connection * 2 + (way == Way::ToServer ? 0 : 1)) * kSpread;
}

std::uint64_t FaultDice::next() noexcept
{
    mState += 0x9E3779B97F4A7C15;
    std::uint64_t mixed = mState;
    mixed = (mixed ^ mixed >> 30) * 0xBF58476D1CE4E5B9;
    mixed = (mixed ^ mixed >> 27) * 0x94D049BB133111EB;
    return mixed ^ mixed >> 31;
}

bool FaultDice::comesTrue(double probability) noexcept
{
    constexpr int kMantissa = 53;
    return std::ldexp(static_cast<double>(next() >> (64 - kMantissa)), -kMantissa) < probability;
}

} // namespace qel::tool
