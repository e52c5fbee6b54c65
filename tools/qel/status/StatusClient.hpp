#pragma once

#include "status/StatusReport.hpp"

#include <chrono>
#include <nlohmann/json.hpp>
#include <string>

namespace qel::tool {

/// Which socket a client means: an option, else $QEL_STATUS_SOCKET, else the default of servers, else, if it is there
/// and the default is not, that of the service.
/// @return empty: none is known
std::string statusSocketFor(const std::string& option);

/// Asks a server over its status socket.
/// @param request  one line, without its end
/// @return the answer, an object
/// @throws CommandFailure  CannotConnect: no server is there; DeadlinePassed, ClosedByPeer, ProtocolBroken: it does not
///         answer as it should; Refused: it answers that it cannot do it, with its reason
nlohmann::ordered_json askServer(const std::string& path, const std::string& request,
                                 std::chrono::milliseconds timeout);

/// Asks for the status, and reads it. @throws CommandFailure  as askServer()
StatusReport askStatus(const std::string& path, std::chrono::milliseconds timeout);

} // namespace qel::tool
