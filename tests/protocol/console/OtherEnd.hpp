#pragma once

#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/ConsoleOptions.hpp>
#include <qel/protocol/Credentials.hpp>
#include <qel/protocol/Handshake.hpp>
#include <qel/protocol/MemoryStream.hpp>

#include "support/Authority.hpp"
#include "support/LoopbackEnds.hpp"

#include <exception>
#include <functional>
#include <memory>
#include <ostream>
#include <string>
#include <thread>
#include <utility>

namespace qel::test {

/// Whether a connection goes over TLS.
enum class Cover { Plain, Tls };

inline std::ostream& operator<<(std::ostream& os, Cover cover) { return os << (cover == Cover::Tls ? "Tls" : "Plain"); }

/// The credentials of both ends, made on first use.
inline const protocol::Credentials& consoleCredentials()
{
    static const auto credentials = protocol::Credentials::fromTexts(Authority::trusted().clientCredentials());
    return credentials;
}
inline const protocol::Credentials& hypervisorCredentials()
{
    static const auto credentials = protocol::Credentials::fromTexts(Authority::trusted().serverCredentials());
    return credentials;
}

inline protocol::ConsoleOptions consoleOptions(Cover cover, const std::string& server = "memory:1")
{
    protocol::ConsoleOptions options(server);
    options.plain = cover == Cover::Plain;
    if (cover == Cover::Tls) options.credentials = consoleCredentials();
    return options;
}

/// Grants the version request.
inline void welcome(LoopbackMessages& messages)
{
    const auto request = messages.receive();
    messages.send(QelMessageGetEnclTypeAndInterfaceVersionRsp(request->getCallerId(), 'Q', 1, 0, "type", "serial"));
}

/// The hypervisor's steps up to the first message.
/// @return the protected stream, or the same one
inline std::unique_ptr<Stream> takeCover(Cover cover, std::unique_ptr<Stream> stream, int descriptor = -1)
{
    if (cover == Cover::Plain) return stream;
    protocol::awaitUpgrade(*stream, descriptor);
    protocol::grantUpgrade(*stream);
    const auto context = hypervisorCredentials().makeServerContext();
    auto tls = std::make_unique<SSLStream>(*context, std::move(stream));
    protocol::startTls(*tls);
    return tls;
}

/// Does nothing more until the console has gone.
inline void stall(LoopbackMessages& messages)
{
    while (!messages.isClosed())
        continue;
}

/// A hypervisor end that a function of the test plays on a thread of its own. Its connection ends when the function
/// returns or throws.
class OtherEnd {
public:
    using Play = std::function<void(std::unique_ptr<Stream>)>;
    using Dialogue = std::function<void(LoopbackMessages&)>;

    /// @param play  gets the bare stream
    explicit OtherEnd(Play play) : OtherEnd(protocol::makeMemoryStreams(), std::move(play)) {}

    /// @param dialogue  begins after the introduction
    OtherEnd(Cover cover, Dialogue dialogue)
        : OtherEnd([cover, dialogue = std::move(dialogue)](std::unique_ptr<Stream> stream) {
              const auto covered = takeCover(cover, std::move(stream));
              LoopbackMessages messages(*covered);
              welcome(messages);
              dialogue(messages);
          })
    {}

    /// Waits for the function to end.
    ~OtherEnd()
    {
        mNear.reset(); // if no console has taken it
        mThread.join();
    }
    OtherEnd(const OtherEnd&) = delete;
    OtherEnd& operator=(const OtherEnd&) = delete;

    /// The console's end. Can be taken once.
    std::unique_ptr<Stream> takeStream() { return std::move(mNear); }

private:
    OtherEnd(std::pair<std::unique_ptr<Stream>, std::unique_ptr<Stream>> streams, Play play)
        : mNear(std::move(streams.first)), mThread([play = std::move(play), far = std::move(streams.second)]() mutable {
              try {
                  play(std::move(far));
              } catch (const std::exception&) { // the console has gone
              }
          })
    {}

    std::unique_ptr<Stream> mNear;
    std::thread mThread;
};

} // namespace qel::test
