#pragma once

#include "decode/FrameDecoder.hpp"

#include <nlohmann/json.hpp>

namespace qel::tool {

/// A frame as "qel decode --json" prints it: its place, its header in numbers and names, its bytes, and its dump.
/// @param item  has a message
nlohmann::ordered_json frameJson(const FrameDecoder::Item& item);

} // namespace qel::tool
