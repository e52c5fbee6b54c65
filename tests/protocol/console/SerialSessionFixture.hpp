#pragma once

#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/protocol/Console.hpp>

#include "protocol/console/FakeHypervisorEnd.hpp"
#include "support/CapturedLog.hpp"

#include <chrono>
#include <gtest/gtest.h>
#include <optional>
#include <string>
#include <vector>

namespace qel::test {

/// A console, introduced, a hypervisor end that the test plays, and a session of partition 7, connection 3.
class SerialSessionTest : public ::testing::Test {
protected:
    using ClosedNotice = QelMessageVirtualSerialSessionClosedAsync;
    using DataNotice = QelMessageVirtualSerialDataToDaxAsync;

    static constexpr std::uint16_t kPartition = 7;
    static constexpr std::uint16_t kConnection = 3;

    static DataNotice dataFrom(std::uint16_t partition, std::uint16_t connection, const std::string& text)
    {
        return DataNotice(partition, connection, static_cast<std::uint16_t>(text.size()), text.data());
    }
    static DataNotice output(const std::string& text) { return dataFrom(kPartition, kConnection, text); }
    static ClosedNotice closed(ClosedNotice::CloseReason reason)
    {
        return ClosedNotice(kPartition, kConnection, reason);
    }

    /// The frame of a message with some other payload.
    static QelMessageGeneric withPayload(const QelMessage& message, const std::string& payload)
    {
        QelMessageGeneric changed(message);
        changed.setData(payload.data(), static_cast<unsigned int>(payload.size()));
        return changed;
    }

    /// The session-closed notice for a command that exited with status 3.
    static QelMessageGeneric exitedWith3()
    {
        QelMessageGeneric notice(closed(ClosedNotice::CloseReasonReadFailure));
        notice.setStatus(QelMessageStatusNoError, 0x0103);
        return notice;
    }

    ~SerialSessionTest() override
    {
        // The session is closed when it is destroyed; what a test wanted to do about messages is over.
        if (console) end->onMessage = [](const QelMessage&) {};
    }

    void open(const protocol::SerialOptions& options = address())
    {
        session.emplace(console->openSerial(kPartition, options));
        end->forget();
    }
    static protocol::SerialOptions address()
    {
        protocol::SerialOptions options;
        options.connection = kConnection;
        return options;
    }
    void receive(const QelMessage& message)
    {
        end->push(message);
        EXPECT_TRUE(console->process());
    }
    /// The operations of the messages that came, in order.
    std::vector<unsigned int> operations() const
    {
        std::vector<unsigned int> all;
        for (const auto& message : end->received)
            all.push_back(message->getOperation());
        return all;
    }
    template <typename T>
    const T& received(std::size_t index) const
    {
        return qelMessageCast<T>(*end->received.at(index));
    }
    void refuse(QelMessageOpTypes operation, QelMessageStatusCodes status)
    {
        end->onMessage = [this, operation, status](const QelMessage& message) {
            if (message.getOperation() == operation) return end->respond(message, status);
            end->grant(message);
        };
    }
    /// Takes what is there.
    std::string available()
    {
        std::string text(100000, '\0');
        text.resize(session->readAvailable(text.data(), text.size()));
        return text;
    }
    /// One read().
    std::string read(std::size_t length = 100)
    {
        std::string text(length, '\0');
        text.resize(session->read(text.data(), text.size(), std::chrono::seconds(10)));
        return text;
    }

    CapturedLog log{LogLevel::Warn};
    FakeHypervisorEnd* end = nullptr; // owned by the console
    std::optional<protocol::Console> console{
        FakeHypervisorEnd::makeConsole(end, FakeHypervisorEnd::plainOptions(), true)};
    std::optional<protocol::SerialSession> session;
};

} // namespace qel::test
