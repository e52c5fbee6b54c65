#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/protocol/DisconnectReason.hpp>
#include <qel/protocol/Peer.hpp>

#include "base/Library.hpp"

#include <cstdint>
#include <string>
#include <sys/types.h>

namespace qel::tool {

/// @file
/// The lines about who did what. docs/serve.md has their format: an event, then "key=value" in a fixed order. Texts of
/// the peer are quoted and safe to print.

/// "audit: connected console=1 name="alice" ..."
std::string auditConnected(const Peer& peer);

/// "audit: left console=1 name="alice" ... why=closed"
std::string auditLeft(const Peer& peer, DisconnectReason why);

/// "audit: ended console=1 name="alice" ... partition=1 connection=0 uid=1000": an operator has ended a session.
/// @param user  of the operator
std::string auditEnded(const Peer& peer, std::uint16_t partition, std::uint16_t connection, uid_t user);

/// "audit: break partition=1 uid=1000": an operator has sent a break.
std::string auditBreak(std::uint16_t partition, uid_t user);

/// The line about a request: opened, forced, watched, closed or refused.
/// @param status  of the response
/// @param by  what of the configuration has refused it: "rules" and so on; empty: it was the server by itself
/// @return empty: the request has no line, because it was granted and changes no session
std::string auditAnswered(const Peer& peer, const QelMessage& request, QelMessageStatusCodes status,
                          const std::string& by = {});

} // namespace qel::tool
