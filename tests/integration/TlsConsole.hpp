#pragma once

#include <qel/common/net/SocketStream.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/common/security/SSLStream.hpp>

#include "support/LoopbackEnds.hpp"

#include <memory>
#include <string>
#include <utility>

namespace qel::test {

/// A console that takes the steps to TLS one at a time, so that a test can stop or deviate at each. Reads have a
/// deadline.
class TlsConsole {
public:
    /// Connects over TCP.
    explicit TlsConsole(const std::string& endpoint);

    /// Requests TLS and leaves the answer unread.
    void ask();
    /// Reads a message in the clear. @return its operation: upgrade or abort
    unsigned int takeAnswer();
    /// Performs the TLS handshake with these credentials.
    void startTls(const SSLCredentials& credentials);
    /// Performs all steps, including the version request.
    void comeIn(const std::string& toolId);

    /// Gives away the unprotected connection; this console is unusable afterwards.
    std::unique_ptr<Stream> takeStream() { return std::move(mStream); }

    /// Bytes as they are, in the clear.
    void sendBytes(const std::string& bytes) { mStream->write(bytes.data(), bytes.size()); }
    /// True when the server has ended the connection and nothing was left to read.
    bool isClosed();

    /// Frames over TLS.
    LoopbackMessages& messages() { return *mMessages; }
    SSLStream& tls() { return *mTls; }

private:
    SSLClientContext mContext;
    std::unique_ptr<Stream> mStream; // empty once there is mTls
    std::unique_ptr<SSLStream> mTls;
    std::unique_ptr<LoopbackMessages> mMessages;
};

} // namespace qel::test
