#pragma once

#include <qel/protocol/Hypervisor.hpp>

#include "protocol/hypervisor/VirtualSerialFixture.hpp"

#include <functional>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

namespace qel::test {

/// A user's hypervisor that overrides every operation, records the calls, and fails where the test says.
class ScriptedMachine : public protocol::Hypervisor {
public:
    enum class Failure { None, Standard, Other };

    // The script.
    std::string failing; ///< the operation that fails
    Failure failure = Failure::None;
    protocol::MachineInfo info{'Z', 4, 5, "type", "serial"};
    std::chrono::system_clock::time_point time = std::chrono::system_clock::from_time_t(1709618828);
    protocol::GlobalMode mode{9, "mtms"};
    std::string metadata = "kept";
    std::function<QelMessageStatusCodes(const protocol::Peer&, const QelMessage&)> decide;
    std::function<bool(const protocol::Peer&, std::uint16_t)> decideOpen;

    std::vector<protocol::DisconnectReason> reasons; ///< of onDisconnected()
    std::vector<std::string> calls;                  ///< the operations, and what they were called with

    QelMessageStatusCodes mayRequest(const protocol::Peer& peer, const QelMessage& request) override
    {
        pCalled("mayRequest", " " + peer.toolId);
        return decide ? decide(peer, request) : QelMessageStatusNoError;
    }
    bool mayOpen(const protocol::Peer& peer, std::uint16_t partition) override
    {
        pCalled("mayOpen", " " + peer.toolId + " " + std::to_string(partition));
        return !decideOpen || decideOpen(peer, partition);
    }
    protocol::MachineInfo machine() override
    {
        pCalled("machine");
        return info;
    }
    QelCapabilities capabilities() override
    {
        pCalled("capabilities");
        return QelCapabilities("011");
    }
    std::chrono::system_clock::time_point currentTime() override
    {
        pCalled("currentTime");
        return time;
    }
    protocol::GlobalMode getMode() override
    {
        pCalled("getMode");
        return mode;
    }
    void setMode(const protocol::Peer& peer, const protocol::GlobalMode& to) override
    {
        pCalled("setMode", " " + peer.toolId + " " + std::to_string(to.mode) + " " + to.mtms);
        mode = to;
    }
    std::string getMetadata() override
    {
        pCalled("getMetadata");
        return metadata;
    }
    void setMetadata(const protocol::Peer& peer, const std::string& to) override
    {
        pCalled("setMetadata", " " + peer.toolId + " " + to);
        metadata = to;
    }
    void onConnected(const protocol::Peer& peer) override { pCalled("onConnected", " " + peer.toolId); }
    void onDisconnected(const protocol::Peer& peer, protocol::DisconnectReason why) override
    {
        reasons.push_back(why);
        pCalled("onDisconnected", " " + peer.toolId);
    }

    std::vector<std::string> takeCalls() { return std::exchange(calls, {}); }

private:
    void pCalled(const std::string& operation, const std::string& arguments = {})
    {
        calls.push_back(operation + arguments);
        if (operation != failing) return;
        if (failure == Failure::Standard) throw std::runtime_error("out of order");
        if (failure == Failure::Other) throw 42;
    }
};

/// An engine that serves a scripted machine.
class ScriptedMachineFixture : public VirtualSerialFixture {
protected:
    ScriptedMachineFixture()
    {
        auto scripted = std::make_unique<ScriptedMachine>();
        user = scripted.get();
        serve(std::move(scripted));
    }

    ScriptedMachine* user = nullptr; // owned by the fixture
};

} // namespace qel::test
