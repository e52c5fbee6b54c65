#pragma once

#include "check/Case.hpp"

/// @file
/// The cases for a server, one function for each family. A case is added here and nowhere else; docs/conformance.md is
/// printed from them.

namespace qel::tool::check {

/// All of them, in the order in which they run.
Cases serverCases();

Cases frameHeaderCases(); ///< frame/: header, lengths, pad
Cases frameStreamCases(); ///< frame/: split and joined frames, the end of the stream

} // namespace qel::tool::check
