#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/Utilities.hpp>
#include <qel/protocol/CertificateState.hpp>

#include "integration/TestConsole.hpp"
#include "support/CredentialDirectory.hpp"

#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <vector>

namespace qel::test {

using Arguments = std::vector<std::string>;

inline Arguments operator+(Arguments left, const Arguments& right)
{
    left.insert(left.end(), right.begin(), right.end());
    return left;
}

/// The bytes of a frame.
inline std::string frameOf(const QelMessage& message) { return std::string(message.serialize(), message.msgLength()); }

/// A directory of credentials, and the program that runs with them.
class Tls : public ::testing::Test {
protected:
    std::unique_ptr<ServeProcess> serve(const Arguments& options = {}, const std::string& name = "server") const
    {
        return std::make_unique<ServeProcess>(options, "127.0.0.1:0", directory.options(name));
    }

    Process::Result call(const ServeProcess& server, const Arguments& more = {}, const std::string& name = "client",
                         const std::string& request = "limits") const
    {
        return callTo(server.endpoint(), more, name, request);
    }

    Process::Result callTo(const std::string& endpoint, const Arguments& more = {}, const std::string& name = "client",
                           const std::string& request = "limits") const
    {
        return withoutPinNote(
            runQel(Arguments{"call", "--connect", endpoint} + directory.options(name) + more + Arguments{request}));
    }

    Process::Result console(const ServeProcess& server, const std::string& input, const Arguments& more) const
    {
        return withoutPinNote(
            run(qelCommand(Arguments{"console", "--connect", server.endpoint()} + directory.options("client") + more),
                input));
    }

    /// What a client says first when no pin is set.
    static std::string pinNote()
    {
        return "qel: note: any certificate of the root may be the server: --peer-name or --peer-fingerprint says "
               "which\n";
    }

    /// Most tests are not about it.
    static Process::Result withoutPinNote(Process::Result result)
    {
        if (result.errors.rfind(pinNote(), 0) == 0) result.errors.erase(0, pinNote().size());
        return result;
    }

    static std::string prefix(const std::string& endpoint)
    {
        return "qel: no protected connection to " + endpoint + ": ";
    }

    /// The first and the last second of a certificate in the directory, as messages print it.
    std::string startOf(const std::string& file) const { return protocol::isoTime(validityOf(file).getNotBefore()); }
    std::string endOf(const std::string& file) const { return protocol::isoTime(validityOf(file).getNotAfter()); }

    SSLValidityPeriod validityOf(const std::string& file) const
    {
        return SSLCertificate(Utilities::readFile(directory.file(file))).getValidityPeriod();
    }

    CredentialDirectory directory;
};

} // namespace qel::test
