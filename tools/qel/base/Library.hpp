#pragma once

namespace qel::protocol {}

namespace qel::tool {

// The program is written in terms of the library: it uses its names without a prefix.
using namespace protocol;

} // namespace qel::tool
