#include <qel/common/security/CertificateFacts.hpp>
#include <qel/common/security/SSLException.hpp>
#include <qel/common/security/SSLTypes.hpp>
#include <qel/common/util/CustomDeleter.hpp>

#include <array>
#include <climits>
#include <memory>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/objects.h>
#include <openssl/pem.h>
#include <openssl/x509.h>

namespace qel {

namespace {

using Asn1ObjectPtr = std::unique_ptr<ASN1_OBJECT, CustomDeleter<ASN1_OBJECT, void, ASN1_OBJECT_free>>;
using NamePtr = std::unique_ptr<X509_NAME, CustomDeleter<X509_NAME, void, X509_NAME_free>>;

struct FreeByOpenSSL {
    void operator()(unsigned char* text) const noexcept { OPENSSL_free(text); }
};

/// Drops entries that calls add to the error queue between construction and destruction: some calls fail for inputs
/// that are not errors here.
class QueueUnchanged {
public:
    QueueUnchanged() { ERR_set_mark(); }
    ~QueueUnchanged() { ERR_pop_to_mark(); }
    QueueUnchanged(const QueueUnchanged&) = delete;
    QueueUnchanged& operator=(const QueueUnchanged&) = delete;
};

[[noreturn]] void fail(const char* what)
{
    SSLException::flushErrorQueue();
    throw SSLException(what);
}

std::string numberOf(const ASN1_OBJECT* object)
{
    constexpr int kInDots = 1;
    const int length = OBJ_obj2txt(nullptr, 0, object, kInDots); // without the NUL that the second call adds
    if (length <= 0) fail("cannot read the number of an attribute");
    std::string number(static_cast<std::size_t>(length) + 1, '\0');
    OBJ_obj2txt(number.data(), length + 1, object, kInDots);
    number.pop_back();
    return number;
}

std::string nameOf(const ASN1_OBJECT* object)
{
    const int nid = OBJ_obj2nid(object);
    return nid != NID_undef ? OBJ_nid2sn(nid) : numberOf(object);
}

void appendHex(std::string& text, unsigned char byte, const char* digits)
{
    text += digits[byte >> 4];
    text += digits[byte & 0x0F];
}

std::string valueOf(const ASN1_STRING* value)
{
    const QueueUnchanged queue;
    unsigned char* text = nullptr;
    const int length = ASN1_STRING_to_UTF8(&text, value);
    const std::unique_ptr<unsigned char, FreeByOpenSSL> owner(text);
    if (length >= 0) return std::string(text, text + length);
    const unsigned char* const bytes = ASN1_STRING_get0_data(value);
    std::string digits = "#";
    for (int i = 0; i < ASN1_STRING_length(value); ++i)
        appendHex(digits, bytes[i], "0123456789abcdef");
    return digits;
}

NameFields fieldsOf(const X509_NAME* name)
{
    NameFields fields;
    const int count = X509_NAME_entry_count(name);
    for (int i = 0; i < count; ++i) {
        const X509_NAME_ENTRY* const entry = X509_NAME_get_entry(name, i);
        fields.push_back({nameOf(X509_NAME_ENTRY_get_object(entry)), valueOf(X509_NAME_ENTRY_get_data(entry))});
    }
    return fields;
}

/// @param key  may be null: OpenSSL does not know the kind of key
PublicKeyFacts factsOf(const EVP_PKEY* key)
{
    if (key == nullptr) return {"unknown", 0};
    const int nid = EVP_PKEY_base_id(key);
    if (nid == EVP_PKEY_RSA) return {"RSA", EVP_PKEY_bits(key)}; // OpenSSL's own name is "rsaEncryption"
    if (nid == EVP_PKEY_EC) return {"EC", EVP_PKEY_bits(key)};
    return {OBJ_nid2sn(nid), EVP_PKEY_bits(key)};
}

template <typename Object>
std::string digestOf(const Object* object, int (*digest)(const Object*, const EVP_MD*, unsigned char*, unsigned int*))
{
    std::array<unsigned char, EVP_MAX_MD_SIZE> bytes{};
    unsigned int length = 0;
    if (digest(object, EVP_sha256(), bytes.data(), &length) != 1) fail("cannot compute a fingerprint");
    std::string text;
    for (unsigned int i = 0; i < length; ++i) {
        if (i != 0) text += ':';
        appendHex(text, bytes[i], "0123456789ABCDEF");
    }
    return text;
}

} // namespace

CertificateFacts factsOf(const SSLCertificate& certificate)
{
    const QueueUnchanged queue;
    const X509* const handle = certificate.get();
    return {fieldsOf(X509_get_subject_name(handle)), fieldsOf(X509_get_issuer_name(handle)),
            certificate.getSerialNumber(),           certificate.getValidityPeriod(),
            factsOf(X509_get0_pubkey(handle)),       fingerprintOf(certificate)};
}

RequestFacts factsOf(const SSLCertificateRequest& request)
{
    const QueueUnchanged queue;
    return {fieldsOf(X509_REQ_get_subject_name(request.get())), factsOf(X509_REQ_get0_pubkey(request.get())),
            digestOf<X509_REQ>(request.get(), &X509_REQ_digest), isSignatureValid(request)};
}

std::string fingerprintOf(const SSLCertificate& certificate) { return digestOf<X509>(certificate.get(), &X509_digest); }

std::string privateKeyType(const std::string& pem)
{
    const QueueUnchanged queue;
    if (pem.size() > INT_MAX) return {};
    const BIO_PTR bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
    if (bio == nullptr) fail("cannot read a private key");
    char noPassPhrase[] = ""; // with null, OpenSSL would ask at the terminal
    const EVP_PKEY_PTR key(PEM_read_bio_PrivateKey(bio.get(), nullptr, nullptr, noPassPhrase));
    return key == nullptr ? std::string() : factsOf(key.get()).type;
}

bool isSignatureValid(const SSLCertificateRequest& request)
{
    const QueueUnchanged queue;
    EVP_PKEY* const key = X509_REQ_get0_pubkey(request.get());
    return key != nullptr && X509_REQ_verify(request.get(), key) == 1;
}

bool haveSameSubject(const SSLCertificateRequest& request, const SSLCertificate& certificate)
{
    return X509_NAME_cmp(X509_REQ_get_subject_name(request.get()), X509_get_subject_name(certificate.get())) == 0;
}

std::string attributeName(const std::string& name)
{
    const QueueUnchanged queue;
    const Asn1ObjectPtr object(OBJ_txt2obj(name.c_str(), 0));
    return object == nullptr ? std::string() : nameOf(object.get());
}

bool isExtension(const std::string& name)
{
    const QueueUnchanged queue;
    const Asn1ObjectPtr object(OBJ_txt2obj(name.c_str(), 0));
    if (object == nullptr) return false;
    const std::string number = numberOf(object.get());
    return number.rfind("2.5.29.", 0) == 0 || number.rfind("1.3.6.1.5.5.7.1.", 0) == 0; // id-ce and id-pe, RFC 5280
}

std::string objectionTo(const std::string& attribute, const std::string& value)
{
    SSLException::flushErrorQueue();
    const NamePtr name(X509_NAME_new());
    if (name == nullptr) fail("cannot make a name");
    constexpr int kAppend = -1;
    constexpr int kNewSet = 0;
    const auto* const text = reinterpret_cast<const unsigned char*>(value.c_str());
    const QueueUnchanged queue;
    if (X509_NAME_add_entry_by_txt(name.get(), attribute.c_str(), MBSTRING_ASC, text, -1, kAppend, kNewSet) == 1) {
        return {};
    }
    const char* const reason = ERR_reason_error_string(ERR_peek_error()); // the first error is the cause of the others
    return reason != nullptr ? reason : "not accepted";
}

} // namespace qel
