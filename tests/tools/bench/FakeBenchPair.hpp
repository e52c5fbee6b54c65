#pragma once

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>

#include "bench/BenchPair.hpp"
#include "protocol/console/FakeHypervisorEnd.hpp"

#include <memory>
#include <string>
#include <utility>

namespace qel::test {

/// A pair of consoles, "one" and "two" of type 9, that send each other 300 bytes, and a hypervisor that passes on what
/// they send, unless a test has other plans for it.
struct FakeBenchPair {
    FakeBenchPair()
    {
        tool::BenchConsole one = makeConsole(first, "one");
        tool::BenchConsole two = makeConsole(second, "two");
        // They outlive this object, which a test may have moved the pair out of.
        first->onMessage = [from = first, to = second](const QelMessage& message) { pass(message, *from, *to, "one"); };
        second->onMessage = [from = second, to = first](const QelMessage& message) {
            pass(message, *from, *to, "two");
        };
        pair = std::make_unique<tool::BenchPair>(std::move(one), std::move(two), 300, std::chrono::milliseconds(1234));
    }

    FakeHypervisorEnd* first = nullptr; // owned by the pair
    FakeHypervisorEnd* second = nullptr;
    std::unique_ptr<tool::BenchPair> pair;

private:
    static tool::BenchConsole makeConsole(FakeHypervisorEnd*& borrowed, const std::string& toolId)
    {
        protocol::ConsoleOptions options = FakeHypervisorEnd::plainOptions();
        options.identity.toolType = 9;
        options.identity.toolId = toolId;
        return {options.identity, FakeHypervisorEnd::makeConsole(borrowed, options)};
    }

    static void pass(const QelMessage& message, FakeHypervisorEnd& from, FakeHypervisorEnd& to, const std::string& name)
    {
        from.grant(message);
        to.push(QelMessageDaxBroadcastOutboundAsync(dynamic_cast<const QelMessageDaxBroadcastReq&>(message), name, 9));
    }
};

} // namespace qel::test
