#pragma once

#include <qel/common/io/Stream.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/common/security/SSLCredentials.hpp>
#include <qel/common/security/SSLStream.hpp>

#include "support/CapturedLog.hpp"

#include <cstddef>
#include <functional>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <sys/types.h>
#include <vector>

/// @file
/// What tests of TLS connections share: an authority, connections, and the two ends of one on a thread each.

namespace qel::test {

/// Who an end of a test connection says it is. All but the last trust the same root, that of Authority::trusted(), so
/// that only what they present differs.
enum class Identity {
    Client,            ///< issued by the root to "client"
    Server,            ///< issued by the root to "server"
    Expired,           ///< issued by the root, until yesterday
    NotYetValid,       ///< issued by the root, from tomorrow
    OtherRoot,         ///< issued by somebody else
    WithSubjectOfRoot, ///< issued by the root to the subject that is the root's own
    WithKeyOfAnother,  ///< issued by the root, but with a key that is not its own: contexts refuse these credentials
                       ///< and are left with the root, to trust, and nothing to present
    Stranger,          ///< issued by somebody else, whom alone it trusts
};

/// @return the credentials of an identity: made when they are first asked for, and then the same all the time
/// Thread safety: from any thread.
const SSLCredentials& credentialsOf(Identity identity);

/// @return contexts with the credentials of an identity; the same objects each time
SSLClientContext& clientContext(Identity identity = Identity::Client);
SSLServerContext& serverContext(Identity identity = Identity::Server);

/// What carries the bytes of a test connection.
enum class Transport { Memory, Tcp };

struct StreamPair {
    std::unique_ptr<Stream> client;
    std::unique_ptr<Stream> server;
};

/// @return both ends of a new connection. Reads and writes that make no progress fail after a long time, so that a test
///         with a mistake ends.
StreamPair connectStreams(Transport transport);

/// What one end of a connection did.
struct Outcome {
    std::string failure;          ///< "StreamIOException: EOF", for example; empty when it came to its end
    std::vector<std::string> log; ///< what its thread wrote, see linesOfThread()
};

struct Outcomes {
    Outcome client;
    Outcome server;
};

/// Does some work. The error queue of this thread must be empty afterwards.
/// @return how it failed, as Outcome has it; empty when it came to its end
std::string failureOf(const std::function<void()>& work);

/// Runs both ends of a connection, each on a thread of its own, until both have come to their end. Each must leave the
/// error queue of its thread empty.
Outcomes runEnds(const CapturedLog& log, const std::function<void()>& client, const std::function<void()>& server);

/// Runs one piece of work on this thread. The error queue must be empty afterwards.
Outcome runHere(const CapturedLog& log, const std::function<void()>& work);

/// What one thread has written to the log: "E: text". Left out are the lines that socket streams write about each
/// transfer; neighbouring lines with what OpenSSL says itself, which differs from version to version, stand as one
/// "E: [libssl]".
std::vector<std::string> linesOfThread(const CapturedLog& log, pid_t thread);

/// Fails the test if the calling thread's error queue holds something, and empties it.
void expectEmptyErrorQueue();

/// What tests of TLS streams begin with; the log is captured.
class TlsTest : public ::testing::Test {
protected:
    /// Does something on this thread. @return how it went
    Outcome here(const std::function<void()>& work) { return runHere(mLog, work); }

    /// Both ends do their handshake at the same time.
    Outcomes shakeHands(SSLStream& client, SSLStream& server);

    /// Both ends are encrypted afterwards, and the log is empty.
    void encrypt(SSLStream& client, SSLStream& server);

    CapturedLog mLog;
};

// What our streams write to the log.

/// The lines of a handshake that succeeds, in their order.
std::vector<std::string> handshakeLines();
std::string encryptedLine(std::size_t length);
std::string decryptedLine(std::size_t length);

// Data.

/// Bytes that tell where they stand, more or less.
std::string pattern(std::size_t length);
void writeText(Stream& stream, const std::string& data);
/// What one read() delivers.
std::string readSome(Stream& stream, std::size_t length);
std::string readExactly(Stream& stream, std::size_t length);

} // namespace qel::test
