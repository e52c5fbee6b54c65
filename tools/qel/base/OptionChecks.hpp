#pragma once

#include <qel/protocol/ServerAddress.hpp>

#include "base/Library.hpp"

#include <CLI/CLI.hpp>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

/// @file
/// Checks of option values. Every command uses these, so the same mistake gets the same message everywhere.

namespace qel::tool {

/// Reads an integer. This is the one rule for all integers on a command line: decimal digits, or hexadecimal digits
/// after "0x"; leading zeros mean nothing, so 010 is ten.
/// @return none when the text is not such an integer or the value does not fit 64 bits
std::optional<std::uint64_t> parseInteger(const std::string& text);

/// Accepts an integer in [min, max], as parseInteger() reads it, and leaves it in decimal.
/// Use it with transform(): CLI11 by itself would read 010 as octal.
CLI::Validator integerIn(std::uint64_t min, std::uint64_t max);

/// The message of integerIn(): `"x" is not an integer in [1, 255]`.
std::string notAnIntegerIn(const std::string& text, std::uint64_t min, std::uint64_t max);

/// Accepts a number in [min, max]; NaN is refused.
CLI::Validator numberIn(double min, double max);

/// Accepts one of these words; names the nearest one otherwise.
CLI::Validator oneOf(std::vector<std::string> words);

/// Accepts at most `bytes` bytes of text.
CLI::Validator textUpTo(std::size_t bytes);

/// Accepts an IP address and port: "127.0.0.1:4711", "[::1]:4711".
CLI::Validator endpointValidator();

/// The port of a server unless an option says otherwise. Debian's services(5) has no service on it.
constexpr std::uint16_t kDefaultPort = 4717;

/// Adds the default port to an address or a name that has none; leaves everything else to other checks. Use it with
/// transform().
CLI::Validator defaultPort();

/// Accepts where a server can be reached, as ServerAddress::parse() does: "hypervisor.example:4711", "127.0.0.1:4711".
CLI::Validator serverValidator();

/// Accepts a capability set as QelCapabilities does: up to 32 characters, each 0 or 1.
CLI::Validator capabilityValidator();

/// Accepts the name of an existing file. A file that exists but cannot be read is not a usage error: opening it fails
/// later, with the reason.
CLI::Validator fileValidator();

/// An option of a command by its long name, without dashes. CLI::App::get_option() would end the process for want of
/// memory.
/// @return null: the command has no such option
CLI::Option* findOption(CLI::App& command, const std::string& name);

/// Replaces the description of an option that others have added.
/// @param name  with its dashes, such as "--timeout"; an option of the command
void describeOption(CLI::App& command, const std::string& name, const std::string& description);

} // namespace qel::tool
