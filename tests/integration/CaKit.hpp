#pragma once

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

/// Runs "qel ca" behind some commands of the shell, such as "umask 0".
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

} // namespace qel::test
