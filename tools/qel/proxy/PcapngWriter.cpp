#include "proxy/PcapngWriter.hpp"

#include <qel/common/Utilities.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace qel::tool {

namespace {

constexpr unsigned int kFin = 0x01;
constexpr unsigned int kSyn = 0x02;
constexpr unsigned int kReset = 0x04;
constexpr unsigned int kPush = 0x08;
constexpr unsigned int kAck = 0x10;

constexpr std::uint32_t kSection = 0x0A0D0D0A;
constexpr std::uint32_t kInterface = 1;
constexpr std::uint32_t kPacket = 6;
constexpr std::uint16_t kEthernet = 1;           // some readers take several interfaces of no other kind
constexpr std::size_t kPayloadBytes = 32 * 1024; // of a packet: an IP packet has less than 64 KiB
constexpr std::size_t kGatheredBytes = 256 * 1024;

/// Blocks are little-endian.
void putLittle(std::string& text, std::uint64_t number, unsigned int bytes)
{
    for (unsigned int i = 0; i < bytes; ++i)
        text += static_cast<char>(number >> 8 * i);
}

/// The network is big-endian.
void putBig(std::string& text, std::uint32_t number, unsigned int bytes)
{
    for (unsigned int i = bytes; i > 0; --i)
        text += static_cast<char>(number >> 8 * (i - 1));
}

void pad(std::string& text)
{
    constexpr std::size_t kAlignment = 4;
    text.resize((text.size() + kAlignment - 1) / kAlignment * kAlignment);
}

void putOption(std::string& text, std::uint16_t code, const std::string& value)
{
    putLittle(text, code, 2);
    putLittle(text, value.size(), 2);
    text += value;
    pad(text);
}

std::string block(std::uint32_t type, const std::string& body)
{
    constexpr std::size_t kAround = 12; // the type, and the length twice
    std::string text;
    putLittle(text, type, 4);
    putLittle(text, body.size() + kAround, 4);
    text += body;
    putLittle(text, body.size() + kAround, 4);
    return text;
}

std::string sectionBlock()
{
    constexpr std::uint16_t kApplication = 4;
    std::string body;
    putLittle(body, 0x1A2B3C4D, 4);
    putLittle(body, 1, 2); // version 1.0
    putLittle(body, 0, 2);
    putLittle(body, ~std::uint64_t{0}, 8); // the length of the section is not known
    putOption(body, kApplication, "qel proxy");
    putLittle(body, 0, 4);
    return block(kSection, body);
}

std::string interfaceBlock(const std::string& name)
{
    constexpr std::uint16_t kName = 2;
    constexpr std::uint16_t kResolution = 9;
    std::string body;
    putLittle(body, kEthernet, 2);
    putLittle(body, 0, 2);
    putLittle(body, 0, 4); // packets are not cut
    putOption(body, kName, name);
    putOption(body, kResolution, "\x09"); // nanoseconds
    putLittle(body, 0, 4);
    return block(kInterface, body);
}

/// The Internet checksum (RFC 1071): the sum of 16-bit words, folded.
class Checksum {
public:
    void add(std::string_view bytes)
    {
        for (std::size_t i = 0; i < bytes.size(); ++i) {
            const std::uint32_t byte = static_cast<unsigned char>(bytes[i]);
            mSum += i % 2 == 0 ? byte << 8 : byte;
        }
    }
    std::uint16_t value() const
    {
        std::uint64_t sum = mSum;
        while (sum > 0xFFFF)
            sum = (sum & 0xFFFF) + (sum >> 16);
        return static_cast<std::uint16_t>(~sum);
    }

private:
    std::uint64_t mSum = 0;
};

void set16(std::string& text, std::size_t at, std::uint16_t number)
{
    text[at] = static_cast<char>(number >> 8);
    text[at + 1] = static_cast<char>(number);
}

std::string addressOf(const IPEndpoint& endpoint)
{
    const IPAddress& address = endpoint.getAddress();
    return {reinterpret_cast<const char*>(address.bytes()), address.size()};
}

/// Locally administered addresses: the last byte tells the ends apart.
std::string ethernetHeader(Way way, bool isIPv4)
{
    const std::string address("\x02\x51\x45\x4C\x00", 5);
    const char from = way == Way::ToServer ? 1 : 2;
    const char to = way == Way::ToServer ? 2 : 1;
    std::string header = address + to + address + from;
    putBig(header, isIPv4 ? 0x0800 : 0x86DD, 2);
    return header;
}

std::string ipHeader(const std::string& from, const std::string& to, std::size_t tcpBytes)
{
    constexpr std::size_t kHeader4 = 20;
    constexpr unsigned int kHops = 64;
    constexpr unsigned int kTcp = 6;
    std::string header;
    if (from.size() != sizeof(std::uint32_t)) {
        putBig(header, 0x60000000, 4);
        putBig(header, static_cast<std::uint32_t>(tcpBytes), 2);
        putBig(header, kTcp, 1);
        putBig(header, kHops, 1);
        return header + from + to;
    }
    putBig(header, 0x4500, 2);
    putBig(header, static_cast<std::uint32_t>(kHeader4 + tcpBytes), 2);
    putBig(header, 0x00004000, 4); // do not fragment
    putBig(header, kHops, 1);
    putBig(header, kTcp, 1);
    putBig(header, 0, 2);
    header += from + to;
    Checksum sum;
    sum.add(header);
    set16(header, 10, sum.value());
    return header;
}

} // namespace

PcapngWriter::PcapngWriter(const std::string& file, CapturedSides sides)
    : mName(file), mSides(sides),
      mFile(::open(file.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOCTTY, S_IRUSR | S_IWUSR))
{
    const PosixErrorCode error = errno;
    if (mFile.get() < 0) throw FileIOError(error, "cannot open " + file);
    mGathered = sectionBlock();
    if (mSides != CapturedSides::Console) mGathered += interfaceBlock("server");
    if (mSides != CapturedSides::Server) mGathered += interfaceBlock("console");
}

PcapngWriter::~PcapngWriter() { pFlush(); }

bool PcapngWriter::pHolds(ProxySide side) const noexcept
{
    if (mSides == CapturedSides::Both) return true;
    return (mSides == CapturedSides::Server) == (side == ProxySide::Server);
}

std::uint32_t PcapngWriter::pInterface(ProxySide side) const noexcept
{
    return mSides == CapturedSides::Both && side == ProxySide::Console ? 1 : 0;
}

void PcapngWriter::onOpened(std::uint64_t connection, const ProxyAddresses& addresses)
{
    pOpen(connection, ProxySide::Console, addresses.console, addresses.consoleHere);
    pOpen(connection, ProxySide::Server, addresses.serverHere, addresses.server);
}

void PcapngWriter::pOpen(std::uint64_t connection, ProxySide side, const IPEndpoint& client, const IPEndpoint& server)
{
    if (!pHolds(side)) return;
    const Key key(connection, side);
    Stream& stream = mStreams[key];
    stream.peers[0].endpoint = client;
    stream.peers[1].endpoint = server;
    pPacket(key, stream, Way::ToServer, kSyn, {});
    pPacket(key, stream, Way::ToConsole, kSyn | kAck, {});
    pPacket(key, stream, Way::ToServer, kAck, {});
}

void PcapngWriter::onBytes(std::uint64_t connection, ProxySide side, Way way, std::string_view bytes)
{
    const auto stream = mStreams.find({connection, side});
    if (stream == mStreams.end()) return;
    while (!bytes.empty()) {
        pPacket(stream->first, stream->second, way, kPush | kAck, bytes.substr(0, kPayloadBytes));
        bytes.remove_prefix(std::min(bytes.size(), kPayloadBytes));
    }
}

void PcapngWriter::onEnd(const FlowPlace& place)
{
    for (const ProxySide side : {ProxySide::Console, ProxySide::Server}) {
        const auto stream = mStreams.find({place.connection, side});
        if (stream == mStreams.end()) continue;
        pPacket(stream->first, stream->second, place.way, kFin | kAck, {});
        stream->second.peers[place.way == Way::ToServer ? 0 : 1].hasEnded = true;
    }
}

void PcapngWriter::onClosed(std::uint64_t connection, const std::string& /*why*/, const FrameFlow& /*toServer*/,
                            const FrameFlow& /*toConsole*/)
{
    for (const ProxySide side : {ProxySide::Console, ProxySide::Server}) {
        const auto stream = mStreams.find({connection, side});
        if (stream == mStreams.end()) continue;
        const auto& peers = stream->second.peers;
        if (!peers[0].hasEnded || !peers[1].hasEnded)
            pPacket(stream->first, stream->second, Way::ToServer, kReset | kAck, {});
        mStreams.erase(stream);
    }
    mComments.erase(connection);
}

void PcapngWriter::onFault(const FlowPlace& place, std::uint64_t number, const FaultRule& rule, const std::string& what)
{
    constexpr std::size_t kLongest = 1000;
    std::string& comment = mComments[place.connection];
    if (comment.size() > kLongest) return;
    if (!comment.empty()) comment += '\n';
    comment += wayText(place.way);
    if (number > 0) comment += " frame " + std::to_string(number);
    comment += ": " + what + " (" + rule.text.substr(0, kLongest) + ")";
}

void PcapngWriter::pPacket(const Key& key, Stream& stream, Way way, unsigned int flags, std::string_view payload)
{
    constexpr std::size_t kHeader = 20;
    Peer& from = stream.peers[way == Way::ToServer ? 0 : 1];
    const Peer& to = stream.peers[way == Way::ToServer ? 1 : 0];
    const std::string fromAddress = addressOf(from.endpoint);
    const std::string toAddress = addressOf(to.endpoint);
    std::string tcp;
    putBig(tcp, from.endpoint.getPort(), 2);
    putBig(tcp, to.endpoint.getPort(), 2);
    putBig(tcp, from.next, 4);
    putBig(tcp, (flags & kAck) != 0 ? to.next : 0, 4);
    putBig(tcp, 0x50, 1); // 20 bytes of header
    putBig(tcp, flags, 1);
    putBig(tcp, 0xFFFF, 2); // window
    putBig(tcp, 0, 4);
    tcp += payload;
    Checksum sum;
    std::string pseudo = fromAddress + toAddress;
    putBig(pseudo, static_cast<std::uint32_t>(tcp.size()), 4);
    putBig(pseudo, 6, 4); // TCP
    sum.add(pseudo);
    sum.add(tcp);
    set16(tcp, 16, sum.value());
    const bool takesNumber = (flags & (kSyn | kFin)) != 0;
    from.next += static_cast<std::uint32_t>(tcp.size() - kHeader) + (takesNumber ? 1 : 0);

    const bool isIPv4 = from.endpoint.getFamily() == IPFamily::IPv4;
    const std::string packet = ethernetHeader(way, isIPv4) + ipHeader(fromAddress, toAddress, tcp.size()) + tcp;
    const auto time =
        static_cast<std::uint64_t>(std::chrono::nanoseconds(TimeProvider::system().time_since_epoch()).count());
    std::string body;
    putLittle(body, pInterface(key.second), 4);
    putLittle(body, time >> 32, 4);
    putLittle(body, time & 0xFFFFFFFF, 4);
    putLittle(body, packet.size(), 4);
    putLittle(body, packet.size(), 4);
    body += packet;
    pad(body);
    const auto comment = mComments.find(key.first);
    if (comment != mComments.end()) {
        putOption(body, 1, comment->second);
        putLittle(body, 0, 4);
        mComments.erase(comment);
    }
    mGathered += block(kPacket, body);
    if (mGathered.size() >= kGatheredBytes) pFlush();
}

void PcapngWriter::onIdle() { pFlush(); }

void PcapngWriter::pFlush()
{
    std::size_t written = 0;
    while (mFile.get() >= 0 && written < mGathered.size()) {
        const ssize_t count = ::write(mFile.get(), mGathered.data() + written, mGathered.size() - written);
        const int error = errno;
        if (count >= 0) {
            written += static_cast<std::size_t>(count);
        } else if (error != EINTR) {
            mFailure = "cannot write to " + mName + ": " + PosixError(error).what() + "; the capture ends here";
            mFile.reset();
        }
    }
    mGathered.clear();
}

} // namespace qel::tool
