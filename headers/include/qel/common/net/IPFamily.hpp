#pragma once

#include <qel/common/QelExport.hpp>

#include <iosfwd>

namespace qel {

/// The family of an IP address. The numbers are the versions of the protocol, not the AF_ constants of the system.
enum class IPFamily : int { IPv4 = 4, IPv6 = 6 };

namespace IPFamilyUtils {

/// @return AF_INET or AF_INET6, the number the system's socket calls want (socket(2))
/// @throws std::invalid_argument  "Not an IP address family": the value is neither IPv4 nor IPv6
QEL_EXPORT int toUNIXAddressFamily(IPFamily family);

} // namespace IPFamilyUtils

/// Reads one word: "ipv4" or "ipv6", in any mixture of cases.
/// @throws std::invalid_argument  "Invalid IPFamily": the next word is anything else, or there is none; the value is
///                                left as it was
QEL_EXPORT std::istream& operator>>(std::istream& is, IPFamily& family);

/// Prints "IPv4" or "IPv6", which operator>> reads back; any other value prints as its number in decimal.
QEL_EXPORT std::ostream& operator<<(std::ostream& os, IPFamily family);

} // namespace qel
