#pragma once

#include <cstddef>
#include <functional>
#include <openssl/bio.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>

namespace qel::test {

template <typename Function>
struct SecondParameter;

template <typename Result, typename First, typename Second>
struct SecondParameter<Result(First, Second)> {
    using Type = Second;
};

/// A certificate to be written: const in OpenSSL 3, not in 1.1.1.
using WrittenCertificate = SecondParameter<decltype(::PEM_write_bio_X509)>::Type;

/// Replaces OpenSSL functions, as SystemCalls does for system calls, to cause failures that no input can cause. A test
/// program that links TlsCalls.cpp defines these functions itself; the library and OpenSSL then call those.
///
/// A call goes to the member of its name if that is set, otherwise to OpenSSL. A replacement is disabled while it runs,
/// so it may make the real call.
///
/// In force for the thread that makes it, from construction to destruction; they nest.
class TlsCalls {
public:
    TlsCalls();
    ~TlsCalls();
    TlsCalls(const TlsCalls&) = delete;
    TlsCalls& operator=(const TlsCalls&) = delete;

    std::function<std::size_t(BIO* bio)> BIO_ctrl_get_write_guarantee;
    std::function<int(BIO** first, std::size_t firstBytes, BIO** second, std::size_t secondBytes)> BIO_new_bio_pair;
    std::function<int(BIO* bio, void* buffer, int length)> BIO_read;
    std::function<int(BIO* bio, const void* buffer, int length)> BIO_write;
    std::function<int(BIO* bio, WrittenCertificate certificate)> PEM_write_bio_X509;
    std::function<int(const SSL* ssl, int result)> SSL_get_error;
    std::function<int(SSL* ssl, void* buffer, int length)> SSL_read;
    std::function<int(SSL* ssl, const void* buffer, int length)> SSL_write;

private:
    TlsCalls* const mOuter; // active again when this one ends
};

} // namespace qel::test
