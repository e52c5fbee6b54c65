#pragma once

#include <cstdint>

namespace qel::bench {

/// @return the segments with data that a connection has sent so far
/// @throws std::runtime_error  the kernel does not tell
std::uint32_t dataSegmentsSent(int descriptor);

} // namespace qel::bench
