// A program that uses TLS through the installed package: OpenSSL comes with it, and so does the definition without
// which the headers would warn on OpenSSL 3.

#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLCertificateRequest.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/common/security/SSLException.hpp>

#include <iostream>

int main()
{
    qel::SSLClientContext context;
    const qel::SSL_PTR connection = context.allocateConnection();
    const qel::RSA_PTR key(RSA_new());
    std::cout << "connection: " << (connection != nullptr) << ", key: " << (key != nullptr) << '\n';
    try {
        const qel::SSLCertificate certificate("no certificate");
        return 1;
    } catch (const qel::SSLException& e) {
        std::cout << e.what() << '\n';
    }
    return 0;
}
