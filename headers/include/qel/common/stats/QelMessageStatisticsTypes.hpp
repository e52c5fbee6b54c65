#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>

#include <chrono>
#include <cstdint>
#include <iosfwd>

/// @file
/// The values that the statistics of a message queue consist of.
///
/// Thread safety: plain values.
/// Numbers print in decimal or with hexFormat(), whatever the base of the stream. The stream must not be left-aligned;
/// by default it is not.

namespace qel {

/// A number of messages, and the sum of their lengths as msgLength() returns them.
struct QelMessageCount {
    std::uint64_t mCount = 0; ///< messages
    std::uint64_t mBytes = 0; ///< bytes

    /// Adds a message.
    QelMessageCount& operator+=(const QelMessage& message)
    {
        ++mCount;
        mBytes += message.msgLength();
        return *this;
    }

    /// Subtracts a message, which must have been added before: the numbers wrap below zero.
    QelMessageCount& operator-=(const QelMessage& message)
    {
        --mCount;
        mBytes -= message.msgLength();
        return *this;
    }

    /// Adds field by field.
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

/// The latency of one message, and the message.
struct QelMessageLatency {
    unsigned int mCallerID = 0;
    unsigned short mFunction = 0;  ///< function code
    unsigned short mOperation = 0; ///< operation type
    std::chrono::nanoseconds mLatency = {};

    /// No message: all zero, not valid.
    QelMessageLatency() = default;

    QelMessageLatency(const QelMessage& message, const std::chrono::nanoseconds& latency)
        : mCallerID(message.getCallerId()), mFunction(message.getFunction()), mOperation(message.getOperation()),
          mLatency(latency)
    {}

    /// @return whether neither function code nor operation type is zero
    bool isValid() const noexcept { return mFunction != 0 && mOperation != 0; }
};

/// Prints caller id, function, operation and the latency in microseconds, rounded down:
/// "[CID=0x0000002A FN=0x6003 OP=0x8001 T=312004us]".
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageLatency& latency);

} // namespace qel
