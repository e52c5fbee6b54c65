#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/net/IPFamily.hpp>
#include <qel/common/net/IPv4Address.hpp>
#include <qel/common/net/IPv6Address.hpp>
#include <qel/common/util/Comparable.hpp>

#include <cstddef>
#include <iosfwd>
#include <string>

namespace qel {

/// An IP address of either family. Compares by family first (IPv4 before IPv6), then by address.
/// Thread safety: a plain value.
class QEL_EXPORT IPAddress : public Comparable<IPAddress> {
public:
    /// 0.0.0.0
    IPAddress() noexcept;

    /// @param family  decides how many bytes are read: 4 or 16
    /// @param bytes   the address in network order; copied, of any alignment
    /// @param length  the size of bytes: at least as many as are read
    /// @throws std::invalid_argument  "family": neither IPv4 nor IPv6; "length": too few bytes; "bytes": a null pointer
    IPAddress(IPFamily family, const void* bytes, unsigned length);

    IPAddress(const IPv4Address& address) noexcept;
    IPAddress(const IPv6Address& address) noexcept;

    IPFamily getFamily() const noexcept { return mFamily; }

    /// @return the address, owned by this object; the reference is valid until an address of the other family is
    ///         assigned
    /// @throws std::invalid_argument  "family": the address is of the other family
    const IPv4Address& getIPv4() const;
    /// The same for IPv6.
    const IPv6Address& getIPv6() const;

    /// @return size() bytes in network order, owned by this object
    const unsigned char* bytes() const noexcept;
    /// @return 4 or 16
    std::size_t size() const noexcept;

    /// @return the text form of the address, without brackets
    std::string str() const;

    /// @return -1, 0 or 1: this address is less than, equal to or greater than the other
    int compare(const IPAddress& other) const noexcept;

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
