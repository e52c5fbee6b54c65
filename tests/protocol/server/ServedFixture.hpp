#pragma once

#include <qel/common/util/Poll.hpp>
#include <qel/protocol/PeerPins.hpp>
#include <qel/protocol/WakeUp.hpp>

#include "protocol/hypervisor/HypervisorFixture.hpp"
#include "server/Connection.hpp"
#include "server/LogThrottle.hpp"
#include "support/LoopbackEnds.hpp"

#include <memory>
#include <utility>

namespace qel::test {

/// A hypervisor end with one connection, which the test plays the console of.
class ServedFixture : public HypervisorFixture {
protected:
    /// Makes the connection of a stream, without starting it.
    /// @param context  null: plain
    std::unique_ptr<protocol::Connection> serve(std::unique_ptr<Stream> stream, int descriptor,
                                                const protocol::ConnectionLimits& limits = {},
                                                SSLServerContext* context = nullptr)
    {
        return std::make_unique<protocol::Connection>(
            protocol::ConnectionServices{*hypervisor, pins, limits, throttle, ended, refusals},
            protocol::ServedStream{std::move(stream), descriptor, "the test", "the source"}, context);
    }

    /// The same of the far end of a connection over loopback.
    std::unique_ptr<protocol::Connection> serve(Loopback& ends, const protocol::ConnectionLimits& limits = {},
                                                SSLServerContext* context = nullptr)
    {
        const int descriptor = ends.far->getSocket().getFd();
        return serve(std::move(ends.far), descriptor, limits, context);
    }

    /// Waits until a connection has ended.
    void awaitEnd(const protocol::Connection& connection)
    {
        ASSERT_TRUE(PollSet(ended.getPollFd()).wait(Loopback::kDeadline).anyReady());
        EXPECT_TRUE(connection.hasEnded());
    }

    using HypervisorFixture::serve;

    protocol::PeerPins pins;
    protocol::LogThrottle throttle{[] {}};
    protocol::WakeUp ended;
    protocol::RefusalCounts refusals;
};

} // namespace qel::test
