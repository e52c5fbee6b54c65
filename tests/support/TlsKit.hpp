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
/// Shared by the tests of TLS connections: credentials, connections, and both ends of one on a thread each.

namespace qel::test {

/// What an end of a test connection presents. All but the last trust the same root, that of Authority::trusted().
enum class Identity {
    Client,            ///< issued by the root to "client"
    Server,            ///< issued by the root to "server"
    Expired,           ///< issued by the root, until yesterday
    NotYetValid,       ///< issued by the root, from tomorrow
    OtherRoot,         ///< issued by another root
    WithSubjectOfRoot, ///< issued by the root, with the root's own subject
    WithKeyOfAnother,  ///< issued by the root, with a key that does not match: contexts refuse these credentials, and
                       ///< then trust the root but present nothing
    Stranger,          ///< issued by another root, and trusts only that one
};

/// @return the credentials of an identity, made on first use
/// Thread safety: any thread may call it.
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

/// @return both ends of a new connection. Reads and writes that make no progress fail after a long time, so that a
/// broken
///         test ends.
StreamPair connectStreams(Transport transport);

/// What one end of a connection did.
struct Outcome {
    std::string failure;          ///< "StreamIOException: EOF", for example; empty when it succeeded
    std::vector<std::string> log; ///< the log of its thread, see linesOfThread()
};

struct Outcomes {
    Outcome client;
    Outcome server;
};

/// Does some work. The error queue of this thread must be empty afterwards.
/// @return its failure, as in Outcome; empty when it succeeded
std::string failureOf(const std::function<void()>& work);

/// Runs both ends of a connection on a thread each, until both have finished. Each must leave the error queue of its
/// thread empty.
Outcomes runEnds(const CapturedLog& log, const std::function<void()>& client, const std::function<void()>& server);

/// Runs one piece of work on this thread. The error queue must be empty afterwards.
Outcome runHere(const CapturedLog& log, const std::function<void()>& work);

/// The log of one thread, as "E: text", without the lines of socket streams about each transfer. Consecutive lines with
/// OpenSSL's own reasons, which differ between versions, are replaced by one "E: [libssl]".
std::vector<std::string> linesOfThread(const CapturedLog& log, pid_t thread);

/// Fails the test if the calling thread's error queue holds something, and empties it.
void expectEmptyErrorQueue();

/// The base of tests of TLS streams. Captures the log.
class TlsTest : public ::testing::Test {
protected:
    /// Runs work on this thread. @return its outcome
    Outcome here(const std::function<void()>& work) { return runHere(mLog, work); }

    /// Runs the handshakes of both ends at the same time.
    Outcomes shakeHands(SSLStream& client, SSLStream& server);

    /// Encrypts both ends and clears the log.
    void encrypt(SSLStream& client, SSLStream& server);

    CapturedLog mLog;
};

// Log lines of our streams.

/// The lines of a successful handshake, in order.
std::vector<std::string> handshakeLines();
std::string encryptedLine(std::size_t length);
std::string decryptedLine(std::size_t length);

// Data.

/// Bytes that nearly identify their position.
std::string pattern(std::size_t length);
void writeText(Stream& stream, const std::string& data);
/// The data of one read().
std::string readSome(Stream& stream, std::size_t length);
std::string readExactly(Stream& stream, std::size_t length);

} // namespace qel::test
