#pragma once

#include <qel/common/io/StreamIOException.hpp>

#include <string>

namespace qel::protocol {

/// Whether a stream failed because a deadline passed. A stream reports that in two ways: with the text "I/O deadline"
/// when the deadline passed before the wait began, and with the system's EAGAIN as the cause when it passed during it.
bool isDeadline(const StreamIOException& error);

/// Throws what a failure of a stream means to a caller: DeadlinePassed ("the peer did not answer in time: ...") or
/// ClosedByPeer ("connection lost: ..."), with the cause in the text and nested. Call it in a catch clause.
/// @param peer  for Error::getPeer()
[[noreturn]] void throwStreamFailure(const StreamIOException& error, const std::string& peer);

} // namespace qel::protocol
