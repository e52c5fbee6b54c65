#include "support/TlsCalls.hpp"

#include <cstdlib>
#include <dlfcn.h>

namespace qel::test {

namespace {

thread_local TlsCalls* tCurrent = nullptr;

template <typename Function>
Function* realFunction(const char* name)
{
    void* const symbol = ::dlsym(RTLD_NEXT, name);
    if (symbol == nullptr) std::abort();
    return reinterpret_cast<Function*>(symbol);
}

/// Calls the stand-in of the current thread, or else the real function.
template <typename Result, typename... Parameters>
Result dispatch(std::function<Result(Parameters...)> TlsCalls::*standIn, Result (*real)(Parameters...),
                Parameters... arguments)
{
    TlsCalls* const current = tCurrent;
    if (current == nullptr || !(current->*standIn)) return real(arguments...);
    tCurrent = nullptr;
    const Result result = (current->*standIn)(arguments...);
    tCurrent = current;
    return result;
}

} // namespace

TlsCalls::TlsCalls() : mOuter(tCurrent) { tCurrent = this; }

TlsCalls::~TlsCalls() { tCurrent = mOuter; }

} // namespace qel::test

// The functions of OpenSSL that this program defines itself.
#define QEL_TEST_CALL(result, name, parameters, ...)                                                                   \
    extern "C" __attribute__((visibility("default"))) result name parameters                                           \
    {                                                                                                                  \
        static result(*const sReal) parameters = qel::test::realFunction<result parameters>(#name);                    \
        return qel::test::dispatch(&qel::test::TlsCalls::name, sReal, __VA_ARGS__);                                    \
    }

QEL_TEST_CALL(std::size_t, BIO_ctrl_get_write_guarantee, (BIO * bio), bio)
QEL_TEST_CALL(int, BIO_new_bio_pair, (BIO * *first, std::size_t firstBytes, BIO** second, std::size_t secondBytes),
              first, firstBytes, second, secondBytes)
QEL_TEST_CALL(int, BIO_read, (BIO * bio, void* buffer, int length), bio, buffer, length)
QEL_TEST_CALL(int, BIO_write, (BIO * bio, const void* buffer, int length), bio, buffer, length)
QEL_TEST_CALL(int, PEM_write_bio_X509, (BIO * bio, qel::test::WrittenCertificate certificate), bio, certificate)
QEL_TEST_CALL(int, SSL_get_error, (const SSL* ssl, int result), ssl, result)
QEL_TEST_CALL(int, SSL_read, (SSL * ssl, void* buffer, int length), ssl, buffer, length)
QEL_TEST_CALL(int, SSL_write, (SSL * ssl, const void* buffer, int length), ssl, buffer, length)
