#pragma once

#include <qel/common/QelMessage.hpp>

#include <string>

namespace qel::tool {

/// Says in words why a request was refused and what to do about it, such as "partition 3 is held by another console;
/// --force takes it". Covers every status that a hypervisor sends.
/// @param response  its function, operation and status are used
/// @param subject  what the request is about, such as "partition 3"; empty: nothing in particular
/// @return empty for a status without a text
std::string refusalReason(const QelMessage& response, const std::string& subject);

} // namespace qel::tool
