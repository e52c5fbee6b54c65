#pragma once

#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/protocol/CommandEnd.hpp>
#include <qel/protocol/SerialSession.hpp>

#include <cstddef>
#include <cstdint>
#include <string>

namespace qel::protocol {

/// What a console knows of one virtual serial session. Thread safety: one thread.
struct SerialState {
    SerialState(std::uint16_t partitionId, std::uint16_t connectionNumber, std::size_t maxUnreadBytes)
        : partition(partitionId), connection(connectionNumber), maxUnread(maxUnreadBytes)
    {}

    const std::uint16_t partition;
    const std::uint16_t connection;
    const std::size_t maxUnread;
    bool isOpen = false; ///< at the hypervisor
    bool isHeld = false; ///< the hypervisor holds a session with this address for this console, of an earlier opening
    bool isClosing = false; ///< a call waits for that; output may exceed the limit
    std::uint64_t sent = 0; ///< bytes of input
    SessionEnd end = SessionEnd::None;
    CommandEnd commandEnd;

    /// Whether a notice is about this session while it is open.
    template <typename Notice>
    bool isMeant(const Notice& notice) const
    {
        return isOpen && notice.getLpId() == partition && notice.getVssConnectionNumber() == connection;
    }

    /// Keeps output.
    void append(const char* data, std::size_t length);
    /// Removes the oldest output. @return the number of bytes
    std::size_t take(char* buffer, std::size_t length) noexcept;
    std::size_t unreadBytes() const noexcept { return mOutput.size() - mTaken; }
    bool isFull() const noexcept { return !isClosing && unreadBytes() >= maxUnread; }

    /// The session has ended. The first reason stays.
    void finish(SessionEnd reason) noexcept;
    void finish(const QelMessageVirtualSerialSessionClosedAsync& notice);

private:
    std::string mOutput;
    std::size_t mTaken = 0; // bytes at the front of mOutput that have been read
};

} // namespace qel::protocol
