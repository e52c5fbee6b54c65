#pragma once

#include <qel/common/QelMessage.hpp>

namespace qel::test {

/// Sets the process-wide caller-id counter for the length of a test.
class CallerIdScope {
public:
    /// @param last taken for the id that was handed out last; the next one is one more
    explicit CallerIdScope(unsigned int last) : mPrevious(QelMessage::sCallerIdCounter.exchange(last)) {}
    ~CallerIdScope() { QelMessage::sCallerIdCounter = mPrevious; }
    CallerIdScope(const CallerIdScope&) = delete;
    CallerIdScope& operator=(const CallerIdScope&) = delete;

    /// @return the id that was handed out last
    unsigned int last() const { return QelMessage::sCallerIdCounter; }

private:
    unsigned int mPrevious;
};

} // namespace qel::test
