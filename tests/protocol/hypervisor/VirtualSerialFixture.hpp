#pragma once

#include "protocol/hypervisor/HypervisorFixture.hpp"

#include <string>

namespace qel::test {

/// Virtual serial sessions, through the hypervisor that keeps them.
class VirtualSerialFixture : public HypervisorFixture {
protected:
    /// Output is read only for a console, and none is kept.
    static protocol::PartitionOptions waiting()
    {
        protocol::PartitionOptions options;
        options.replayBytes = 0;
        options.unattended = protocol::WhenUnattended::Wait;
        return options;
    }

    /// Output is read all the time, and the newest bytes are kept.
    static protocol::PartitionOptions keeping(std::size_t replayBytes)
    {
        protocol::PartitionOptions options;
        options.replayBytes = replayBytes;
        return options;
    }

    unsigned int open(Peer& peer, std::uint16_t partition, std::uint16_t number = 0, bool force = false)
    {
        return statusOf(peer, QelMessageVirtualSerialOpenReq(partition, number, force));
    }
    unsigned int close(Peer& peer, std::uint16_t partition, std::uint16_t number = 0, bool force = false)
    {
        return statusOf(peer, QelMessageVirtualSerialCloseReq(partition, number, force));
    }
    unsigned int setUp(Peer& peer, std::uint16_t partition, std::uint16_t number = 0)
    {
        return statusOf(peer, QelMessageVirtualSerialSetupSessionReq(partition, number));
    }
    /// Takes the session-closed notice. @param statusDetail  how the command ended, where the notice says so
    static void expectClosed(Peer& peer, std::uint16_t partition, unsigned int reason, unsigned int statusDetail = 0,
                             unsigned int number = 0)
    {
        const auto notice = peer.link.take<QelMessageVirtualSerialSessionClosedAsync>();
        EXPECT_EQ(notice->getLpId(), partition);
        EXPECT_EQ(notice->getVssConnectionNumber(), number);
        EXPECT_EQ(notice->getCloseReason(), reason);
        EXPECT_EQ(notice->getStatus(), 0U);
        EXPECT_EQ(notice->getStatusDetail(), statusDetail);
    }
    static std::string takeData(Peer& peer, std::uint16_t partition, unsigned int number = 0)
    {
        const auto data = peer.link.take<QelMessageVirtualSerialDataToDaxAsync>();
        EXPECT_EQ(data->getLpId(), partition);
        EXPECT_EQ(data->getVssConnectionNumber(), number);
        return std::string(data->getSerialData(), data->getSerialDataLength());
    }

    /// Everything that has been sent on a number of partition 1.
    static std::string received(Peer& peer, unsigned int number = 0)
    {
        std::string all;
        while (peer.link.posted() != 0)
            all += takeData(peer, 1, number);
        return all;
    }
};

} // namespace qel::test
