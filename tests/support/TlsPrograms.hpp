#pragma once

#include <qel/common/net/Socket.hpp>
#include <qel/common/security/SSLStream.hpp>

#include "support/Process.hpp"
#include "support/TemporaryDirectory.hpp"
#include "support/TlsKit.hpp"

#include <functional>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <vector>

/// @file
/// TLS programs of other projects as peers of our streams.

namespace qel::test {

/// Credentials as files, for the duration of a test.
class CredentialFiles {
public:
    explicit CredentialFiles(const SSLCredentials& credentials);

    std::string certificate() const { return mDirectory.file("cert.pem"); }
    std::string key() const { return mDirectory.file("key.pem"); }
    std::string root() const { return mDirectory.file("root.pem"); }

private:
    TemporaryDirectory mDirectory;
};

/// @return whether a program can be started by its name
bool hasProgram(const std::string& name);

/// Our end of a connection to a program, over TCP. All waits have a deadline.
class ProgramTest : public TlsTest {
protected:
    /// Ends a test whose program is missing. Call it in SetUp().
    static void skipWithout(const std::string& program);

    /// Starts a program by name.
    static std::unique_ptr<Process> start(std::vector<std::string> command);
    /// Starts a program that has no option to listen on loopback only, and restricts it to loopback.
    static std::unique_ptr<Process> startOnLoopback(std::vector<std::string> command);

    // We accept.

    /// @return a port at which acceptClient() waits
    std::string listen();
    /// Takes the next connection, as a server with the credentials of an identity.
    std::unique_ptr<SSLStream> acceptClient(Identity identity = Identity::Server);
    /// The same with other credentials.
    std::unique_ptr<SSLStream> acceptClient(SSLServerContext& context);

    // They accept.

    /// Connects to the port of 127.0.0.1 at which a program listens, once it does.
    /// @throws std::runtime_error  it does not listen, or it listens beyond loopback
    std::unique_ptr<SSLStream> connectTo(const Process& program, Identity identity = Identity::Client);
    /// The same with other credentials.
    std::unique_ptr<SSLStream> connectTo(const Process& program, SSLClientContext& context);

    /// Waits until the program has sent something that our end has not read.
    void awaitBytes() const;

private:
    /// @return a stream over the socket, with deadlines
    std::unique_ptr<Stream> pStreamOver(Socket socket);

    Socket mListener{-1};
    int mConnection = -1; // the descriptor of our end; owned by the stream
};

} // namespace qel::test
