#pragma once

#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/util/UniqueFd.hpp>

#include "proxy/ProxyObserver.hpp"

#include <array>
#include <cstdint>
#include <map>
#include <string>
#include <string_view>
#include <utility>

namespace qel::tool {

/// Which connections of the proxy a capture holds: those with the servers, those with the consoles, or both.
enum class CapturedSides { Server, Console, Both };

/// Writes what passes as a capture in pcapng form, for Wireshark and "qel decode". Each side is an Ethernet interface;
/// the packets are made up around the bytes that were read and written, with the addresses of the sockets, so that the
/// streams can be followed. TLS is decrypted. A fault is a comment on the next packet of its connection.
///
/// When the file cannot be written any more, the writer stops and says so; the proxy goes on.
/// Thread safety: one thread.
class PcapngWriter final : public ProxyObserver {
public:
    /// Creates the file for its owner only, or empties it.
    /// @throws FileIOError  it cannot be opened
    PcapngWriter(const std::string& file, CapturedSides sides);
    ~PcapngWriter() override;

    void onFault(const FlowPlace& place, std::uint64_t number, const FaultRule& rule, const std::string& what) override;
    void onOpened(std::uint64_t connection, const ProxyAddresses& addresses) override;
    void onBytes(std::uint64_t connection, ProxySide side, Way way, std::string_view bytes) override;
    void onEnd(const FlowPlace& place) override;
    void onClosed(std::uint64_t connection, const std::string& why, const FrameFlow& toServer,
                  const FrameFlow& toConsole) override;
    void onIdle() override;

    /// Why writing has stopped, once; empty: it has not.
    std::string takeFailure() { return std::exchange(mFailure, {}); }

private:
    /// One end of a made-up TCP connection.
    struct Peer {
        IPEndpoint endpoint;
        std::uint32_t next = 0; // sequence number
        bool hasEnded = false;
    };
    struct Stream {
        std::array<Peer, 2> peers; // by the way that leads away from them: to-server, to-console
    };
    using Key = std::pair<std::uint64_t, ProxySide>;

    bool pHolds(ProxySide side) const noexcept;
    std::uint32_t pInterface(ProxySide side) const noexcept;
    void pOpen(std::uint64_t connection, ProxySide side, const IPEndpoint& client, const IPEndpoint& server);
    void pPacket(const Key& key, Stream& stream, Way way, unsigned int flags, std::string_view payload);
    void pFlush();

    const std::string mName;
    const CapturedSides mSides;
    UniqueFd mFile;
    std::string mGathered;
    std::string mFailure;
    std::map<Key, Stream> mStreams;
    std::map<std::uint64_t, std::string> mComments; // of a connection, for its next packet
};

} // namespace qel::tool
