#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/protocol/Console.hpp>

#include "protocol/console/FakeHypervisorEnd.hpp"
#include "support/CapturedLog.hpp"

#include <gtest/gtest.h>
#include <vector>

namespace qel::test {

/// A console, introduced, and a hypervisor end that the test plays on the same thread.
class ConsoleTestBase : public ::testing::Test {
protected:
    /// Answers every request with this, put under its caller id.
    template <typename Response, typename... Arguments>
    void answerWith(const Arguments&... arguments)
    {
        end->onMessage = [this, arguments...](const QelMessage& message) {
            end->push(Response(message.getCallerId(), arguments...));
        };
    }
    void answerWithStatus(QelMessageStatusCodes status)
    {
        end->onMessage = [this, status](const QelMessage& message) { end->respond(message, status); };
    }
    void answerNothing()
    {
        end->onMessage = [](const QelMessage&) {};
    }
    std::vector<unsigned int> operations() const
    {
        std::vector<unsigned int> all;
        for (const auto& message : end->received)
            all.push_back(message->getOperation());
        return all;
    }

    CapturedLog log{LogLevel::Debug};
    FakeHypervisorEnd* end = nullptr; // owned by the console
    protocol::Console console = FakeHypervisorEnd::makeConsole(end);
    const QelMessageGetQelTodReq request{};
};

} // namespace qel::test
