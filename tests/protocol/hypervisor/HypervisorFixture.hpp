#pragma once

#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>

#include "hypervisor/HypervisorEngine.hpp"
#include "protocol/hypervisor/FakeConsole.hpp"
#include "protocol/hypervisor/FakeSerialLine.hpp"
#include "support/CapturedLog.hpp"

#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace qel::test {

/// A request of any identity.
inline QelMessageGeneric request(unsigned short function, unsigned short operation, const std::string& payload = {})
{
    QelMessageGeneric message(4711, function, operation, MsgResponseExpected);
    message.setData(payload.data(), static_cast<unsigned int>(payload.size()));
    return message;
}

/// A hypervisor with two partitions, 1 and 2, and consoles that send it frames as they come from the wire.
class HypervisorFixture : public ::testing::Test {
protected:
    /// A console and its connection.
    struct Peer {
        FakeConsole link;
        protocol::ConsoleId id = 0;
    };

    HypervisorFixture() { serve(std::make_unique<protocol::Hypervisor>()); }

    /// Starts over with a hypervisor that takes so many consoles.
    void limitConsoles(std::uint8_t maxConsoles) { serve(std::make_unique<protocol::Hypervisor>(), maxConsoles); }

    /// Starts over with a machine, and gives it the two partitions.
    void serve(std::unique_ptr<protocol::Hypervisor> served,
               std::uint8_t maxConsoles = protocol::HypervisorEngine::kDefaultMaxConsoles,
               const protocol::PartitionOptions& options = {})
    {
        hypervisor.reset();
        machine = std::move(served);
        machine->addPartition(1, makeLine(port1), options);
        machine->addPartition(2, makeLine(port2), options);
        startEngine(maxConsoles);
    }

    /// Starts over with two partitions that are served in a certain way.
    void serveWith(const protocol::PartitionOptions& options)
    {
        serve(std::make_unique<protocol::Hypervisor>(), protocol::HypervisorEngine::kDefaultMaxConsoles, options);
    }

    /// Starts an engine for the machine.
    void startEngine(std::uint8_t maxConsoles)
    {
        hypervisor = std::make_unique<protocol::HypervisorEngine>(*machine, maxConsoles, [this] { ++serialWakes; });
    }

    void connect(Peer& peer)
    {
        protocol::Peer from;
        from.address = "127.0.0.1:9";
        peer.id = hypervisor->connect(peer.link, std::move(from));
    }

    /// Hands the hypervisor the bytes of a message.
    protocol::ConsoleState receive(Peer& peer, const QelMessage& message)
    {
        return receive(peer, message.serialize(), message.msgLength());
    }
    protocol::ConsoleState receive(Peer& peer, const std::vector<char>& frame)
    {
        return receive(peer, frame.data(), frame.size());
    }
    /// Checks too that a change of the watches comes with a wake-up, and that the reader is told whether it may go on.
    protocol::ConsoleState receive(Peer& peer, const char* frame, std::size_t length)
    {
        const auto message = registry.deserialize(frame, static_cast<unsigned int>(length));
        const auto watchedBefore = watchedEvents();
        const unsigned wakesBefore = serialWakes;
        const protocol::Received received = hypervisor->receive(peer.id, *message);
        EXPECT_EQ(received.mayReadNext, hypervisor->mayReceive(peer.id)) << message->getLogID();
        if (watchedEvents() != watchedBefore) {
            EXPECT_GT(serialWakes, wakesBefore) << message->getLogID();
        }
        return received.state;
    }

    /// Sends a request and takes the one message that answers it.
    std::unique_ptr<QelMessage> ask(Peer& peer, const QelMessage& request)
    {
        receive(peer, request);
        std::unique_ptr<QelMessage> response = peer.link.take();
        EXPECT_EQ(peer.link.posted(), 0U);
        EXPECT_EQ(response->getClassification(), QelMessageClassification::Response);
        EXPECT_EQ(response->getCallerId(), request.getCallerId());
        EXPECT_EQ(response->getFunction(), request.getFunction());
        EXPECT_EQ(response->getOperation(), request.getOperation());
        return response;
    }
    unsigned int statusOf(Peer& peer, const QelMessage& request) { return ask(peer, request)->getStatus(); }

    static QelMessageGetEnclTypeAndInterfaceVersionReq versionRequest(const std::string& toolId,
                                                                      std::uint32_t toolType = 7)
    {
        return QelMessageGetEnclTypeAndInterfaceVersionReq(1, toolType, 2, 3, toolId);
    }

    void identify(Peer& peer, const std::string& toolId, std::uint32_t toolType = 7)
    {
        connect(peer);
        ASSERT_EQ(statusOf(peer, versionRequest(toolId, toolType)), 0U);
    }
    void openSession(Peer& peer, const std::string& toolId)
    {
        identify(peer, toolId);
        ASSERT_EQ(statusOf(peer, QelMessageInterfaceCmpOpenKrogSessionReq()), 0U);
    }
    void openSerial(Peer& peer, std::uint16_t partition, bool force = false)
    {
        ASSERT_EQ(statusOf(peer, QelMessageVirtualSerialOpenReq(partition, 0, force)), 0U);
    }
    /// All steps until data flows.
    void setUpSerial(Peer& peer, const std::string& toolId, std::uint16_t partition)
    {
        openSession(peer, toolId);
        openSerial(peer, partition);
        ASSERT_EQ(statusOf(peer, QelMessageVirtualSerialSetupSessionReq(partition, 0)), 0U);
    }
    void sendData(Peer& peer, std::uint16_t partition, const std::string& data)
    {
        receive(peer, QelMessageVirtualSerialDataToOsAsync(partition, 0, static_cast<std::uint16_t>(data.size()),
                                                           data.data()));
    }
    /// The partitions that the serial thread waits for.
    std::vector<std::uint16_t> watched() const
    {
        std::vector<std::uint16_t> ids;
        for (const protocol::SerialWatch& watch : hypervisor->serialWatches())
            ids.push_back(watch.partition);
        return ids;
    }

    /// The same with the poll events of each.
    std::vector<std::pair<std::uint16_t, short>> watchedEvents() const
    {
        std::vector<std::pair<std::uint16_t, short>> events;
        for (const protocol::SerialWatch& watch : hypervisor->serialWatches())
            events.emplace_back(watch.partition, watch.fd.mFd.events);
        return events;
    }

    /// Does what is due. @return whether the hypervisor looks again soon whether a command has ended
    bool awaitsEnd() const { return hypervisor->serviceLines() == protocol::Partition::kExitInterval; }

    CapturedLog log{LogLevel::Warn};
    QelMessageRegistry registry;
    FakeSerialLine* port1 = nullptr; // owned by the machine
    FakeSerialLine* port2 = nullptr;
    unsigned serialWakes = 0;
    std::unique_ptr<protocol::Hypervisor> machine;
    std::unique_ptr<protocol::HypervisorEngine> hypervisor; // of the machine

private:
    static std::unique_ptr<FakeSerialLine> makeLine(FakeSerialLine*& borrowed)
    {
        auto line = std::make_unique<FakeSerialLine>();
        borrowed = line.get();
        return line;
    }
};

} // namespace qel::test
