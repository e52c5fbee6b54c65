#include "console/KeepAlive.hpp"

#include <qel/protocol/Error.hpp>

namespace qel::tool {

using std::chrono::milliseconds;

void KeepAlive::watch(Console& console, TimePoint now)
{
    mQuestion.reset();
    mConsole = &console;
    mHeardAt = now;
    mIsAsked = mIsSilent = false;
}

KeepAlive::Event KeepAlive::noteHeard(TimePoint now)
{
    mHeardAt = now;
    mIsAsked = false;
    pTakeAnswer(now);
    if (!mIsSilent) return Event::None;
    mIsSilent = false;
    return Event::Back;
}

void KeepAlive::postpone(TimePoint now)
{
    if (mIsSilent) return;
    mHeardAt = now;
    mIsAsked = false;
}

PollDeadline KeepAlive::deadline() const
{
    if (mInterval == milliseconds::zero() || mIsSilent) return {};
    return mHeardAt + (mIsAsked ? mInterval : mInterval / 2);
}

KeepAlive::Event KeepAlive::check(TimePoint now)
{
    if (mInterval == milliseconds::zero() || mIsSilent) return Event::None;
    if (!mIsAsked && now >= mHeardAt + mInterval / 2) pAsk(now);
    if (now < mHeardAt + mInterval) return Event::None;
    mIsSilent = true;
    return Event::Silent;
}

milliseconds KeepAlive::silence(TimePoint now) const
{
    return std::chrono::duration_cast<milliseconds>(now - mHeardAt);
}

/// A connection that takes nothing cannot be asked; its silence counts all the same.
void KeepAlive::pAsk(TimePoint now)
{
    mIsAsked = true;
    if (mQuestion || !PollSet(mConsole->getPollFd(PollEvents::Write)).poll().anyReady()) return;
    try {
        mAskedAt = now;
        mQuestion.emplace(mConsole->start(QelMessageGetQelTodReq()));
    } catch (const Error&) {
        return; // receiving will say why
    }
}

void KeepAlive::pTakeAnswer(TimePoint now)
{
    if (!mQuestion || !mQuestion->isReady()) return;
    mRoundTrip = std::chrono::duration_cast<std::chrono::microseconds>(now - mAskedAt);
    mQuestion.reset(); // a refusal is an answer as well, so its content does not matter
}

} // namespace qel::tool
