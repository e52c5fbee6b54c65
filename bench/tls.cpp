#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/security/RSAPrivateKey.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLCertificateRequest.hpp>
#include <qel/common/security/SSLValidityPeriod.hpp>

#include "AsioTlsConnection.hpp"
#include "Contest.hpp"
#include "Loopback.hpp"
#include "TlsEnds.hpp"

#include <cstddef>
#include <ctime>
#include <dlfcn.h>
#include <memory>
#include <openssl/rsa.h>
#include <openssl/x509.h>
#include <string>
#include <vector>

namespace qel::bench {

namespace {

constexpr std::size_t kShort = 64; // bytes of the frames that go there and back

/// One pair of contexts for all connections of a contestant.
template <typename Contexts>
Contexts& shared()
{
    static Contexts sContexts;
    return sContexts;
}

// Frames.

struct OurConnection {
    OurConnection() : tls(shared<OurContexts>(), TcpPair()), near(*tls.near, registry), far(*tls.far, registry)
    {
        tls.handshake();
    }

    QelMessageRegistry registry;
    OurTlsPair tls;
    QelMessageStream near;
    QelMessageStream far;
};

struct RawConnection {
    RawConnection() : tls(shared<RawContexts>(), pair), buffer(QelMessage::MtuMax) { tls.handshake(); }

    void pass(SSL* from, SSL* to, const QelMessage& message)
    {
        rawWrite(from, message.serialize(), message.msgLength());
        rawRead(to, buffer.data(), kPrefix);
        rawRead(to, buffer.data() + kPrefix, frameLength(buffer.data()) - kPrefix);
    }

    TcpPair pair;
    RawTlsPair tls;
    std::vector<char> buffer;
};

/// One frame over: one write and two reads.
void oursOneWay(benchmark::State& state, std::size_t length)
{
    OurConnection connection;
    const std::unique_ptr<QelMessage> message = messageOf(length);
    for (auto _ : state) {
        connection.near.write(*message);
        benchmark::DoNotOptimize(connection.far.read());
    }
}

void rawOneWay(benchmark::State& state, std::size_t length)
{
    RawConnection connection;
    const std::unique_ptr<QelMessage> message = messageOf(length);
    for (auto _ : state) {
        connection.pass(connection.tls.near.get(), connection.tls.far.get(), *message);
        benchmark::DoNotOptimize(connection.buffer.data());
    }
}

void asioOneWay(benchmark::State& state, std::size_t length)
{
    AsioConnection connection;
    const std::unique_ptr<QelMessage> message = messageOf(length);
    for (auto _ : state) {
        AsioConnection::write(connection.near, *message);
        benchmark::DoNotOptimize(asioRead(connection.far));
    }
}

void oursThereAndBack(benchmark::State& state)
{
    OurConnection connection;
    const std::unique_ptr<QelMessage> message = messageOf(kShort);
    for (auto _ : state) {
        connection.near.write(*message);
        benchmark::DoNotOptimize(connection.far.read());
        connection.far.write(*message);
        benchmark::DoNotOptimize(connection.near.read());
    }
}

void rawThereAndBack(benchmark::State& state)
{
    RawConnection connection;
    const std::unique_ptr<QelMessage> message = messageOf(kShort);
    for (auto _ : state) {
        connection.pass(connection.tls.near.get(), connection.tls.far.get(), *message);
        connection.pass(connection.tls.far.get(), connection.tls.near.get(), *message);
    }
}

void asioThereAndBack(benchmark::State& state)
{
    AsioConnection connection;
    const std::unique_ptr<QelMessage> message = messageOf(kShort);
    for (auto _ : state) {
        AsioConnection::write(connection.near, *message);
        benchmark::DoNotOptimize(asioRead(connection.far));
        AsioConnection::write(connection.far, *message);
        benchmark::DoNotOptimize(asioRead(connection.near));
    }
}

// The handshake of both ends, from new connections on; making the TCP connection is not counted.

void oursHandshake(benchmark::State& state)
{
    OurContexts& contexts = shared<OurContexts>();
    for (auto _ : state) {
        state.PauseTiming();
        auto pair = std::make_unique<TcpPair>();
        state.ResumeTiming();
        OurTlsPair tls(contexts, std::move(*pair));
        tls.handshake();
    }
}

void rawHandshake(benchmark::State& state)
{
    const RawContexts& contexts = shared<RawContexts>();
    for (auto _ : state) {
        state.PauseTiming();
        auto pair = std::make_unique<TcpPair>();
        state.ResumeTiming();
        RawTlsPair tls(contexts, *pair);
        tls.handshake();
        tls.near.reset();
        tls.far.reset();
        pair.reset(); // closing the descriptors is counted, as it is part of ours
    }
}

// Certificates. New ones come with new keys, and finding the primes takes so long, and so differently long, that
// nothing else could be seen beside it. While one of these objects lives, new keys are copies of one that exists.

RSA* sExistingKey = nullptr;

class ExistingKeys {
public:
    ExistingKeys()
    {
        static const RSAPrivateKey sKey;
        mKey.reset(EVP_PKEY_get1_RSA(sKey.get()));
        sExistingKey = mKey.get();
    }
    ~ExistingKeys() { sExistingKey = nullptr; }
    ExistingKeys(const ExistingKeys&) = delete;
    ExistingKeys& operator=(const ExistingKeys&) = delete;

private:
    RSA_PTR mKey;
};

int copyExistingKey(RSA* key)
{
    const BIGNUM* n = nullptr;
    const BIGNUM* e = nullptr;
    const BIGNUM* d = nullptr;
    const BIGNUM* p = nullptr;
    const BIGNUM* q = nullptr;
    const BIGNUM* dmp1 = nullptr;
    const BIGNUM* dmq1 = nullptr;
    const BIGNUM* iqmp = nullptr;
    RSA_get0_key(sExistingKey, &n, &e, &d);
    RSA_get0_factors(sExistingKey, &p, &q);
    RSA_get0_crt_params(sExistingKey, &dmp1, &dmq1, &iqmp);
    return RSA_set0_key(key, BN_dup(n), BN_dup(e), BN_dup(d)) == 1 &&
           RSA_set0_factors(key, BN_dup(p), BN_dup(q)) == 1 &&
           RSA_set0_crt_params(key, BN_dup(dmp1), BN_dup(dmq1), BN_dup(iqmp)) == 1;
}

using GenerateKey = int(RSA* key, int bits, BIGNUM* exponent, BN_GENCB* callback);

int generateKey(RSA* key, int bits, BIGNUM* exponent, BN_GENCB* callback)
{
    if (sExistingKey != nullptr) return copyExistingKey(key);
    static auto* const sReal = reinterpret_cast<GenerateKey*>(::dlsym(RTLD_NEXT, "RSA_generate_key_ex"));
    return sReal(key, bits, exponent, callback);
}

EVP_PKEY_PTR rawKey()
{
    const RSA_PTR rsa(RSA_new());
    const BN_PTR exponent(BN_new());
    EVP_PKEY_PTR key(EVP_PKEY_new());
    checkCall(BN_set_word(exponent.get(), RSA_F4) == 1, "BN_set_word");
    checkCall(RSA_generate_key_ex(rsa.get(), 2048, exponent.get(), nullptr) == 1, "RSA_generate_key_ex");
    checkCall(EVP_PKEY_set1_RSA(key.get(), rsa.get()) == 1, "EVP_PKEY_set1_RSA");
    return key;
}

void addName(X509_NAME* name, const char* text)
{
    const auto* const bytes = reinterpret_cast<const unsigned char*>(text);
    checkCall(X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC, bytes, -1, -1, 0) == 1, "X509_NAME_add_entry");
}

/// Everything but the names and the key.
void finish(X509* certificate, EVP_PKEY* signer)
{
    const std::time_t now = std::time(nullptr);
    const BN_PTR number(BN_new());
    checkCall(X509_set_version(certificate, 0) == 1, "X509_set_version");
    checkCall(ASN1_TIME_set(X509_getm_notBefore(certificate), now - 86400) != nullptr, "ASN1_TIME_set");
    checkCall(ASN1_TIME_set(X509_getm_notAfter(certificate), now + 86400) != nullptr, "ASN1_TIME_set");
    checkCall(BN_rand(number.get(), 128, -1, 0) == 1, "BN_rand");
    checkCall(BN_to_ASN1_INTEGER(number.get(), X509_get_serialNumber(certificate)) != nullptr, "BN_to_ASN1_INTEGER");
    checkCall(X509_sign(certificate, signer, EVP_sha256()) > 0, "X509_sign");
}

void oursSelfSign(benchmark::State& state)
{
    const ExistingKeys keys;
    for (auto _ : state) {
        const SSLCertificate root(SSLSubject{{"CN", "a root"}}, SSLValidityPeriod::days(1));
        benchmark::DoNotOptimize(root.get());
    }
}

void rawSelfSign(benchmark::State& state)
{
    const ExistingKeys keys;
    for (auto _ : state) {
        const EVP_PKEY_PTR key = rawKey();
        const X509_PTR root(X509_new());
        addName(X509_get_subject_name(root.get()), "a root");
        checkCall(X509_set_pubkey(root.get(), key.get()) == 1, "X509_set_pubkey");
        checkCall(X509_set_issuer_name(root.get(), X509_get_subject_name(root.get())) == 1, "X509_set_issuer_name");
        finish(root.get(), key.get());
    }
}

void oursIssue(benchmark::State& state)
{
    const ExistingKeys keys;
    const SSLCertificate root(SSLSubject{{"CN", "a root"}}, SSLValidityPeriod::days(1));
    for (auto _ : state) {
        SSLCertificateRequest request(SSLSubject{{"CN", "a leaf"}});
        const SSLCertificate leaf = root.sign(request, SSLValidityPeriod::days(1));
        benchmark::DoNotOptimize(leaf.get());
    }
}

void rawIssue(benchmark::State& state)
{
    const ExistingKeys keys;
    const EVP_PKEY_PTR rootKey = rawKey();
    const X509_PTR root(X509_new());
    addName(X509_get_subject_name(root.get()), "a root");
    for (auto _ : state) {
        const EVP_PKEY_PTR key = rawKey();
        const X509_REQ_PTR request(X509_REQ_new());
        checkCall(X509_REQ_set_version(request.get(), 0) == 1, "X509_REQ_set_version");
        addName(X509_REQ_get_subject_name(request.get()), "a leaf");
        checkCall(X509_REQ_set_pubkey(request.get(), key.get()) == 1, "X509_REQ_set_pubkey");
        checkCall(X509_REQ_sign(request.get(), key.get(), EVP_sha256()) > 0, "X509_REQ_sign");

        const X509_PTR leaf(X509_new());
        const EVP_PKEY_PTR publicKey(X509_REQ_get_pubkey(request.get()));
        checkCall(X509_set_pubkey(leaf.get(), publicKey.get()) == 1, "X509_set_pubkey");
        checkCall(X509_set_subject_name(leaf.get(), X509_REQ_get_subject_name(request.get())) == 1, "subject");
        checkCall(X509_set_issuer_name(leaf.get(), X509_get_subject_name(root.get())) == 1, "issuer");
        finish(leaf.get(), rootKey.get());
    }
}

Contest::Body of(std::size_t length, void (*body)(benchmark::State&, std::size_t))
{
    return [length, body](benchmark::State& state) { body(state, length); };
}

} // namespace

void addTlsContests()
{
    struct Size {
        const char* name;
        std::size_t bytes;
        double rawAtMost;
        double asioAtMost;
    };
    // The longest frame does not fit the 8 KiB in which our ciphertext moves; that is where its limit comes from.
    for (const Size& size : {Size{"64 B", kShort, 0.95, 0.96}, Size{"1 KiB", 1024, 0.95, 0.97},
                             Size{"4 KiB", 4096, 0.95, 1.0}, Size{"16 KiB", 16384, 1.75, 0}}) {
        contest(std::string("TLS: frame over loopback, ") + size.name)
            .ours(of(size.bytes, oursOneWay))
            .floor("OpenSSL on the descriptor", size.rawAtMost, of(size.bytes, rawOneWay))
            .peer("Boost.Asio, an owned message", size.asioAtMost, of(size.bytes, asioOneWay));
    }
    contest("TLS: request and response over loopback, 64 B")
        .ours(oursThereAndBack)
        .floor("OpenSSL on the descriptor", 0, rawThereAndBack)
        .peer("Boost.Asio, owned messages", 0.97, asioThereAndBack);
    contest("TLS: handshake and version byte, both ends")
        .ours(oursHandshake)
        .floor("OpenSSL on the descriptor", 1.02, rawHandshake);
    contest("TLS: self-signed certificate, existing key")
        .ours(oursSelfSign)
        .floor("the calls of OpenSSL", 1.05, rawSelfSign);
    contest("TLS: request and certificate, existing keys")
        .ours(oursIssue)
        .floor("the calls of OpenSSL", 1.05, rawIssue);
}

} // namespace qel::bench

/// Comes before the one of OpenSSL, for the library and for the calls above alike.
extern "C" __attribute__((visibility("default"))) int RSA_generate_key_ex(RSA* key, int bits, BIGNUM* exponent,
                                                                          BN_GENCB* callback)
{
    return qel::bench::generateKey(key, bits, exponent, callback);
}
