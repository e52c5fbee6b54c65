#pragma once

#include <qel/common/net/IPEndpoint.hpp>

#include "proxy/FrameFlow.hpp"

#include <cstdint>
#include <string>
#include <string_view>

namespace qel::tool {

/// The two sides of the proxy.
enum class ProxySide { Console, Server };

/// The addresses of a connection on both sides.
struct ProxyAddresses {
    IPEndpoint console;     ///< of the console
    IPEndpoint consoleHere; ///< of the proxy, towards the console
    IPEndpoint serverHere;  ///< of the proxy, towards the server
    IPEndpoint server;      ///< of the server
};

/// Hears what happens in a proxy, on the thread that runs it. The defaults do nothing.
class ProxyObserver : public FlowObserver {
public:
    void onFrame(const FlowPlace& /*place*/, std::uint64_t /*number*/, const FrameView& /*frame*/) override {}
    void onFault(const FlowPlace& /*place*/, std::uint64_t /*number*/, const FaultRule& /*rule*/,
                 const std::string& /*what*/) override
    {}
    void onNote(const FlowPlace& /*place*/, const std::string& /*text*/) override {}

    /// Both sides are connected.
    virtual void onOpened(std::uint64_t /*connection*/, const ProxyAddresses& /*addresses*/) {}

    /// Something about a connection as a whole, for a person.
    virtual void onConnectionNote(std::uint64_t /*connection*/, const std::string& /*text*/) {}

    /// Bytes that a side has sent to the proxy (`way` leads away from it) or has been sent. Without TLS, or decrypted.
    virtual void onBytes(std::uint64_t /*connection*/, ProxySide /*side*/, Way /*way*/, std::string_view /*bytes*/) {}

    /// A direction has ended towards its receiver.
    virtual void onEnd(const FlowPlace& /*place*/) {}

    /// A connection is gone. @param why  one line: how it ended
    virtual void onClosed(std::uint64_t /*connection*/, const std::string& /*why*/, const FrameFlow& /*toServer*/,
                          const FrameFlow& /*toConsole*/)
    {}

    /// A connection has not come about. @param why  one line
    virtual void onRefused(std::uint64_t /*connection*/, const std::string& /*why*/) {}

    /// The proxy is about to wait: what has been gathered can be written.
    virtual void onIdle() {}
};

} // namespace qel::tool
