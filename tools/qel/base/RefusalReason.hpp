#pragma once

#include <qel/common/QelMessage.hpp>

#include <string>

namespace qel::tool {

/// Says in words why a request was refused and what to do about it, such as "partition 3 is held by another console;
/// --force takes it, --watch looks on". Covers every status that a hypervisor sends.
/// @param response  its function, operation and status are used
/// @param subject  what the request is about, such as "partition 3"; empty: nothing in particular
/// @return empty for a status without a text
std::string refusalReason(const QelMessage& response, const std::string& subject);

/// The name of the request that a response answers: that of "qel call", such as "get-mode", or words such as "open
/// session" for the steps that commands take by themselves.
/// @return empty for an unknown request
std::string requestName(const QelMessage& response);

/// The line for the user about a response with a status other than zero: the reason in words, then the status, as in
/// "partition 3 is held by another console; --force takes it, --watch looks on: 0x00000013
/// (QelMessageStatusConnectionNotAvailable)". Without words for the reason it begins with the name of the request:
/// "limits refused: ...".
/// @param subject  as for refusalReason()
std::string refusalText(const QelMessage& response, const std::string& subject = {});

} // namespace qel::tool
