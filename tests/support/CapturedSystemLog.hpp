#pragma once

#include <ostream>
#include <string>
#include <vector>

/// @file
/// The system log, caught before it leaves the process. A program that links CapturedSystemLog.cpp replaces the C
/// library's syslog by one that keeps the messages: a function of the executable wins over that of a shared library,
/// for the calls of other shared libraries too.

namespace qel::test {

/// A message to the system log, as the caller composed it.
struct SystemLogMessage {
    int priority; // LOG_ERR and the like
    std::string text;

    bool operator==(const SystemLogMessage& other) const { return priority == other.priority && text == other.text; }
};

std::ostream& operator<<(std::ostream& os, const SystemLogMessage& message);

/// Keeps what goes to the system log from its construction to its destruction. A message while there is none of these
/// fails the test. One at a time.
/// Thread safety: any thread may write to the system log meanwhile.
class CapturedSystemLog {
public:
    CapturedSystemLog();
    ~CapturedSystemLog();
    CapturedSystemLog(const CapturedSystemLog&) = delete;
    CapturedSystemLog& operator=(const CapturedSystemLog&) = delete;

    /// @return the messages so far, which are forgotten
    std::vector<SystemLogMessage> take();
};

} // namespace qel::test
