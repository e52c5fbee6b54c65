#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/net/IPFamily.hpp>
#include <qel/common/net/IPv4Address.hpp>
#include <qel/common/net/IPv6Address.hpp>

#include <cstddef>
#include <iosfwd>
#include <string>

namespace qel {

/// An IP address of either family.
/// Thread safety: a plain value.
class QEL_EXPORT IPAddress {
public:
    /// 0.0.0.0
    IPAddress() noexcept;

    /// @param family  says how many of the bytes are taken: the first 4 or the first 16
    /// @param bytes   the address in network order, copied; may be at any memory address
    /// @param length  the bytes there are, at least as many as are taken
    /// @throws std::invalid_argument  "family": neither IPv4 nor IPv6; "length": too few bytes; "bytes": a null pointer
    IPAddress(IPFamily family, const void* bytes, unsigned length);

    IPAddress(const IPv4Address& address) noexcept;
    IPAddress(const IPv6Address& address) noexcept;

    IPFamily getFamily() const noexcept { return mFamily; }

    /// @return the address; the reference lives as long as this object and its family stays the same
    /// @throws std::invalid_argument  "family": the address is of the other family
    const IPv4Address& getIPv4() const;
    const IPv6Address& getIPv6() const;

    /// @return size() bytes in network order, owned by this object
    const unsigned char* bytes() const noexcept;
    /// @return 4 or 16
    std::size_t size() const noexcept;

    /// @return the text form of the address of its family; no brackets
    std::string str() const;

    /// Compares by family first (IPv4 before IPv6), then by the bytes.
    /// @return -1, 0 or 1: this address is before, equal to or behind the other
    int compare(const IPAddress& other) const noexcept;

    friend bool operator==(const IPAddress& a, const IPAddress& b) noexcept { return a.compare(b) == 0; }
    friend bool operator!=(const IPAddress& a, const IPAddress& b) noexcept { return a.compare(b) != 0; }
    friend bool operator<(const IPAddress& a, const IPAddress& b) noexcept { return a.compare(b) < 0; }
    friend bool operator>(const IPAddress& a, const IPAddress& b) noexcept { return a.compare(b) > 0; }
    friend bool operator<=(const IPAddress& a, const IPAddress& b) noexcept { return a.compare(b) <= 0; }
    friend bool operator>=(const IPAddress& a, const IPAddress& b) noexcept { return a.compare(b) >= 0; }

private:
    union IPAddressUnion {
        IPAddressUnion(const IPv4Address& address) noexcept : mIPv4(address) {}
        IPAddressUnion(const IPv6Address& address) noexcept : mIPv6(address) {}

        IPv4Address mIPv4;
        IPv6Address mIPv6;
    };

    IPFamily mFamily; // which member of mAddress is live
    IPAddressUnion mAddress;
};

/// Prints str().
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const IPAddress& address);

} // namespace qel
