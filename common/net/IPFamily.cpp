#include <qel/common/StreamFormatters.hpp>
#include <qel/common/Utilities.hpp>
#include <qel/common/net/IPFamily.hpp>

#include <istream>
#include <ostream>
#include <stdexcept>
#include <string>
#include <sys/socket.h>

namespace qel {

int IPFamilyUtils::toUNIXAddressFamily(IPFamily family)
{
    switch (family) {
    case IPFamily::IPv4:
        return AF_INET;
    case IPFamily::IPv6:
        return AF_INET6;
    }
    throw std::invalid_argument("Not an IP address family");
}

std::istream& operator>>(std::istream& is, IPFamily& family)
{
    std::string word;
    is >> word;
    word = Utilities::lowercase(word);
    if (word == "ipv4") {
        family = IPFamily::IPv4;
    } else if (word == "ipv6") {
        family = IPFamily::IPv6;
    } else {
        throw std::invalid_argument("Invalid IPFamily");
    }
    return is;
}

std::ostream& operator<<(std::ostream& os, IPFamily family)
{
    switch (family) {
    case IPFamily::IPv4:
        return os << "IPv4";
    case IPFamily::IPv6:
        return os << "IPv6";
    }
    return os << decFormat(static_cast<int>(family));
}

} // namespace qel
