#pragma once

#include <ostream>
#include <string>
#include <vector>

/// @file
/// Messages to the system log, captured within the process. A program that links CapturedSystemLog.cpp replaces the C
/// library's syslog by one that keeps the messages, for the calls of shared libraries too.

namespace qel::test {

/// A message to the system log, as the caller composed it.
struct SystemLogMessage {
    int priority; // LOG_ERR and the like
    std::string text;

    bool operator==(const SystemLogMessage& other) const { return priority == other.priority && text == other.text; }
};

std::ostream& operator<<(std::ostream& os, const SystemLogMessage& message);

/// Captures the messages to the system log from construction to destruction. A message that no object captures fails
/// the test. One at a time. Thread safety: any thread may write to the system log.
class CapturedSystemLog {
public:
    CapturedSystemLog();
    ~CapturedSystemLog();
    CapturedSystemLog(const CapturedSystemLog&) = delete;
    CapturedSystemLog& operator=(const CapturedSystemLog&) = delete;

    /// @return the messages so far, and forgets them
    std::vector<SystemLogMessage> take();
};

} // namespace qel::test
