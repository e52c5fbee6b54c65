#pragma once

#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/util/PosixError.hpp>

#include "support/HookedStream.hpp"
#include "support/MemoryStreamPair.hpp"
#include "support/TlsKit.hpp"

#include <cerrno>
#include <exception>
#include <functional>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <openssl/err.h>

namespace qel::test {

inline const char* const kRenegotiation = "SSL stream peer attempted renegotiation";

inline constexpr std::size_t kPlenty = 1 << 20; // bytes in transit: no write in these tests waits for a reader

/// An exception of a type that the library does not know, for underlying streams to throw.
struct ForeignFailure {
    int number;
};

inline std::exception_ptr foreignFailure() { return std::make_exception_ptr(ForeignFailure{42}); }

/// StreamIOException "outside", with a PosixError "inside" nested in it.
inline std::exception_ptr nestedFailure()
{
    try {
        try {
            throw PosixError(EPIPE, "inside");
        } catch (const PosixError&) {
            std::throw_with_nested(StreamIOException("outside"));
        }
    } catch (...) {
        return std::current_exception();
    }
}

inline void expectNestedFailure(const std::function<void()>& work)
{
    try {
        work();
        ADD_FAILURE() << "no exception";
    } catch (const StreamIOException& outside) {
        EXPECT_STREQ(outside.what(), "outside");
        EXPECT_THAT([&outside] { std::rethrow_if_nested(outside); },
                    ::testing::ThrowsMessage<PosixError>(::testing::StartsWith("inside: 32 (")));
    }
}

/// Leaves an entry in the error queue of this thread, as other code may.
inline void spoilErrorQueue()
{
    BIO_new_mem_buf(nullptr, 0); // fails and adds an entry
    ASSERT_NE(ERR_peek_error(), 0U);
}

class SSLStreamTest : public TlsTest {};

/// Two of our streams over a connection in memory.
class SSLStreamPair : public TlsTest {
protected:
    SSLStreamPair()
        : mMemory(kPlenty), mClient(clientContext(), pHooked()), mServer(serverContext(), mMemory.takeServer())
    {}

    void encrypt() { TlsTest::encrypt(mClient, mServer); }

    MemoryStreamPair mMemory;
    HookedStream::Hooks mHooks; // of the client
    SSLStream mClient;
    SSLStream mServer;

private:
    std::unique_ptr<Stream> pHooked() { return std::make_unique<HookedStream>(mMemory.takeClient(), mHooks); }
};

/// Two connected, encrypted streams.
class EncryptedPair : public SSLStreamPair {
protected:
    void SetUp() override { encrypt(); }
};

} // namespace qel::test
