#pragma once

#include "proxy/FaultRule.hpp"
#include "proxy/FrameView.hpp"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace qel::tool {

/// One direction of one connection.
struct FlowPlace {
    std::uint64_t connection = 0; ///< counted from 1
    Way way = Way::ToServer;
};

/// Hears what happens in a flow, in its order. Must not call the flow.
class FlowObserver {
public:
    virtual ~FlowObserver() = default;

    /// A frame has arrived whole. @param number  in its flow, from 1
    virtual void onFrame(const FlowPlace& place, std::uint64_t number, const FrameView& frame) = 0;

    /// A rule has done something. @param number  of the frame; 0: to no single frame
    virtual void onFault(const FlowPlace& place, std::uint64_t number, const FaultRule& rule,
                         const std::string& what) = 0;

    /// Something about the connection, for a person, such as that TLS begins.
    virtual void onNote(const FlowPlace& place, const std::string& text) = 0;
};

/// The frames and bytes of one direction on their way through the proxy, with the faults of a plan. It does no input or
/// output and reads no clock: it is told what arrives and when, and says what to send and when.
///
/// A direction without rules for its frames passes bytes on as they arrive, and divides them into frames only to tell
/// the observer. With such rules a frame leaves when it has arrived whole. Bytes that are not frames, as from the
/// beginning of TLS, pass unchanged; only rules that count bytes act on them. No byte is lost, added or moved without a
/// rule.
///
/// Memory: 80 KiB for what arrives, and about 256 KiB, times the copies of a rule, for what waits to leave.
/// Lifetime: borrows the plan and the observer. Thread safety: one thread.
class FrameFlow {
public:
    using TimePoint = std::chrono::steady_clock::time_point;
    static constexpr TimePoint kNever = TimePoint::max();

    /// What is to happen once next() has nothing more.
    enum class Ending {
        None,
        HalfClose, ///< end the direction towards the receiver
        Cut,       ///< end both directions of both sides
        Reset      ///< reset both sides
    };

    FrameFlow(const FlowPlace& place, const FaultPlan& plan, FlowObserver& observer);
    FrameFlow(const FrameFlow&) = delete;
    FrameFlow& operator=(const FrameFlow&) = delete;

    /// Whether there is room for more, and no rule keeps the proxy from reading.
    bool wantsInput(TimePoint now) const noexcept;

    /// Where to put what arrives. @param length  set to the room there, more than 0 while wantsInput()
    char* room(std::size_t& length);

    /// `count` bytes have been put there.
    void take(std::size_t count, TimePoint now);

    /// The sender has ended this direction.
    void takeEnd(TimePoint now);

    /// The bytes of the next write; empty: there is nothing to send at this time. Valid until the next call.
    std::string_view next(TimePoint now);

    /// `count` of these bytes have been sent.
    void sent(std::size_t count, TimePoint now);

    /// See Ending. A HalfClose may come from a rule, and then what arrives later is dropped.
    Ending ending() const noexcept;

    /// True when nothing more can leave: the direction has ended, or a rule has ended the connection.
    bool isOver() const noexcept;

    /// When next() may have something although nothing has arrived; kNever: it will not.
    TimePoint wakeAt(TimePoint now) const noexcept;

    std::uint64_t frameCount() const noexcept { return mFrames; }
    std::uint64_t arrivedBytes() const noexcept { return mArrived; }
    std::uint64_t sentBytes() const noexcept { return mSentBytes; }

private:
    /// A frame after the rules.
    struct Outgoing {
        std::uint64_t number = 0;
        std::string bytes;
        FaultRule::Time delay{0};
        std::uint64_t copies = 0; // besides itself
        const FaultRule* split = nullptr;
        const FaultRule* join = nullptr;
        const FaultRule* reorder = nullptr;
        const FaultRule* instead = nullptr; // ends something: the frame is not sent
        const FaultRule* after = nullptr;   // ends something when the frame has been sent
        bool isDropped = false;
    };

    /// A write, or something that a rule does when all before it has been sent.
    struct Chunk {
        std::string bytes;
        TimePoint due = TimePoint::min();
        bool takesMore = false;
        const FaultRule* action = nullptr;
        std::uint64_t number = 0; // of the frame, for the report
    };

    struct RuleState {
        const FaultRule* rule;
        std::uint64_t matched = 0; // frames
        std::uint64_t done = 0;
    };

    struct ByteLimit {
        const FaultRule* rule;
        bool isDone = false;
    };

    // What arrives.
    void pParse(TimePoint now);
    bool pParseFrame(TimePoint now);
    void pPassOther(TimePoint now);
    void pPass(const FrameView& frame, TimePoint now);

    // The rules.
    bool pIsMeant(const FrameView& frame) const noexcept;
    Outgoing pApplyRules(const FrameView& frame);
    void pApply(const FaultRule& rule, const FrameView& frame, Outgoing& outgoing);
    void pCorrupt(const FaultRule& rule, const FrameView& frame, Outgoing& outgoing);
    void pReport(std::uint64_t number, const FaultRule& rule, const std::string& what);

    // Towards the queue.
    void pPlace(Outgoing&& outgoing, TimePoint now);
    void pEmit(Outgoing&& outgoing, TimePoint now);
    void pSplit(const Outgoing& outgoing, TimePoint due, TimePoint now);
    void pJoin(Outgoing&& outgoing, TimePoint now);
    void pFlushHeld(TimePoint now, bool isLate);
    void pFlushJoined(TimePoint now);
    void pQueue(std::string_view bytes, TimePoint due, bool isOwnWrite);
    void pQueueAction(const FaultRule& rule, std::uint64_t number);
    TimePoint pDueAfter(FaultRule::Time delay, TimePoint now);

    // What leaves.
    bool pAct(const FaultRule& rule, std::uint64_t number, TimePoint now);
    bool pPassLimits(TimePoint now);
    bool pActInTurn(TimePoint now);
    std::string_view pWithinRate(std::string_view bytes, TimePoint now);
    std::string_view pWaiting(TimePoint now);
    void pConsume(std::size_t count);
    std::size_t pUnsent() const noexcept;
    std::size_t pKept() const noexcept;
    bool pIsPaused(TimePoint now) const noexcept { return mPausedUntil > now; }

    const FlowPlace mPlace;
    FlowObserver& mObserver;
    std::vector<RuleState> mRules; // those for frames of this flow
    std::vector<ByteLimit> mLimits;
    const FaultRule* mRate = nullptr;
    FaultDice mDice;
    const bool mHolds; // frames leave when they are whole

    std::vector<char> mInput;
    std::size_t mSent = 0;   // in mInput, while the flow does not hold frames
    std::size_t mParsed = 0; // in mInput: the beginning of an incomplete frame
    std::size_t mEnd = 0;    // in mInput
    bool mIsFrames = true;   // no byte that is not part of a frame has come yet
    bool mHasEnded = false;  // the sender has

    std::deque<Chunk> mQueue;
    std::size_t mFrontSent = 0; // bytes of the first chunk
    std::size_t mQueuedBytes = 0;
    std::string mSpare; // of a chunk that has been sent: its memory is used again
    TimePoint mLastDue = TimePoint::min();
    std::optional<Outgoing> mHeld; // until the next frame
    TimePoint mHeldUntil = kNever;
    std::vector<Outgoing> mJoined;
    TimePoint mJoinUntil = kNever;

    TimePoint mPausedUntil = TimePoint::min(); // kNever: for ever
    TimePoint mRateAt = TimePoint::min();      // the next write
    bool mSaidRate = false;
    bool mIsHalfClosed = false; // by a rule
    Ending mEnding = Ending::None;

    std::uint64_t mFrames = 0;
    std::uint64_t mArrived = 0;
    std::uint64_t mSentBytes = 0;
};

} // namespace qel::tool
