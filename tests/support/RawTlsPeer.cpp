#include "support/RawTlsPeer.hpp"

#include <qel/common/security/RSAPrivateKey.hpp>
#include <qel/common/security/SSLCertificate.hpp>

#include <algorithm>
#include <array>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <stdexcept>
#include <utility>

namespace qel::test {

namespace {

constexpr std::size_t kTagBytes = 16;
constexpr std::size_t kNonceBytes = 12;
constexpr std::size_t kKeyBytes = 32;

void require(bool condition, const char* what)
{
    if (!condition) throw std::runtime_error(std::string("RawTlsPeer: ") + what);
}

const unsigned char* unsignedBytes(const std::string& bytes)
{
    return reinterpret_cast<const unsigned char*>(bytes.data());
}

std::string fromHex(const std::string& digits)
{
    std::string bytes;
    for (std::size_t i = 0; i + 1 < digits.size(); i += 2) {
        bytes.push_back(static_cast<char>(std::stoi(digits.substr(i, 2), nullptr, 16)));
    }
    return bytes;
}

std::string bigEndian(std::uint64_t value, std::size_t length)
{
    std::string bytes(length, '\0');
    for (std::size_t i = length; i > 0 && value != 0; --i, value >>= 8) {
        bytes[i - 1] = static_cast<char>(value & 0xFF);
    }
    return bytes;
}

/// HKDF-Expand-Label of RFC 8446, 7.1, with an empty context, for at most as many bytes as SHA-384 has.
std::string expandLabel(const std::string& secret, const std::string& label, std::size_t length)
{
    const std::string name = "tls13 " + label;
    const std::string info = bigEndian(length, 2) + bigEndian(name.size(), 1) + name + std::string(1, '\0') + '\x01';
    std::array<unsigned char, EVP_MAX_MD_SIZE> digest{};
    unsigned int digestBytes = 0;
    require(HMAC(EVP_sha384(), secret.data(), static_cast<int>(secret.size()), unsignedBytes(info), info.size(),
                 digest.data(), &digestBytes) != nullptr,
            "HMAC");
    return std::string(digest.begin(), digest.begin() + static_cast<std::ptrdiff_t>(length));
}

std::string encrypt(const std::string& key, const std::string& nonce, const std::string& header,
                    const std::string& plaintext)
{
    const std::unique_ptr<EVP_CIPHER_CTX, decltype(&EVP_CIPHER_CTX_free)> context(EVP_CIPHER_CTX_new(),
                                                                                  &EVP_CIPHER_CTX_free);
    std::string result(plaintext.size() + kTagBytes, '\0');
    unsigned char* const out = reinterpret_cast<unsigned char*>(&result[0]);
    int length = 0;
    require(EVP_EncryptInit_ex(context.get(), EVP_aes_256_gcm(), nullptr, unsignedBytes(key), unsignedBytes(nonce)) ==
                    1 &&
                EVP_EncryptUpdate(context.get(), nullptr, &length, unsignedBytes(header),
                                  static_cast<int>(header.size())) == 1 &&
                EVP_EncryptUpdate(context.get(), out, &length, unsignedBytes(plaintext),
                                  static_cast<int>(plaintext.size())) == 1,
            "encryption");
    int rest = 0;
    require(EVP_EncryptFinal_ex(context.get(), out + length, &rest) == 1 &&
                EVP_CIPHER_CTX_ctrl(context.get(), EVP_CTRL_GCM_GET_TAG, kTagBytes, out + plaintext.size()) == 1,
            "end of encryption");
    return result;
}

int acceptAll(int, X509_STORE_CTX*) { return 1; }

} // namespace

RawTlsPeer::RawTlsPeer(Role role, const Options& options, std::unique_ptr<Stream> stream)
    : mStream(std::move(stream)), mRole(role), mContext(SSL_CTX_new(TLS_method())), mIn(BIO_new(BIO_s_mem())),
      mOut(BIO_new(BIO_s_mem()))
{
    require(mContext != nullptr && mIn != nullptr && mOut != nullptr, "no context");
    require(SSL_CTX_set_min_proto_version(mContext.get(), options.minimumVersion) == 1, "minimum version");
    require(SSL_CTX_set_max_proto_version(mContext.get(), options.maximumVersion) == 1, "maximum version");
    require(SSL_CTX_set_num_tickets(mContext.get(), options.tickets) == 1, "tickets");
    SSL_CTX_set_keylog_callback(mContext.get(), pKeepSecret);
    const int demands = options.verifiesPeer ? SSL_VERIFY_PEER | SSL_VERIFY_FAIL_IF_NO_PEER_CERT : SSL_VERIFY_NONE;
    SSL_CTX_set_verify(mContext.get(), demands, options.credentials == nullptr ? acceptAll : nullptr);
    if (options.credentials != nullptr) {
        const SSLCertificate certificate(options.credentials->mCert);
        const SSLCertificate root(options.credentials->mRootCA);
        const RSAPrivateKey key(options.credentials->mKey);
        require(SSL_CTX_use_certificate(mContext.get(), certificate.get()) == 1 &&
                    SSL_CTX_use_PrivateKey(mContext.get(), key.get()) == 1,
                "certificate");
        require(X509_STORE_add_cert(SSL_CTX_get_cert_store(mContext.get()), root.get()) == 1, "root");
    }
    mSSL.reset(SSL_new(mContext.get()));
    require(mSSL != nullptr, "no connection");
    SSL_set_bio(mSSL.get(), mIn, mOut);
    SSL_set_app_data(mSSL.get(), this);
    if (role == Client) {
        SSL_set_connect_state(mSSL.get());
    } else {
        SSL_set_accept_state(mSSL.get());
    }
}

RawTlsPeer::~RawTlsPeer() = default;

void RawTlsPeer::beginHandshake()
{
    SSL_do_handshake(mSSL.get());
    ERR_clear_error();
    pFlush();
}

bool RawTlsPeer::handshake()
{
    int result = 0;
    do {
        ERR_clear_error();
        result = SSL_do_handshake(mSSL.get());
    } while (pRetry(result));
    return result == 1;
}

void RawTlsPeer::write(const std::string& data)
{
    ERR_clear_error();
    const int result = SSL_write(mSSL.get(), data.data(), static_cast<int>(data.size()));
    ERR_clear_error();
    if (result > 0) ++mRecordsSent;
    pFlush();
}

std::string RawTlsPeer::read(std::size_t length)
{
    std::string data;
    while (data.size() < length) {
        std::array<char, 16384> buffer;
        const std::size_t most = std::min(buffer.size(), length - data.size());
        ERR_clear_error();
        const int result = SSL_read(mSSL.get(), buffer.data(), static_cast<int>(most));
        if (result > 0) {
            data.append(buffer.data(), static_cast<std::size_t>(result));
        } else if (!pRetry(result)) {
            break;
        }
    }
    return data;
}

void RawTlsPeer::exchangeVersions(char version)
{
    write(std::string(1, version));
    read(1);
}

void RawTlsPeer::updateKeys(bool answered)
{
    require(SSL_key_update(mSSL.get(), answered ? SSL_KEY_UPDATE_REQUESTED : SSL_KEY_UPDATE_NOT_REQUESTED) == 1,
            "key update");
    require(SSL_do_handshake(mSSL.get()) == 1, "key update message");
    pFlush();
}

void RawTlsPeer::closeNotify()
{
    SSL_shutdown(mSSL.get());
    ERR_clear_error();
    pFlush();
}

void RawTlsPeer::release()
{
    mHeld = false;
    pFlush();
}

std::string RawTlsPeer::protectedRecord(std::uint8_t type, const std::string& content)
{
    require(SSL_CIPHER_get_id(SSL_get_current_cipher(mSSL.get())) == TLS1_3_CK_AES_256_GCM_SHA384, "another cipher");
    require(!mSecret.empty(), "no keys yet");
    const std::string plaintext = content + static_cast<char>(type);
    const std::string header = "\x17\x03\x03" + bigEndian(plaintext.size() + kTagBytes, 2);
    const std::string number = bigEndian(mRecordsSent++, kNonceBytes);
    std::string nonce = expandLabel(mSecret, "iv", kNonceBytes);
    for (std::size_t i = 0; i < kNonceBytes; ++i)
        nonce[i] = static_cast<char>(nonce[i] ^ number[i]);
    return header + encrypt(expandLabel(mSecret, "key", kKeyBytes), nonce, header, plaintext);
}

void RawTlsPeer::sendBytes(const std::string& bytes) { mStream->write(bytes.data(), bytes.size()); }

/// The format of the line: https://www.ietf.org/archive/id/draft-ietf-tls-keylogfile-02.html
void RawTlsPeer::pKeepSecret(const SSL* ssl, const char* line)
{
    RawTlsPeer& peer = *static_cast<RawTlsPeer*>(SSL_get_app_data(ssl));
    const std::string text = line;
    const std::string label = peer.mRole == Client ? "CLIENT_TRAFFIC_SECRET_0 " : "SERVER_TRAFFIC_SECRET_0 ";
    if (text.compare(0, label.size(), label) != 0) return;
    peer.mSecret = fromHex(text.substr(text.rfind(' ') + 1));
}

void RawTlsPeer::pFlush()
{
    if (mHeld) return;
    char* data = nullptr;
    const long length = BIO_get_mem_data(mOut, &data);
    if (length <= 0) return;
    const std::string bytes(data, static_cast<std::size_t>(length));
    BIO_reset(mOut);
    sendBytes(bytes);
}

/// @return false at the end of the stream
bool RawTlsPeer::pReceive()
{
    std::array<char, 16384> buffer;
    const std::size_t count = mStream->read(buffer.data(), buffer.size());
    if (count == 0) return false;
    return BIO_write(mIn, buffer.data(), static_cast<int>(count)) == static_cast<int>(count);
}

/// Sends what there is to send and, if the engine waits for something, receives.
/// @return whether the call is to be repeated
bool RawTlsPeer::pRetry(int result)
{
    const int error = SSL_get_error(mSSL.get(), result);
    ERR_clear_error();
    pFlush();
    return error == SSL_ERROR_WANT_READ && pReceive();
}

} // namespace qel::test
