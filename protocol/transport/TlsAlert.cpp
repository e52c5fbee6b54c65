#include "transport/TlsAlert.hpp"

namespace qel::protocol {

namespace {

struct CertificateAlert {
    int number;
    const char* text;
};

// RFC 8446, 6.2: the alerts that are about the certificate of the end that receives them.
constexpr CertificateAlert kCertificateAlerts[] = {
    {42, "bad certificate"},     {43, "unsupported certificate"}, {44, "certificate revoked"},
    {45, "certificate expired"}, {46, "certificate unknown"},     {48, "unknown CA"},
    {49, "access denied"},       {116, "certificate required"},
};

} // namespace

std::string certificateAlert(const SSLStream& stream)
{
    const int number = stream.getPeerAlert();
    for (const CertificateAlert& alert : kCertificateAlerts) {
        if (alert.number == number) return std::string(alert.text) + " (TLS alert " + std::to_string(number) + ")";
    }
    return {};
}

} // namespace qel::protocol
