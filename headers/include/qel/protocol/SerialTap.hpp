#pragma once

#include <qel/protocol/ProtocolExport.hpp>

#include <cstddef>
#include <cstdint>
#include <string>

namespace qel::protocol {

/// Listens to what a partition puts out, whoever holds its session: for a log of the line, for example. A tap belongs
/// to PartitionOptions; one object may serve several partitions.
///
/// Thread safety: one operation is called at a time for one partition, in the order of what happened. Operations for
/// different partitions may come from different threads at the same time. The server's lock is not held, so an
/// operation may take its time: the line's data wait for it, and so do those of the other lines. It must not call the
/// server.
class QEL_PROTOCOL_EXPORT SerialTap {
public:
    SerialTap() = default;
    virtual ~SerialTap();
    SerialTap(const SerialTap&) = delete;
    SerialTap& operator=(const SerialTap&) = delete;

    /// The partition has put out bytes: exactly what its line has read, in order, without gaps.
    virtual void onOutput(std::uint16_t partition, const char* data, std::size_t length) noexcept = 0;

    /// Something has happened to the line or to its sessions: one line of text without its end, such as "the command
    /// exited with status 3" or "line lost: connection refused; connecting again".
    virtual void onEvent(std::uint16_t partition, const std::string& text) noexcept = 0;
};

} // namespace qel::protocol
