#pragma once

#include <qel/common/Utilities.hpp>
#include <qel/common/security/RSAPrivateKey.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLCertificateRequest.hpp>

#include "support/Process.hpp"
#include "support/TemporaryDirectory.hpp"

#include <gtest/gtest.h>
#include <map>
#include <string>
#include <vector>

namespace qel::test {

/// The command line of "qel ca" with some arguments.
std::vector<std::string> caCommand(const std::vector<std::string>& arguments);

/// Runs "qel ca" to its end. @param environment  added to that of the test
Process::Result runCa(const std::vector<std::string>& arguments,
                      const std::map<std::string, std::string>& environment = {});

/// Runs "qel ca" after some shell commands, such as "umask 0".
Process::Result runCaAfter(const std::string& shellCommands, const std::vector<std::string>& arguments);

/// Runs the program openssl.
Process::Result runOpenssl(const std::vector<std::string>& arguments);

/// The environment in which file calls of the program fail as FileFaultsModule.cpp says.
/// @param settings  without the "QEL_FAULT_" in front
std::map<std::string, std::string> faults(const std::map<std::string, std::string>& settings);

/// A fresh directory for each test, and a root and the credentials of "server" that all tests of a program share.
class CaTest : public testing::Test {
protected:
    std::string path() const { return mDirectory.path(); }
    std::string file(const std::string& name) const { return mDirectory.file(name); }
    std::string read(const std::string& name) const;
    void write(const std::string& name, const std::string& content) const;
    /// In octal, as "600".
    std::string modeOf(const std::string& name) const;
    /// All names in the directory, in their order.
    std::vector<std::string> names() const;

    /// Puts shared files into the directory: root.crt and root.key, server.crt, server.key and server.csr.
    void bring(const std::vector<std::string>& names) const;
    /// The root: "CN=Our root,O=Example", ten years.
    void bringRoot() const { bring({"root.crt", "root.key"}); }

    /// The directory with the shared files; not to be changed.
    static const std::string& shared();

private:
    TemporaryDirectory mDirectory;
};

/// The fixture of most tests of the authority.
class Ca : public CaTest {
protected:
    using Clock = SSLValidityPeriod::Clock;

    static std::string readShared(const std::string& name) { return Utilities::readFile(shared() + "/" + name); }

    SSLCertificate certificate(const std::string& name) const { return SSLCertificate(read(name)); }

    /// A certificate of that period, for the shared server by the shared root.
    void writeCertificate(const std::string& name, Clock::time_point from, Clock::time_point until) const
    {
        static const SSLCertificate sRoot(readShared("root.crt"), RSAPrivateKey(readShared("root.key")));
        SSLCertificateRequest request(readShared("server.csr"));
        write(name, sRoot.sign(request, SSLValidityPeriod(from, until)).getPEM());
    }
};

} // namespace qel::test
