#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>

#include <chrono>
#include <cstdint>
#include <iosfwd>

/// @file
/// The values that the statistics of a message queue consist of. They are plain values: copy and compare them as you
/// like; one thread at a time.
///
/// All numbers print in decimal or with hexFormat(), whatever base the stream was left in. They expect a stream without
/// left alignment, as every fresh stream is.

namespace qel {

/// How many messages, and how many bytes they have together: whole frames, as msgLength() counts them.
struct QelMessageCount {
    std::uint64_t mCount = 0; ///< messages
    std::uint64_t mBytes = 0; ///< bytes

    /// One message more.
    QelMessageCount& operator+=(const QelMessage& message)
    {
        ++mCount;
        mBytes += message.msgLength();
        return *this;
    }

    /// One message less. It must have been added before: the numbers go round below zero.
    QelMessageCount& operator-=(const QelMessage& message)
    {
        --mCount;
        mBytes -= message.msgLength();
        return *this;
    }

    QelMessageCount& operator+=(const QelMessageCount& other) noexcept
    {
        mCount += other.mCount;
        mBytes += other.mBytes;
        return *this;
    }
};

/// Prints messages and bytes: "12 (3456 B)".
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageCount& count);

/// Messages and bytes per second.
struct QelMessageThroughput {
    QelMessageCount mPerSecond;
};

/// Prints both rates: "12 m/s (3456 B/s)".
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageThroughput& throughput);

/// How long one message took, and which message it was.
struct QelMessageLatency {
    unsigned int mCallerID = 0;
    unsigned short mFunction = 0;  ///< function code
    unsigned short mOperation = 0; ///< operation type
    std::chrono::nanoseconds mLatency = {};

    /// No message: all zero, and not valid.
    QelMessageLatency() = default;

    QelMessageLatency(const QelMessage& message, const std::chrono::nanoseconds& latency)
        : mCallerID(message.getCallerId()), mFunction(message.getFunction()), mOperation(message.getOperation()),
          mLatency(latency)
    {}

    /// @return whether both function code and operation type are other than zero
    bool isValid() const noexcept { return mFunction != 0 && mOperation != 0; }
};

/// Prints caller id, function, operation and the latency in whole microseconds:
/// "[CID=0x0000002A FN=0x6003 OP=0x8001 T=312004us]".
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageLatency& latency);

} // namespace qel
