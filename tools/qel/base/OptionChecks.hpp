#pragma once

#include <qel/common/net/IPAddress.hpp>

#include <CLI/CLI.hpp>
#include <cstdint>

/// @file
/// What the values of options have to be, said in the same words by every command.

namespace qel::tool {

/// Accepts the text of an endpoint: "127.0.0.1:4711", "[::1]:4711".
CLI::Validator endpointValidator();

/// Accepts the text of a capability set, as QelCapabilities takes it: up to 32 characters 0 and 1.
CLI::Validator capabilityValidator();

/// Accepts the name of a file that is to be read, unless there is none of that name. A file that cannot be reached or
/// read is no wrong command line: that shows when it is opened.
CLI::Validator fileValidator();

/// Accepts a number from one to the other, both included, and nothing that is no number, such as "nan".
CLI::Validator numberBetween(double least, double most);

/// For options that take whole numbers: a number from one to the other, both included, in decimal or, behind "0x", in
/// hexadecimal digits. Zeros in front mean nothing, so that 010 is ten here as it is everywhere else on a command line.
/// To be used with transform(): the parser itself would take 010 for an octal number.
CLI::Validator wholeNumberBetween(std::uint64_t least, std::uint64_t most);

/// 127.0.0.0/8, ::1, and the former as an IPv4-mapped IPv6 address.
bool isLoopback(const IPAddress& address);

} // namespace qel::tool
