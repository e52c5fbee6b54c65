#pragma once

#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/io/Stream.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/ConsoleOptions.hpp>

#include <array>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <fcntl.h>
#include <functional>
#include <memory>
#include <stdexcept>
#include <string>
#include <sys/socket.h>
#include <unistd.h>
#include <utility>
#include <vector>

namespace qel::test {

/// The stream of a console whose hypervisor the test plays: hands every message that the console
/// writes to onMessage, and lets it read what push() puts there. Its descriptor is ready as that of a socket would be.
///
/// A read() with nothing to read throws StreamIOException("I/O deadline"), as if the hypervisor had not answered in
/// time.
///
/// Lifetime: close() ends the console's side; the test may look at what was received until the console is destroyed.
class FakeHypervisorEnd : public Stream {
public:
    using Milliseconds = std::chrono::milliseconds;

    FakeHypervisorEnd()
    {
        std::array<int, 2> ends{};
        if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends.data()) != 0) {
            throw std::runtime_error("socketpair");
        }
        mNear = ends[0];
        mFar = ends[1];
    }
    ~FakeHypervisorEnd() override
    {
        ::close(mNear);
        ::close(mFar);
    }

    int descriptor() const { return mNear; }

    // What the hypervisor does.

    /// What it does about a message; grants every request unless set.
    std::function<void(const QelMessage&)> onMessage = [this](const QelMessage& message) { grant(message); };

    void grant(const QelMessage& request)
    {
        if (request.getClassification() != QelMessageClassification::Request) return;
        if (request.getOperation() == QelMessageOpGetEnclTypeAndInterfaceVersion) return welcome(request);
        respond(request, QelMessageStatusNoError);
    }
    void welcome(const QelMessage& request)
    {
        push(QelMessageGetEnclTypeAndInterfaceVersionRsp(request.getCallerId(), 'Q', 1, 0, "type", "serial"));
    }
    void respond(const QelMessage& request, QelMessageStatusCodes status)
    {
        QelMessageGeneric response(request.getCallerId(), request.getFunction(), request.getOperation(), MsgResponse);
        response.setStatus(status);
        push(response);
    }
    void push(const QelMessage& message) { pushBytes(std::string(message.serialize(), message.msgLength())); }
    void pushBytes(const std::string& bytes)
    {
        if (::send(mFar, bytes.data(), bytes.size(), MSG_NOSIGNAL) != static_cast<ssize_t>(bytes.size())) {
            throw std::runtime_error("push");
        }
    }
    /// Nothing more will come.
    void end() { ::shutdown(mFar, SHUT_WR); }

    /// From now on the connection is not ready to be written to; or is again.
    void stopTaking()
    {
        const std::array<char, 1024> filler{};
        while (::send(mNear, filler.data(), filler.size(), 0) > 0)
            continue;
    }
    void takeAgain()
    {
        std::array<char, 1024> filler;
        while (::read(mFar, filler.data(), filler.size()) > 0)
            continue;
    }

    /// Called by every read(), first.
    std::function<void()> beforeRead;

    /// Every write() throws this.
    void failWrites(std::function<void()> failure) { mWriteFailure = std::move(failure); }

    // What was asked.

    /// All messages that came, in order.
    std::vector<std::unique_ptr<QelMessage>> received;
    unsigned int writes = 0; ///< each of one or more whole messages
    std::vector<Milliseconds> readDeadlines;
    std::vector<Milliseconds> writeDeadlines;

    // The stream.

    void close() override { ::shutdown(mNear, SHUT_RDWR); }
    void setReadDeadline(Milliseconds timeout) override { readDeadlines.push_back(timeout); }
    void setWriteDeadline(Milliseconds timeout) override { writeDeadlines.push_back(timeout); }
    std::size_t read(char* buffer, std::size_t length) override
    {
        if (const auto before = beforeRead) before();
        const ssize_t count = ::read(mNear, buffer, length);
        if (count < 0) throw StreamIOException("I/O deadline");
        return static_cast<std::size_t>(count);
    }
    void write(const char* buffer, std::size_t length) override
    {
        if (mWriteFailure) mWriteFailure();
        ++writes;
        while (length > 0) {
            QelMessageStream::MessageHeader header;
            std::memcpy(&header, buffer, sizeof(header));
            const unsigned int frame = header.mMsgLength;
            if (frame > length) throw std::runtime_error("a part of a frame");
            received.push_back(mRegistry.deserialize(buffer, frame));
            buffer += frame;
            length -= frame;
            onMessage(*received.back());
        }
    }

    /// A console over it, introduced, without TLS.
    /// @param end  set to the fake, which the console owns
    /// @param hasDescriptor  whether the console knows its descriptor
    static protocol::Console makeConsole(FakeHypervisorEnd*& end,
                                         const protocol::ConsoleOptions& options = plainOptions(),
                                         bool hasDescriptor = false)
    {
        auto owned = std::make_unique<FakeHypervisorEnd>();
        end = owned.get();
        const int descriptor = hasDescriptor ? owned->descriptor() : -1;
        protocol::Console console(std::move(owned), options, std::chrono::seconds(10), descriptor);
        end->forget();
        return console;
    }
    static protocol::ConsoleOptions plainOptions()
    {
        protocol::ConsoleOptions options("fake:1");
        options.plain = true;
        return options;
    }

    /// Forgets what was asked so far.
    void forget()
    {
        received.clear();
        writes = 0;
        readDeadlines.clear();
        writeDeadlines.clear();
    }

private:
    int mNear = -1;
    int mFar = -1;
    QelMessageRegistry mRegistry;
    std::function<void()> mWriteFailure;
};

} // namespace qel::test
