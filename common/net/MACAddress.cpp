#include <qel/common/StreamFormatters.hpp>
#include <qel/common/net/MACAddress.hpp>

#include <ostream>
#include <stdexcept>

namespace qel {

MACAddress::MACAddress(std::initializer_list<unsigned char> bytes) : MACAddress(bytes.begin(), bytes.size()) {}

MACAddress::MACAddress(const void* bytes, std::size_t length) : mBeU64(0)
{
    if (length != NUM_BYTES) throw std::invalid_argument("length");
    if (bytes == nullptr) throw std::invalid_argument("bytes");
    const unsigned char* const begin = static_cast<const unsigned char*>(bytes);
    for (std::size_t i = 0; i < NUM_BYTES; ++i)
        mBeU64 = mBeU64 << 8 | begin[i];
}

std::array<unsigned char, MACAddress::NUM_BYTES> MACAddress::bytes() const noexcept
{
    std::array<unsigned char, NUM_BYTES> result;
    for (std::size_t i = 0; i < NUM_BYTES; ++i) {
        result[i] = static_cast<unsigned char>(mBeU64 >> (8 * (NUM_BYTES - 1 - i)));
    }
    return result;
}

std::ostream& operator<<(std::ostream& os, const MACAddress& address)
{
    const char* separator = "";
    for (const unsigned char byte : address.bytes()) {
        os << separator << hexFormat(byte).noPrefix();
        separator = ":";
    }
    return os;
}

} // namespace qel
