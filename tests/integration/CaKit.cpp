#include "integration/CaKit.hpp"

#include <qel/common/Utilities.hpp>

#include <algorithm>
#include <filesystem>
#include <stdexcept>
#include <sys/stat.h>

namespace qel::test {

namespace {

namespace fs = std::filesystem;

Process::Result runWith(const std::vector<std::string>& command, const std::map<std::string, std::string>& environment)
{
    Process process(command, environment);
    process.closeInput();
    return process.wait();
}

} // namespace

std::vector<std::string> caCommand(const std::vector<std::string>& arguments)
{
    std::vector<std::string> command{QEL_PROGRAM, "ca"};
    command.insert(command.end(), arguments.begin(), arguments.end());
    return command;
}

Process::Result runCa(const std::vector<std::string>& arguments, const std::map<std::string, std::string>& environment)
{
    return runWith(caCommand(arguments), environment);
}

Process::Result runCaAfter(const std::string& shellCommands, const std::vector<std::string>& arguments)
{
    std::vector<std::string> command{"/bin/sh", "-c", shellCommands + " && exec \"$0\" \"$@\""};
    const std::vector<std::string> ca = caCommand(arguments);
    command.insert(command.end(), ca.begin(), ca.end());
    return runWith(command, {});
}

Process::Result runOpenssl(const std::vector<std::string>& arguments)
{
    std::vector<std::string> command{"/usr/bin/env", "openssl"};
    command.insert(command.end(), arguments.begin(), arguments.end());
    return runWith(command, {});
}

std::map<std::string, std::string> faults(const std::map<std::string, std::string>& settings)
{
    std::map<std::string, std::string> environment{{"LD_PRELOAD", QEL_FILE_FAULTS}};
    for (const auto& setting : settings)
        environment["QEL_FAULT_" + setting.first] = setting.second;
    return environment;
}

std::string CaTest::read(const std::string& name) const { return Utilities::readFile(file(name)); }

void CaTest::write(const std::string& name, const std::string& content) const
{
    Utilities::writeFile(file(name), content);
}

std::string CaTest::modeOf(const std::string& name) const
{
    struct stat status {};
    if (::lstat(file(name).c_str(), &status) != 0) return "none";
    char text[8];
    std::snprintf(text, sizeof(text), "%o", status.st_mode & 07777U);
    return text;
}

std::vector<std::string> CaTest::names() const
{
    std::vector<std::string> all;
    for (const auto& entry : fs::directory_iterator(path()))
        all.push_back(entry.path().filename().string());
    std::sort(all.begin(), all.end());
    return all;
}

void CaTest::bring(const std::vector<std::string>& names) const
{
    for (const std::string& name : names) {
        fs::copy_file(shared() + "/" + name, file(name)); // with its permissions
    }
}

const std::string& CaTest::shared()
{
    static const TemporaryDirectory sDirectory;
    static const std::string sPath = [] {
        const auto root = runCa({"init", sDirectory.path(), "--subject", "CN=Our root,O=Example"});
        const auto server = runCa({"issue", sDirectory.path(), "server", "--subject", "CN=server"});
        if (root.exitStatus != 0 || server.exitStatus != 0) throw std::runtime_error(root.errors + server.errors);
        return sDirectory.path();
    }();
    return sPath;
}

} // namespace qel::test
