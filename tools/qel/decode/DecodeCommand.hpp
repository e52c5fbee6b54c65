#pragma once

#include "base/Program.hpp"

#include <CLI/CLI.hpp>
#include <istream>
#include <ostream>

namespace qel::tool {

/// Adds "qel decode": reads frames and prints each.
CLI::App& addDecodeCommand(CLI::App& parent, Action& action);

/// The form of the input. Guess: raw frames, hexadecimal text or a pcap capture, by the first bytes.
enum class FrameNotation { Guess, Raw, Hex };

/// Prints every frame of the input: its offset, its one-line id and its dump, or all frames as one JSON document.
/// Malformed frames go to `errors`, with offset and reason. Offsets count bytes of frames, not characters of text. The
/// contents of a frame are escaped, so that printing them on a terminal is safe.
/// @return Done when all frames are well-formed, else Refused
/// @throws CommandFailure  Failed: the input cannot be read to its end
ExitStatus decodeFrames(std::istream& input, FrameNotation notation, bool json, std::ostream& output,
                        std::ostream& errors);

} // namespace qel::tool
