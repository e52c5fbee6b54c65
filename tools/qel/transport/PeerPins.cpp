#include "transport/PeerPins.hpp"

#include <qel/common/security/SSLCertificate.hpp>

#include "base/Failures.hpp"
#include "base/Text.hpp"
#include "certificates/CertificateView.hpp"
#include "certificates/SubjectText.hpp"

#include <algorithm>
#include <cctype>

namespace qel::tool {

namespace {

constexpr std::size_t kFingerprintBytes = 32;

bool contains(const std::vector<std::string>& list, const std::string& text)
{
    return std::find(list.begin(), list.end(), text) != list.end();
}

bool isHexDigit(char character) { return std::isxdigit(static_cast<unsigned char>(character)) != 0; }

char upperCase(char character) { return static_cast<char>(std::toupper(static_cast<unsigned char>(character))); }

/// @return the peer's certificate, never null
std::unique_ptr<SSLCertificate> certificateOf(const SSLStream& stream)
{
    auto certificate = stream.getPeerCertificate();
    if (certificate == nullptr) throw CommandFailure(ExitStatus::ClosedByPeer, "the connection is closed");
    return certificate;
}

/// @return empty when it has none
std::string commonNameOf(const SSLCertificate& certificate)
{
    const SSLSubject subject = certificate.getSubject();
    const auto found = subject.find("CN");
    return found == subject.end() ? std::string() : found->second;
}

[[noreturn]] void refuse(const std::string& what, const std::string& option)
{
    throw CommandFailure(ExitStatus::Refused, "wrong peer: " + what + " does not match " + option);
}

} // namespace

std::string normalizedFingerprint(const std::string& text)
{
    const bool hasColons = text.find(':') != std::string::npos;
    const std::size_t step = hasColons ? 3 : 2;
    const std::size_t length = kFingerprintBytes * step - (hasColons ? 1 : 0);
    if (text.size() != length) return {};
    std::string normalized;
    for (std::size_t at = 0; at < text.size(); at += step) {
        if (!isHexDigit(text[at]) || !isHexDigit(text[at + 1])) return {};
        if (at != 0 && hasColons && text[at - 1] != ':') return {};
        if (at != 0) normalized += ':';
        normalized += upperCase(text[at]);
        normalized += upperCase(text[at + 1]);
    }
    return normalized;
}

void checkPeer(const SSLStream& stream, const PeerPins& pins)
{
    const auto certificate = certificateOf(stream);
    if (!pins.names.empty()) {
        const std::string name = commonNameOf(*certificate);
        // No pin matches a certificate without a common name, not even an empty pin.
        if (name.empty() || !contains(pins.names, name)) refuse("the name " + quoted(name), "--peer-name");
    }
    if (!pins.fingerprints.empty()) {
        const std::string fingerprint = fingerprintOf(*certificate);
        if (!contains(pins.fingerprints, fingerprint)) refuse("the fingerprint " + fingerprint, "--peer-fingerprint");
    }
}

std::string describePeer(const SSLStream& stream)
{
    const CertificateFacts facts = factsOf(*certificateOf(stream));
    return quoted(nameText(facts.subject)) + ", SHA-256 " + facts.fingerprint;
}

} // namespace qel::tool
