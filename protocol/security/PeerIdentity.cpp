#include <qel/common/security/CertificateFacts.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/NameText.hpp>
#include <qel/protocol/PeerIdentity.hpp>
#include <qel/protocol/Text.hpp>

namespace qel::protocol {

PeerIdentity identityOf(const SSLStream& stream)
{
    const auto certificate = stream.getPeerCertificate();
    if (certificate == nullptr) throw ClosedByPeer("the connection is closed");
    PeerIdentity peer;
    const CertificateFacts facts = factsOf(*certificate);
    const SSLSubject subject = certificate->getSubject();
    const auto name = subject.find("CN");
    if (name != subject.end()) peer.commonName = name->second;
    peer.subject = nameText(facts.subject);
    peer.fingerprint = facts.fingerprint;
    return peer;
}

std::string describePeer(const PeerIdentity& peer) { return quoted(peer.subject) + ", SHA-256 " + peer.fingerprint; }

} // namespace qel::protocol
