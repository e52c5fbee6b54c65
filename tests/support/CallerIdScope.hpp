#pragma once

#include <qel/common/QelMessage.hpp>

namespace qel::test {

/// Sets the process-wide caller-id counter for the duration of a test. The counter is protected, hence the base class.
class CallerIdScope : private QelMessage {
public:
    /// @param last the id that counts as drawn last; the next one is one more
    explicit CallerIdScope(unsigned int last) : mPrevious(sCallerIdCounter.exchange(last)) {}
    ~CallerIdScope() override { sCallerIdCounter = mPrevious; }
    CallerIdScope(const CallerIdScope&) = delete;
    CallerIdScope& operator=(const CallerIdScope&) = delete;

    /// @return the id that was drawn last
    unsigned int last() const { return sCallerIdCounter; }

private:
    unsigned int mPrevious;
};

} // namespace qel::test
