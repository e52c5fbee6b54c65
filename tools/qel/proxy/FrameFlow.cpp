#include "proxy/FrameFlow.hpp"

#include <qel/common/QelMessage.hpp>

#include <algorithm>
#include <cstring>
#include <utility>

namespace qel::tool {

namespace {

constexpr std::size_t kReadBytes = 64 * 1024;
constexpr std::size_t kQueueBytes = 256 * 1024; // that may wait before reading stops
constexpr std::size_t kPrefixBytes = 8;         // up to the end of mMsgLength

/// A TLS record: its type, and the major version 3.
bool beginsLikeTls(const char* bytes, std::size_t length)
{
    constexpr char kFirstType = 0x14;
    constexpr char kLastType = 0x17;
    return bytes[0] >= kFirstType && bytes[0] <= kLastType && (length == 1 || bytes[1] == 3);
}

} // namespace

FrameFlow::FrameFlow(const FlowPlace& place, const FaultPlan& plan, FlowObserver& observer)
    : mPlace(place), mObserver(observer), mDice(plan.seed, place.connection, place.way),
      mHolds(std::any_of(plan.rules.begin(), plan.rules.end(), [&](const FaultRule& rule) {
          return rule.needsFrames() && rule.match.matchesFlow(place.way, place.connection);
      }))
{
    for (const FaultRule& rule : plan.rules) {
        if (!rule.match.matchesFlow(place.way, place.connection)) continue;
        if (rule.afterBytes) {
            mLimits.push_back({&rule});
        } else if (rule.fault == Fault::Rate) {
            if (mRate == nullptr || rule.bytesPerSecond < mRate->bytesPerSecond) mRate = &rule;
        } else {
            mRules.push_back({&rule});
        }
    }
    mInput.resize(kReadBytes + QelMessage::MtuMax);
}

bool FrameFlow::wantsInput(TimePoint now) const noexcept
{
    if (mHasEnded || mEnding == Ending::Cut || mEnding == Ending::Reset || pIsPaused(now)) return false;
    return mHolds ? pUnsent() < kQueueBytes : pUnsent() < kReadBytes / 2;
}

char* FrameFlow::room(std::size_t& length)
{
    const std::size_t kept = mHolds ? mParsed : std::min(mSent, mParsed);
    const bool isEmpty = kept == mEnd;
    if (isEmpty || mInput.size() - mEnd < QelMessage::MtuMax) {
        std::memmove(mInput.data(), mInput.data() + kept, mEnd - kept);
        mEnd -= kept;
        mParsed -= kept;
        mSent -= std::min(mSent, kept);
    }
    length = mInput.size() - mEnd;
    return mInput.data() + mEnd;
}

void FrameFlow::take(std::size_t count, TimePoint now)
{
    mEnd += count;
    mArrived += count;
    pParse(now);
}

void FrameFlow::takeEnd(TimePoint now)
{
    mHasEnded = true;
    const std::size_t rest = mEnd - mParsed;
    if (rest > 0 && mIsFrames) mObserver.onNote(mPlace, "ends after " + std::to_string(rest) + " bytes of a frame");
    if (!mHolds) return;
    pFlushHeld(now, true);
    pFlushJoined(now);
    pPassOther(now);
}

void FrameFlow::pParse(TimePoint now)
{
    while (mIsFrames && mParsed < mEnd && pParseFrame(now))
        continue;
    if (!mIsFrames) pPassOther(now);
}

/// @return false: the next frame has not arrived whole, or what follows is no frame
bool FrameFlow::pParseFrame(TimePoint now)
{
    constexpr const auto& kEyecatcher = QelMessage::CommonHeader::DaxCmdDesc;
    const char* const bytes = mInput.data() + mParsed;
    const std::size_t there = mEnd - mParsed;
    if (std::memcmp(bytes, kEyecatcher, std::min(there, sizeof(kEyecatcher))) != 0) {
        mIsFrames = false;
        mObserver.onNote(mPlace, beginsLikeTls(bytes, there)
                                     ? "TLS begins: bytes pass unchanged from here on and are not shown"
                                     : "what follows does not begin like a frame: bytes pass unchanged from here on");
        return false;
    }
    if (there < kPrefixBytes) return false;
    const std::size_t length = FrameView(bytes, there).number(4, 4);
    if (length <= kPrefixBytes || length > QelMessage::MtuMax) {
        mIsFrames = false;
        mObserver.onNote(mPlace, "a frame gives " + std::to_string(length) +
                                     " as its length: bytes pass unchanged from here on");
        return false;
    }
    if (there < length) return false;
    const FrameView frame(bytes, length);
    ++mFrames;
    mObserver.onFrame(mPlace, mFrames, frame);
    if (mHolds) pPass(frame, now);
    mParsed += length;
    return true;
}

/// Passes on what is not part of a frame.
void FrameFlow::pPassOther(TimePoint now)
{
    if (mHolds && mEnd > mParsed) {
        pFlushHeld(now, true);
        pFlushJoined(now);
        pQueue({mInput.data() + mParsed, mEnd - mParsed}, pDueAfter({}, now), false);
    }
    mParsed = mEnd;
}

void FrameFlow::pPass(const FrameView& frame, TimePoint now)
{
    if (!mHeld && mJoined.empty() && !pIsMeant(frame)) {
        pQueue({frame.bytes(), frame.length()}, pDueAfter({}, now), false);
        return;
    }
    Outgoing outgoing = pApplyRules(frame);
    const FaultRule* const after = outgoing.after;
    if (outgoing.instead != nullptr) {
        pFlushHeld(now, true);
        pFlushJoined(now);
        pQueueAction(*outgoing.instead, mFrames);
        // To stop reading keeps the frame for later; all else ends this direction before it.
        if (outgoing.instead->fault != Fault::StopReading) return;
    }
    if (!outgoing.isDropped) pPlace(std::move(outgoing), now);
    if (after == nullptr) return;
    pFlushHeld(now, true);
    pFlushJoined(now);
    pQueueAction(*after, mFrames);
}

/// Whether a rule matches the frame.
bool FrameFlow::pIsMeant(const FrameView& frame) const noexcept
{
    return std::any_of(mRules.begin(), mRules.end(),
                       [&](const RuleState& state) { return state.rule->match.matchesFrame(frame, mFrames); });
}

/// A frame that is held back leaves after the one that follows it.
void FrameFlow::pPlace(Outgoing&& outgoing, TimePoint now)
{
    if (mHeld) {
        Outgoing held = std::move(*mHeld);
        mHeld.reset();
        mHeldUntil = kNever;
        pReport(held.number, *held.reorder, "sent after frame " + std::to_string(outgoing.number));
        pEmit(std::move(outgoing), now);
        pEmit(std::move(held), now);
    } else if (outgoing.reorder != nullptr) {
        mHeldUntil = now + outgoing.reorder->within;
        mHeld = std::move(outgoing);
    } else {
        pEmit(std::move(outgoing), now);
    }
}

void FrameFlow::pFlushHeld(TimePoint now, bool isLate)
{
    if (!mHeld) return;
    Outgoing held = std::move(*mHeld);
    mHeld.reset();
    mHeldUntil = kNever;
    if (isLate) pReport(held.number, *held.reorder, "not reordered: no frame followed in time");
    pEmit(std::move(held), now);
}

void FrameFlow::pEmit(Outgoing&& outgoing, TimePoint now)
{
    if (outgoing.join != nullptr) {
        pJoin(std::move(outgoing), now);
        return;
    }
    pFlushJoined(now);
    const TimePoint due = pDueAfter(outgoing.delay, now);
    for (std::uint64_t copy = 0; copy <= outgoing.copies; ++copy) {
        if (outgoing.split != nullptr) {
            pSplit(outgoing, due, now);
        } else {
            pQueue(outgoing.bytes, due, false);
        }
    }
}

void FrameFlow::pSplit(const Outgoing& outgoing, TimePoint due, TimePoint now)
{
    const FaultRule& rule = *outgoing.split;
    const bool pauses = rule.pause.count() > 0;
    if (pauses) due = std::max(due, now);
    std::size_t begin = 0;
    const auto add = [&](std::size_t end) {
        if (end <= begin) return;
        pQueue(std::string_view(outgoing.bytes).substr(begin, end - begin), due, true);
        if (pauses) due += rule.pause;
        begin = end;
    };
    for (std::size_t end = 1; rule.cuts.empty() && end < outgoing.bytes.size(); ++end)
        add(end);
    for (const std::size_t cut : rule.cuts)
        add(std::min(cut, outgoing.bytes.size()));
    add(outgoing.bytes.size());
}

void FrameFlow::pJoin(Outgoing&& outgoing, TimePoint now)
{
    if (mJoined.empty()) mJoinUntil = now + outgoing.join->within;
    const std::uint64_t wanted = outgoing.join->count;
    mJoined.push_back(std::move(outgoing));
    if (mJoined.size() >= wanted) pFlushJoined(now);
}

void FrameFlow::pFlushJoined(TimePoint now)
{
    if (mJoined.empty()) return;
    const std::vector<Outgoing> joined = std::exchange(mJoined, {});
    mJoinUntil = kNever;
    std::string bytes;
    FaultRule::Time delay{0};
    for (const Outgoing& one : joined) {
        for (std::uint64_t copy = 0; copy <= one.copies; ++copy)
            bytes += one.bytes;
        delay = std::max(delay, one.delay);
    }
    const Outgoing& first = joined.front();
    pReport(first.number, *first.join,
            joined.size() == 1 ? std::string("not joined: no frame followed in time")
                               : "joined with the " + std::to_string(joined.size() - 1) +
                                     " that followed into one write of " + std::to_string(bytes.size()) + " bytes");
    pQueue(bytes, pDueAfter(delay, now), true);
}

/// Frames keep their order, so one that is delayed delays those after it.
FrameFlow::TimePoint FrameFlow::pDueAfter(FaultRule::Time delay, TimePoint now)
{
    if (delay.count() > 0) return std::max(mLastDue, now + delay);
    return mLastDue > now ? mLastDue : TimePoint::min();
}

void FrameFlow::pQueue(std::string_view bytes, TimePoint due, bool isOwnWrite)
{
    mLastDue = std::max(mLastDue, due);
    mQueuedBytes += bytes.size();
    if (!isOwnWrite && !mQueue.empty()) {
        Chunk& last = mQueue.back();
        if (last.takesMore && last.due == due && last.bytes.size() < kReadBytes) {
            last.bytes += bytes;
            return;
        }
    }
    Chunk chunk;
    if (!isOwnWrite) chunk.bytes = std::exchange(mSpare, {}); // has room for the frames that follow
    chunk.bytes.assign(bytes);
    chunk.due = due;
    chunk.takesMore = !isOwnWrite;
    mQueue.push_back(std::move(chunk));
}

void FrameFlow::pQueueAction(const FaultRule& rule, std::uint64_t number)
{
    Chunk chunk;
    chunk.due = mLastDue;
    chunk.action = &rule;
    chunk.number = number;
    mQueue.push_back(std::move(chunk));
}

std::string_view FrameFlow::next(TimePoint now)
{
    if (now >= mHeldUntil) pFlushHeld(now, true);
    if (now >= mJoinUntil) pFlushJoined(now);
    for (;;) {
        if (mEnding == Ending::Cut || mEnding == Ending::Reset || pIsPaused(now)) return {};
        if (!pPassLimits(now)) continue;
        std::string_view bytes = pWaiting(now);
        if (bytes.empty()) {
            if (!pActInTurn(now)) return {};
            continue;
        }
        for (const ByteLimit& limit : mLimits) {
            if (!limit.isDone) bytes = bytes.substr(0, *limit.rule->afterBytes - mSentBytes);
        }
        if (!mIsHalfClosed) return mRate == nullptr ? bytes : pWithinRate(bytes, now);
        pConsume(bytes.size());
    }
}

/// Lets the rule act whose turn in the queue has come.
/// @return false: there is none
bool FrameFlow::pActInTurn(TimePoint now)
{
    if (!mHolds || mQueue.empty() || mQueue.front().action == nullptr || mQueue.front().due > now) return false;
    const Chunk chunk = std::move(mQueue.front());
    mQueue.pop_front();
    static_cast<void>(pAct(*chunk.action, chunk.number, now));
    return true;
}

/// What the rate lets go now; empty: nothing.
std::string_view FrameFlow::pWithinRate(std::string_view bytes, TimePoint now)
{
    if (!mSaidRate) {
        mSaidRate = true;
        pReport(0, *mRate, "limited to " + std::to_string(mRate->bytesPerSecond) + " bytes a second");
    }
    if (now < mRateAt) return {};
    constexpr std::uint64_t kWritesPerSecond = 100;
    constexpr std::uint64_t kLongest = 16 * 1024;
    const std::uint64_t piece = mRate->bytesPerSecond / kWritesPerSecond;
    return bytes.substr(0, std::clamp<std::uint64_t>(piece, 1, kLongest));
}

/// Lets the rules act whose number of bytes has been sent.
/// @return false: one has acted
bool FrameFlow::pPassLimits(TimePoint now)
{
    for (ByteLimit& limit : mLimits) {
        if (limit.isDone || mSentBytes < *limit.rule->afterBytes) continue;
        limit.isDone = true;
        if (mDice.comesTrue(limit.rule->probability)) return pAct(*limit.rule, 0, now);
    }
    return true;
}

/// @return false
bool FrameFlow::pAct(const FaultRule& rule, std::uint64_t number, TimePoint now)
{
    switch (rule.fault) {
    case Fault::Cut:
        mEnding = Ending::Cut;
        pReport(number, rule, "the connection is cut: both sides see its end");
        break;
    case Fault::Reset:
        mEnding = Ending::Reset;
        pReport(number, rule, "both sides are reset");
        break;
    case Fault::HalfClose:
        mIsHalfClosed = true;
        pReport(number, rule, "this direction is ended; what still arrives is dropped");
        break;
    default:
        mPausedUntil = rule.pause.count() == 0 ? kNever : now + rule.pause;
        pReport(number, rule,
                rule.pause.count() == 0
                    ? std::string("nothing more is read")
                    : "nothing is read for " +
                          std::to_string(std::chrono::duration_cast<std::chrono::milliseconds>(rule.pause).count()) +
                          " ms");
        break;
    }
    return false;
}

/// What could be sent now.
std::string_view FrameFlow::pWaiting(TimePoint now)
{
    if (!mHolds) return {mInput.data() + mSent, mEnd - mSent};
    if (mQueue.empty()) return {};
    const Chunk& front = mQueue.front();
    if (front.due > now) return {};
    return std::string_view(front.bytes).substr(mFrontSent);
}

void FrameFlow::sent(std::size_t count, TimePoint now)
{
    mSentBytes += count;
    pConsume(count);
    if (mRate == nullptr) return;
    const std::chrono::duration<double> time(static_cast<double>(count) / static_cast<double>(mRate->bytesPerSecond));
    mRateAt = std::max(mRateAt, now) + std::chrono::duration_cast<FaultRule::Time>(time);
}

void FrameFlow::pConsume(std::size_t count)
{
    if (!mHolds) {
        mSent += count;
        return;
    }
    mFrontSent += count;
    if (mFrontSent < mQueue.front().bytes.size()) return;
    mQueuedBytes -= mQueue.front().bytes.size();
    mSpare = std::move(mQueue.front().bytes);
    mQueue.pop_front();
    mFrontSent = 0;
}

std::size_t FrameFlow::pUnsent() const noexcept { return mHolds ? mQueuedBytes + pKept() : mEnd - mSent; }

/// What rules hold back, besides the queue.
std::size_t FrameFlow::pKept() const noexcept
{
    std::size_t bytes = mHeld ? mHeld->bytes.size() : 0;
    for (const Outgoing& one : mJoined)
        bytes += one.bytes.size() * (one.copies + 1);
    return bytes;
}

FrameFlow::Ending FrameFlow::ending() const noexcept
{
    if (mEnding != Ending::None) return mEnding;
    if (mIsHalfClosed) return Ending::HalfClose;
    const bool isEmpty = mHolds ? mQueue.empty() && !mHeld && mJoined.empty() : mSent == mEnd;
    return mHasEnded && isEmpty ? Ending::HalfClose : Ending::None;
}

bool FrameFlow::isOver() const noexcept
{
    const Ending now = ending();
    return now == Ending::Cut || now == Ending::Reset || (now == Ending::HalfClose && mHasEnded);
}

FrameFlow::TimePoint FrameFlow::wakeAt(TimePoint now) const noexcept
{
    if (mEnding != Ending::None || mPausedUntil == kNever) return kNever;
    if (pIsPaused(now)) return mPausedUntil;
    TimePoint wake = std::min(mHeldUntil, mJoinUntil);
    if (pUnsent() == 0 && mQueue.empty()) return wake;
    if (mHolds && !mQueue.empty() && mQueue.front().due > now) return std::min(wake, mQueue.front().due);
    if (mRate != nullptr && mRateAt > now) return std::min(wake, mRateAt);
    return wake;
}

} // namespace qel::tool
