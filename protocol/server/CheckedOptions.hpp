#pragma once

#include <qel/common/net/IPEndpoint.hpp>
#include <qel/protocol/ServerOptions.hpp>

#include <vector>

namespace qel::protocol {

/// Checks the options of a server, each by itself and against each other.
/// @return where to listen
/// @throws std::invalid_argument  begins with the name of the option: "listen: ..."
std::vector<IPEndpoint> checkOptions(const ServerOptions& options);

} // namespace qel::protocol
