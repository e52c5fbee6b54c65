#include "check/Transcript.hpp"

#include <utility>

namespace qel::tool::check {

void Transcript::add(Event event)
{
    if (mFirst.size() < kFirst) {
        mFirst.push_back(std::move(event));
        return;
    }
    mLast.push_back(std::move(event));
    if (mLast.size() <= kLast) return;
    mLast.pop_front();
    ++mOmitted;
}

} // namespace qel::tool::check
