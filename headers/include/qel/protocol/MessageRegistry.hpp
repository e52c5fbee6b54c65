#pragma once

#include <qel/common/QelMessageRegistry.hpp>
#include <qel/protocol/ProtocolExport.hpp>

namespace qel::protocol {

/// The registry of the messages between consoles and hypervisors; one for the process, valid until it exits.
/// Thread safety: any thread.
QEL_PROTOCOL_EXPORT QelMessageRegistry& messageRegistry();

} // namespace qel::protocol
