#include "console/HeldInput.hpp"

#include <algorithm>

namespace qel::tool {

std::size_t HeldInput::add(const std::string& input, TimePoint now)
{
    if (mInput.empty()) mSince = now;
    const std::size_t taken = std::min(input.size(), kLimit - std::min(kLimit, mInput.size()));
    mInput.append(input, 0, taken);
    mDropped += input.size() - taken;
    return input.size() - taken;
}

bool HeldInput::noteSent(TimePoint now)
{
    mSince = now;
    if (!mInput.empty()) return false;
    const bool wasTold = mIsTold || mDropped > 0;
    clear();
    return wasTold;
}

PollDeadline HeldInput::deadline() const
{
    return mInput.empty() || mIsTold ? PollDeadline() : PollDeadline(mSince + kPatience);
}

bool HeldInput::isLate(TimePoint now)
{
    if (!deadline().isExpired(now)) return false;
    mIsTold = true;
    return true;
}

void HeldInput::clear()
{
    mInput.clear();
    mDropped = 0;
    mIsTold = false;
}

} // namespace qel::tool
