#include <qel/common/security/CertificateFacts.hpp>
#include <qel/common/security/SSLException.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/PemContent.hpp>

#include <algorithm>
#include <array>
#include <string_view>
#include <vector>

namespace qel::protocol {

namespace {

constexpr std::string_view kCertificate = "a certificate";
constexpr std::string_view kRequest = "a certificate request";
constexpr std::string_view kKey = "a private key";
constexpr std::string_view kEncryptedKey = "an encrypted private key";
constexpr std::string_view kPublicKey = "a public key";

struct Label {
    const char* text; // as in "-----BEGIN text-----"
    std::string_view kind;
};

constexpr std::array<Label, 11> kLabels{{
    {"CERTIFICATE", kCertificate},
    {"X509 CERTIFICATE", kCertificate},
    {"CERTIFICATE REQUEST", kRequest},
    {"NEW CERTIFICATE REQUEST", kRequest},
    {"PRIVATE KEY", kKey},
    {"RSA PRIVATE KEY", kKey},
    {"EC PRIVATE KEY", kKey},
    {"DSA PRIVATE KEY", kKey},
    {"ENCRYPTED PRIVATE KEY", kEncryptedKey},
    {"PUBLIC KEY", kPublicKey},
    {"RSA PUBLIC KEY", kPublicKey},
}};

constexpr std::string_view kBegin = "-----BEGIN ";

bool contains(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }

bool holds(const std::string& pem, std::string_view kind)
{
    for (const Label& label : kLabels) {
        if (label.kind == kind && contains(pem, std::string("-----BEGIN ") + label.text + "-----")) return true;
    }
    return false;
}

/// The kind of the PEM block that begins at a position; empty for another label or a label that does not end.
std::string_view kindOfBlock(const std::string& pem, std::size_t start)
{
    const std::size_t labelStart = start + kBegin.size();
    const std::size_t labelEnd = pem.find("-----", labelStart);
    if (labelEnd == std::string::npos) return {};
    const std::string_view text = std::string_view(pem).substr(labelStart, labelEnd - labelStart);
    for (const Label& label : kLabels) {
        if (text != label.text) continue;
        const std::string_view block = std::string_view(pem).substr(start, pem.find(kBegin, labelEnd) - start);
        const bool isEncrypted = label.kind == kKey && block.find("Proc-Type: 4,ENCRYPTED") != std::string_view::npos;
        return isEncrypted ? kEncryptedKey : label.kind;
    }
    return {};
}

/// The kinds of all blocks, in their order.
std::vector<std::string_view> kindsIn(const std::string& pem)
{
    std::vector<std::string_view> kinds;
    for (std::size_t at = pem.find(kBegin); at != std::string::npos; at = pem.find(kBegin, at + kBegin.size())) {
        const std::string_view kind = kindOfBlock(pem, at);
        if (!kind.empty()) kinds.push_back(kind);
    }
    return kinds;
}

bool isKey(std::string_view kind) { return kind == kKey || kind == kEncryptedKey; }

[[noreturn]] void refuse(const std::string& reason) { throw CredentialsUnusable(reason); }

/// Explains why a text could not be parsed as an object of a kind.
[[noreturn]] void refuseContent(const std::string& path, const std::string& pem, std::string_view expected,
                                const SSLException& error)
{
    const std::string found = describePem(pem);
    if (!found.empty() && !holds(pem, expected)) refuse(path + " holds " + found + ", not " + std::string(expected));
    refuse(path + ": " + error.what());
}

template <typename Object>
Object parse(const std::string& path, const std::string& pem, std::string_view expected)
{
    try {
        return Object(pem);
    } catch (const SSLException& error) {
        refuseContent(path, pem, expected, error);
    }
}

} // namespace

SSLCertificate parseCertificate(const std::string& path, const std::string& pem)
{
    return parse<SSLCertificate>(path, pem, kCertificate);
}

SSLCertificateRequest parseRequest(const std::string& path, const std::string& pem)
{
    return parse<SSLCertificateRequest>(path, pem, kRequest);
}

RSAPrivateKey parseKey(const std::string& path, const std::string& pem)
{
    try {
        return RSAPrivateKey(pem);
    } catch (const SSLException& error) {
        const std::vector<std::string_view> kinds = kindsIn(pem);
        const auto firstKey = std::find_if(kinds.begin(), kinds.end(), isKey);
        if (firstKey != kinds.end() && *firstKey == kEncryptedKey) {
            refuse(path + " holds an encrypted private key: keys are stored without a pass phrase");
        }
        const std::string type = privateKeyType(pem);
        if (!type.empty() && type != "RSA") refuse(path + " holds a private key of type " + type + ", not RSA");
        refuseContent(path, pem, kKey, error);
    }
}

bool holdsCertificate(const std::string& pem) { return holds(pem, kCertificate); }

bool holdsRequest(const std::string& pem) { return holds(pem, kRequest); }

bool holdsNoKey(const std::string& pem)
{
    const std::vector<std::string_view> kinds = kindsIn(pem);
    return !kinds.empty() && std::none_of(kinds.begin(), kinds.end(), isKey);
}

std::string describePem(const std::string& pem)
{
    const std::vector<std::string_view> kinds = kindsIn(pem);
    return kinds.empty() ? std::string() : std::string(kinds.front());
}

} // namespace qel::protocol
