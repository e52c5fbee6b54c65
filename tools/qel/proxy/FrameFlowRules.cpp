#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"
#include "proxy/FrameFlow.hpp"

#include <array>
#include <cinttypes>
#include <cstdio>
#include <utility>

namespace qel::tool {

namespace {

/// "37.125 ms"
std::string millisecondsText(FaultRule::Time time)
{
    std::array<char, 32> text{};
    std::snprintf(text.data(), text.size(), "%.3f ms", std::chrono::duration<double, std::milli>(time).count());
    return text.data();
}

/// "3, 6 and 23 bytes"
std::string piecesText(const std::vector<std::size_t>& cuts, std::size_t length)
{
    std::string text;
    std::size_t begin = 0;
    for (const std::size_t cut : cuts) {
        if (cut >= length) break;
        text += (text.empty() ? "" : ", ") + std::to_string(cut - begin);
        begin = cut;
    }
    return text + (text.empty() ? "" : " and ") + std::to_string(length - begin) + " bytes";
}

/// Where a rule changes a frame. @return beyond its end: nowhere
std::size_t placeOf(const CorruptTarget& target, const FrameView& frame, FaultDice& dice)
{
    switch (target.kind) {
    case CorruptTarget::Kind::FromEnd:
        return target.offset <= frame.length() ? frame.length() - target.offset : frame.length();
    case CorruptTarget::Kind::FromPayload:
        return frame.headerLength() + target.offset;
    case CorruptTarget::Kind::Any:
        return static_cast<std::size_t>(dice.below(frame.length()));
    case CorruptTarget::Kind::FromStart:
        break;
    }
    return target.offset;
}

std::string placeText(const CorruptTarget& target, std::size_t at)
{
    const bool isNamed = target.width > 1 || target.name.compare(0, 1, "m") == 0;
    return isNamed ? target.name : "byte " + std::to_string(at);
}

} // namespace

FrameFlow::Outgoing FrameFlow::pApplyRules(const FrameView& frame)
{
    Outgoing outgoing;
    outgoing.number = mFrames;
    outgoing.bytes.assign(frame.bytes(), frame.length());
    for (RuleState& state : mRules) {
        const FaultRule& rule = *state.rule;
        if (!rule.match.matchesFrame(frame, mFrames)) continue;
        if (rule.afterFrames && ++state.matched != *rule.afterFrames) continue;
        if (rule.times > 0 && state.done >= rule.times) continue;
        if (rule.probability < 1 && !mDice.comesTrue(rule.probability)) continue;
        ++state.done;
        pApply(rule, frame, outgoing);
        if (outgoing.isDropped) break;
    }
    return outgoing;
}

void FrameFlow::pApply(const FaultRule& rule, const FrameView& frame, Outgoing& outgoing)
{
    switch (rule.fault) {
    case Fault::Delay: {
        const auto range = static_cast<std::uint64_t>((rule.longest - rule.shortest).count());
        const FaultRule::Time delay =
            rule.shortest + FaultRule::Time(range == 0 ? 0 : static_cast<std::int64_t>(mDice.below(range + 1)));
        outgoing.delay += delay;
        pReport(mFrames, rule, "delayed by " + millisecondsText(delay));
        break;
    }
    case Fault::Split:
        outgoing.split = &rule;
        pReport(mFrames, rule,
                rule.cuts.empty() ? "split into " + std::to_string(frame.length()) + " single bytes"
                                  : "split into " + piecesText(rule.cuts, frame.length()));
        break;
    case Fault::Join:
        outgoing.join = &rule;
        break;
    case Fault::Drop:
        outgoing.isDropped = true;
        pReport(mFrames, rule, "dropped");
        break;
    case Fault::Duplicate:
        outgoing.copies += rule.count;
        pReport(mFrames, rule, "sent " + std::to_string(rule.count + 1) + " times");
        break;
    case Fault::Reorder:
        outgoing.reorder = &rule;
        break;
    case Fault::Corrupt:
        pCorrupt(rule, frame, outgoing);
        break;
    default:
        (rule.afterFrames ? outgoing.after : outgoing.instead) = &rule;
        break;
    }
}

void FrameFlow::pCorrupt(const FaultRule& rule, const FrameView& frame, Outgoing& outgoing)
{
    const CorruptTarget& target = rule.target;
    const std::size_t at = placeOf(target, frame, mDice);
    if (at >= frame.length() || target.width > frame.length() - at) {
        pReport(mFrames, rule,
                "not changed: " + target.name + " lies beyond its " + std::to_string(frame.length()) + " bytes");
        return;
    }
    const std::uint64_t mask = (std::uint64_t{1} << 8 * target.width) - 1;
    const std::string before = outgoing.bytes.substr(at, target.width);
    const std::uint64_t old = FrameView(outgoing.bytes.data(), outgoing.bytes.size()).number(at, target.width);
    const std::uint64_t value = rule.value ? *rule.value : (old + 1 + mDice.below(mask)) & mask; // always another one
    for (std::size_t i = 0; i < target.width; ++i)
        outgoing.bytes[at + i] = static_cast<char>(value >> 8 * (target.width - 1 - i));
    pReport(mFrames, rule,
            placeText(target, at) + " changed from " + hexDigits(before) + " to " +
                hexDigits(outgoing.bytes.substr(at, target.width)));
}

void FrameFlow::pReport(std::uint64_t number, const FaultRule& rule, const std::string& what)
{
    mObserver.onFault(mPlace, number, rule, what);
}

} // namespace qel::tool
