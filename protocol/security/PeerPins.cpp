#include <qel/protocol/Error.hpp>
#include <qel/protocol/PeerPins.hpp>
#include <qel/protocol/Text.hpp>

#include <algorithm>
#include <cctype>

namespace qel::protocol {

namespace {

constexpr std::size_t kFingerprintBytes = 32;

bool contains(const std::vector<std::string>& list, const std::string& text)
{
    return std::find(list.begin(), list.end(), text) != list.end();
}

bool isHexDigit(char character) { return std::isxdigit(static_cast<unsigned char>(character)) != 0; }

char upperCase(char character) { return static_cast<char>(std::toupper(static_cast<unsigned char>(character))); }

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

void checkPeer(const PeerIdentity& peer, const PeerPins& pins)
{
    using Reason = CertificateRejected::Reason;
    const bool hasName = !peer.commonName.empty() && contains(pins.names, peer.commonName);
    if (!pins.names.empty() && !hasName) {
        throw CertificateRejected(Reason::NamePin, "wrong peer: the name " + quoted(peer.commonName) +
                                                       " does not match the pinned names");
    }
    if (!pins.fingerprints.empty() && !contains(pins.fingerprints, peer.fingerprint)) {
        throw CertificateRejected(Reason::FingerprintPin, "wrong peer: the fingerprint " + peer.fingerprint +
                                                              " does not match the pinned fingerprints");
    }
}

} // namespace qel::protocol
