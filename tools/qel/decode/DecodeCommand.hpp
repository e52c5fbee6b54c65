#pragma once

#include "base/Program.hpp"

#include <CLI/CLI.hpp>
#include <istream>
#include <ostream>

namespace qel::tool {

/// "qel decode": reads frames back to back and prints each.
CLI::App& addDecodeCommand(CLI::App& parent, Action& action);

/// How the bytes of frames are written in the input.
enum class FrameNotation { Guess, Raw, Hex };

/// Prints every frame of the input: where it lies, its one-line ID and its full dump, or all of them as one JSON
/// document. What is wrong with a frame, or what is none, is named on `errors`, with its offset and the reason. Offsets
/// count the bytes of the frames, also where those are written as text. Nothing that a frame contains can do anything
/// to a terminal that its text is printed on.
/// @return Done when all of the input is good frames; Refused when something is not
/// @throws CommandFailure  Failed: the input cannot be read to its end
ExitStatus decodeFrames(std::istream& input, FrameNotation notation, bool json, std::ostream& output,
                        std::ostream& errors);

} // namespace qel::tool
