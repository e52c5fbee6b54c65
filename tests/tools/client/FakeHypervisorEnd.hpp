#pragma once

#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/io/Stream.hpp>
#include <qel/common/io/StreamIOException.hpp>

#include <array>
#include <cerrno>
#include <chrono>
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
        if (request.getClassification() == QelMessageClassification::Request) respond(request, QelMessageStatusNoError);
    }
    void respond(const QelMessage& request, QelMessageStatusCodes status)
    {
        QelMessageGeneric response(request.getCallerId(), request.getFunction(), request.getOperation(), MsgResponse);
        response.setStatus(status);
        push(response);
    }
    void push(const QelMessage& message)
    {
        const auto length = static_cast<ssize_t>(message.msgLength());
        if (::send(mFar, message.serialize(), message.msgLength(), 0) != length) throw std::runtime_error("push");
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

    /// Every write() throws this.
    void failWrites(std::function<void()> failure) { mWriteFailure = std::move(failure); }

    // What was asked.

    /// All messages that came, in order.
    std::vector<std::unique_ptr<QelMessage>> received;
    std::vector<Milliseconds> readDeadlines;
    std::vector<Milliseconds> writeDeadlines;

    // The stream.

    void close() override {}
    void setReadDeadline(Milliseconds timeout) override { readDeadlines.push_back(timeout); }
    void setWriteDeadline(Milliseconds timeout) override { writeDeadlines.push_back(timeout); }
    std::size_t read(char* buffer, std::size_t length) override
    {
        const ssize_t count = ::read(mNear, buffer, length);
        if (count < 0) throw StreamIOException("I/O deadline");
        return static_cast<std::size_t>(count);
    }
    void write(const char* buffer, std::size_t length) override
    {
        if (mWriteFailure) mWriteFailure();
        received.push_back(mRegistry.deserialize(buffer, static_cast<unsigned int>(length)));
        onMessage(*received.back());
    }

private:
    int mNear = -1;
    int mFar = -1;
    QelMessageRegistry mRegistry;
    std::function<void()> mWriteFailure;
};

} // namespace qel::test
