#include "support/OpenSSLCalls.hpp"

#include <array>
#include <cstdlib>
#include <dlfcn.h>
#include <memory>
#include <openssl/bn.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/rsa.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>
#include <tuple>
#include <type_traits>

namespace qel::test {

namespace {

thread_local OpenSSLCalls* tCurrent = nullptr;

constexpr int kReason = 42;
const char* const kFile = "injected.c";
constexpr int kLine = 4711;

template <typename Argument>
void printArgument(std::string& text, const Argument& argument)
{
    if constexpr (std::is_integral<Argument>::value) {
        if (!text.empty()) text += ", ";
        text += std::to_string(argument);
    }
}

template <typename Result, typename... Parameters>
Result callOrFail(const char* name, Result (*real)(Parameters...), Parameters... arguments)
{
    OpenSSLCalls* const current = tCurrent;
    if (current == nullptr) return real(arguments...);

    std::string text;
    (printArgument(text, arguments), ...);
    if (current->note(name, text)) {
        putInjectedError();
        if constexpr (std::is_pointer<Result>::value) {
            return nullptr;
        } else {
            return static_cast<Result>(current->result());
        }
    }
    tCurrent = nullptr;
    struct Restore {
        OpenSSLCalls* outer;
        ~Restore() { tCurrent = outer; }
    } const restore{current};
    return real(arguments...);
}

// OpenSSL's own function is the next definition after this program's.
template <typename Result, typename... Parameters>
auto openSSLs(const char* name)
{
    void* const symbol = ::dlsym(RTLD_NEXT, name);
    if (symbol == nullptr) std::abort();
    return reinterpret_cast<Result (*)(Parameters...)>(symbol);
}

template <typename Result, typename... Parameters>
Result dispatch(const char* name, Parameters... arguments)
{
    return callOrFail(name, openSSLs<Result, Parameters...>(name), arguments...);
}

thread_local bool tQuickKeys = false;

int generateKey(RSA* rsa, int bits, BIGNUM* exponent, BN_GENCB* progress)
{
    return openSSLs<int, RSA*, int, BIGNUM*, BN_GENCB*>("RSA_generate_key_ex")(rsa, bits, exponent, progress);
}

const RSA* generatedOnce(int bits, BIGNUM* exponent)
{
    using RsaPtr = std::unique_ptr<RSA, void (*)(RSA*)>;
    static const RsaPtr sKey = [&] {
        RsaPtr key(RSA_new(), RSA_free);
        if (generateKey(key.get(), bits, exponent, nullptr) != 1) std::abort();
        return key;
    }();
    const BIGNUM* has = nullptr;
    RSA_get0_key(sKey.get(), nullptr, &has, nullptr);
    if (RSA_bits(sKey.get()) != bits || BN_cmp(has, exponent) != 0) std::abort(); // this test cares after all
    return sKey.get();
}

int copyKey(RSA* rsa, int bits, BIGNUM* exponent, BN_GENCB* /*progress*/)
{
    const RSA* const key = generatedOnce(bits, exponent);
    const BIGNUM* numbers[8] = {};
    RSA_get0_key(key, &numbers[0], &numbers[1], &numbers[2]);
    RSA_get0_factors(key, &numbers[3], &numbers[4]);
    RSA_get0_crt_params(key, &numbers[5], &numbers[6], &numbers[7]);
    return RSA_set0_key(rsa, BN_dup(numbers[0]), BN_dup(numbers[1]), BN_dup(numbers[2])) == 1 &&
           RSA_set0_factors(rsa, BN_dup(numbers[3]), BN_dup(numbers[4])) == 1 &&
           RSA_set0_crt_params(rsa, BN_dup(numbers[5]), BN_dup(numbers[6]), BN_dup(numbers[7])) == 1;
}

// The types in a function's declaration, which differ between versions of OpenSSL by a const here and there.
template <typename Function>
struct Declaration;

template <typename R, typename... Parameters>
struct Declaration<R(Parameters...)> {
    using Result = R;
    template <std::size_t N>
    using Parameter = typename std::tuple_element<N, std::tuple<Parameters...>>::type;
};

} // namespace

OpenSSLCalls::OpenSSLCalls()
{
    if (tCurrent != nullptr) std::abort();
    tCurrent = this;
}

OpenSSLCalls::~OpenSSLCalls() { tCurrent = nullptr; }

void OpenSSLCalls::failCall(std::size_t place, int result)
{
    mFailPlace = place;
    mResult = result;
}

void OpenSSLCalls::failNext(const std::string& name, int result)
{
    mFailName = name;
    mResult = result;
}

bool OpenSSLCalls::note(const std::string& name, const std::string& arguments)
{
    mCalls.push_back(name + '(' + arguments + ')');
    if (mHasFailed || (mCalls.size() - 1 != mFailPlace && name != mFailName)) return false;
    mHasFailed = true;
    return true;
}

std::string OpenSSLCalls::injectedErrorLine()
{
    std::array<char, 256> text{};
    ERR_error_string_n(ERR_PACK(ERR_LIB_USER, 0, kReason), text.data(), text.size());
    return std::string("E: [libssl] ") + kFile + ':' + std::to_string(kLine) + ": " + text.data();
}

QuickKeys::QuickKeys() { tQuickKeys = true; }

QuickKeys::~QuickKeys() { tQuickKeys = false; }

void putInjectedError() { ERR_put_error(ERR_LIB_USER, 0, kReason, kFile, kLine); }

} // namespace qel::test

#define QEL_RESULT(name) qel::test::Declaration<decltype(name)>::Result
#define QEL_PARAMETER(name, n) qel::test::Declaration<decltype(name)>::Parameter<n>

// QEL_OPENSSL_CALL_N: a function of N parameters.
#define QEL_OPENSSL_CALL_0(name)                                                                                       \
    extern "C" QEL_RESULT(name) name(void) { return qel::test::dispatch<QEL_RESULT(name)>(#name); }
#define QEL_OPENSSL_CALL_1(name)                                                                                       \
    extern "C" QEL_RESULT(name) name(QEL_PARAMETER(name, 0) a)                                                         \
    {                                                                                                                  \
        return qel::test::dispatch<QEL_RESULT(name)>(#name, a);                                                        \
    }
#define QEL_OPENSSL_CALL_2(name)                                                                                       \
    extern "C" QEL_RESULT(name) name(QEL_PARAMETER(name, 0) a, QEL_PARAMETER(name, 1) b)                               \
    {                                                                                                                  \
        return qel::test::dispatch<QEL_RESULT(name)>(#name, a, b);                                                     \
    }
#define QEL_OPENSSL_CALL_3(name)                                                                                       \
    extern "C" QEL_RESULT(name) name(QEL_PARAMETER(name, 0) a, QEL_PARAMETER(name, 1) b, QEL_PARAMETER(name, 2) c)     \
    {                                                                                                                  \
        return qel::test::dispatch<QEL_RESULT(name)>(#name, a, b, c);                                                  \
    }
#define QEL_OPENSSL_CALL_4(name)                                                                                       \
    extern "C" QEL_RESULT(name)                                                                                        \
        name(QEL_PARAMETER(name, 0) a, QEL_PARAMETER(name, 1) b, QEL_PARAMETER(name, 2) c, QEL_PARAMETER(name, 3) d)   \
    {                                                                                                                  \
        return qel::test::dispatch<QEL_RESULT(name)>(#name, a, b, c, d);                                               \
    }
#define QEL_OPENSSL_CALL_7(name)                                                                                       \
    extern "C" QEL_RESULT(name)                                                                                        \
        name(QEL_PARAMETER(name, 0) a, QEL_PARAMETER(name, 1) b, QEL_PARAMETER(name, 2) c, QEL_PARAMETER(name, 3) d,   \
             QEL_PARAMETER(name, 4) e, QEL_PARAMETER(name, 5) f, QEL_PARAMETER(name, 6) g)                             \
    {                                                                                                                  \
        return qel::test::dispatch<QEL_RESULT(name)>(#name, a, b, c, d, e, f, g);                                      \
    }

// Contexts and connections.
QEL_OPENSSL_CALL_1(SSL_CTX_new)
QEL_OPENSSL_CALL_3(SSL_CTX_set_verify)
QEL_OPENSSL_CALL_2(SSL_CTX_set_options)
QEL_OPENSSL_CALL_4(SSL_CTX_ctrl)
QEL_OPENSSL_CALL_2(SSL_CTX_set_num_tickets)
QEL_OPENSSL_CALL_2(SSL_CTX_use_certificate)
QEL_OPENSSL_CALL_2(SSL_CTX_use_PrivateKey)
QEL_OPENSSL_CALL_1(SSL_CTX_check_private_key)
QEL_OPENSSL_CALL_2(SSL_CTX_set_cert_store)
QEL_OPENSSL_CALL_2(SSL_CTX_set_client_CA_list)
QEL_OPENSSL_CALL_2(SSL_CTX_add_client_CA)
QEL_OPENSSL_CALL_1(SSL_new)
QEL_OPENSSL_CALL_1(SSL_set_connect_state)
QEL_OPENSSL_CALL_1(SSL_set_accept_state)
QEL_OPENSSL_CALL_0(X509_STORE_new)
QEL_OPENSSL_CALL_2(X509_STORE_add_cert)

// PEM texts.
QEL_OPENSSL_CALL_1(BIO_new)
QEL_OPENSSL_CALL_2(BIO_new_mem_buf)
QEL_OPENSSL_CALL_4(PEM_read_bio_RSAPrivateKey)
QEL_OPENSSL_CALL_4(PEM_read_bio_X509)
QEL_OPENSSL_CALL_4(PEM_read_bio_X509_REQ)
QEL_OPENSSL_CALL_7(PEM_write_bio_RSAPrivateKey)
QEL_OPENSSL_CALL_2(PEM_write_bio_X509)
QEL_OPENSSL_CALL_2(PEM_write_bio_X509_REQ)

// Keys.
QEL_OPENSSL_CALL_0(EVP_PKEY_new)
QEL_OPENSSL_CALL_1(EVP_PKEY_get1_RSA)
QEL_OPENSSL_CALL_2(EVP_PKEY_set1_RSA)
QEL_OPENSSL_CALL_0(RSA_new)
extern "C" int RSA_generate_key_ex(RSA* rsa, int bits, BIGNUM* exponent, BN_GENCB* progress)
{
    using namespace qel::test;
    return callOrFail("RSA_generate_key_ex", tQuickKeys ? copyKey : generateKey, rsa, bits, exponent, progress);
}
QEL_OPENSSL_CALL_1(RSAPrivateKey_dup)

// Certificates and requests.
QEL_OPENSSL_CALL_0(X509_new)
QEL_OPENSSL_CALL_1(X509_dup)
QEL_OPENSSL_CALL_2(X509_set_version)
QEL_OPENSSL_CALL_2(X509_set_pubkey)
QEL_OPENSSL_CALL_2(X509_set_subject_name)
QEL_OPENSSL_CALL_2(X509_set_issuer_name)
QEL_OPENSSL_CALL_2(X509_set_serialNumber)
QEL_OPENSSL_CALL_3(X509_sign)
QEL_OPENSSL_CALL_2(X509_check_private_key)
QEL_OPENSSL_CALL_7(X509_NAME_add_entry_by_txt)
QEL_OPENSSL_CALL_0(X509_REQ_new)
QEL_OPENSSL_CALL_1(X509_REQ_dup)
QEL_OPENSSL_CALL_2(X509_REQ_set_version)
QEL_OPENSSL_CALL_2(X509_REQ_set_pubkey)
QEL_OPENSSL_CALL_1(X509_REQ_get_pubkey)
QEL_OPENSSL_CALL_3(X509_REQ_sign)
QEL_OPENSSL_CALL_2(X509_REQ_check_private_key)

// Numbers, times and texts in them.
QEL_OPENSSL_CALL_0(BN_new)
QEL_OPENSSL_CALL_2(BN_set_word)
QEL_OPENSSL_CALL_4(BN_rand)
QEL_OPENSSL_CALL_1(BN_bn2hex)
QEL_OPENSSL_CALL_2(BN_to_ASN1_INTEGER)
QEL_OPENSSL_CALL_2(ASN1_INTEGER_to_BN)
QEL_OPENSSL_CALL_2(ASN1_TIME_set)
QEL_OPENSSL_CALL_2(ASN1_TIME_to_tm)
QEL_OPENSSL_CALL_2(ASN1_STRING_to_UTF8)
QEL_OPENSSL_CALL_4(OBJ_obj2txt)
