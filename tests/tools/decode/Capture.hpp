#pragma once

#include <cstdint>
#include <string>

namespace qel::test {

/// Builds pcap files packet by packet.
class Capture {
public:
    enum class Order { Little, Big };

    explicit Capture(std::uint32_t linkType = 1, Order order = Order::Little, bool nanoseconds = false)
        : mLinkType(linkType), mOrder(order)
    {
        pNumber(nanoseconds ? 0xA1B23C4D : 0xA1B2C3D4, 4);
        pNumber(2, 2);
        pNumber(4, 2);
        pNumber(0, 4);
        pNumber(0, 4);
        pNumber(262144, 4);
        pNumber(linkType, 4);
    }

    const std::string& bytes() const { return mBytes; }

    /// Adds a packet as it is, link header included.
    void addPacket(const std::string& packet)
    {
        pNumber(1700000000, 4);
        pNumber(0, 4);
        pNumber(static_cast<std::uint32_t>(packet.size()), 4);
        pNumber(static_cast<std::uint32_t>(packet.size()), 4);
        mBytes += packet;
    }

    /// Adds a TCP segment from port 4000 to 4711 of 127.0.0.1, or back.
    void addSegment(std::uint32_t sequence, const std::string& payload, bool back = false, unsigned char flags = 0x10)
    {
        const std::string tcp =
            (back ? bigEndian(4711, 2) + bigEndian(4000, 2) : bigEndian(4000, 2) + bigEndian(4711, 2)) +
            bigEndian(sequence, 4) + bigEndian(0, 4) + "\x50" + std::string(1, static_cast<char>(flags)) +
            std::string(6, '\0') + payload;
        addPacket(link() + ipv4(tcp));
    }

    static std::string bigEndian(std::uint32_t number, unsigned int bytes)
    {
        std::string text;
        for (unsigned int i = bytes; i > 0; --i)
            text += static_cast<char>(number >> 8 * (i - 1));
        return text;
    }

    static std::string ipv4(const std::string& payload, unsigned char protocol = 6, unsigned int fragment = 0)
    {
        return "\x45" + std::string(1, '\0') + bigEndian(static_cast<std::uint32_t>(20 + payload.size()), 2) +
               bigEndian(0, 2) + bigEndian(fragment, 2) + "\x40" + std::string(1, static_cast<char>(protocol)) +
               bigEndian(0, 2) + std::string("\x7F\0\0\x01\x7F\0\0\x01", 8) + payload;
    }

    /// The header of the link with IPv4 in it.
    std::string link() const
    {
        switch (mLinkType) {
        case 0:
            return std::string("\x02\0\0\0", 4);
        case 1:
            return std::string(12, '\xAA') + bigEndian(0x0800, 2);
        case 113:
            return std::string(14, '\0') + bigEndian(0x0800, 2);
        case 276:
            return bigEndian(0x0800, 2) + std::string(18, '\0');
        case 108:
            return bigEndian(2, 4);
        default:
            return {};
        }
    }

private:
    void pNumber(std::uint32_t number, unsigned int bytes)
    {
        const std::string text = bigEndian(number, bytes);
        mBytes += mOrder == Order::Big ? text : std::string(text.rbegin(), text.rend());
    }

    std::uint32_t mLinkType;
    Order mOrder;
    std::string mBytes;
};

} // namespace qel::test
