#pragma once

#include <qel/common/QelExport.hpp>

#include <iosfwd>

namespace qel {

/// The family of an IP address. The values are protocol versions, not the AF_ constants of the system.
enum class IPFamily : int { IPv4 = 4, IPv6 = 6 };

namespace IPFamilyUtils {

/// @return AF_INET or AF_INET6 (socket(2))
/// @throws std::invalid_argument  "Not an IP address family": the value is neither IPv4 nor IPv6
/// Thread safety: any thread.
QEL_EXPORT int toUNIXAddressFamily(IPFamily family);

} // namespace IPFamilyUtils

/// Reads one word: "ipv4" or "ipv6" in upper, lower or mixed case.
/// @throws std::invalid_argument  "Invalid IPFamily": another word, or none; the value is unchanged
QEL_EXPORT std::istream& operator>>(std::istream& is, IPFamily& family);

/// Prints "IPv4" or "IPv6", which operator>> reads back; any other value as a decimal integer.
QEL_EXPORT std::ostream& operator<<(std::ostream& os, IPFamily family);

} // namespace qel
