#include "hypervisor/CommandEnvironment.hpp"

#include <algorithm>
#include <cerrno>
#include <pwd.h>
#include <unistd.h>

namespace qel::protocol {

namespace {

constexpr const char* kPath = "/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin";
constexpr const char* kLanguage = "C.UTF-8";

struct Account {
    std::string user;
    std::string home = "/";
    std::string shell = "/bin/sh";
};

/// The account of the effective user id. An id without an entry in the user database is its own name.
Account currentAccount()
{
    constexpr std::size_t kMaxBuffer = 1024 * 1024;
    const uid_t id = ::geteuid();
    Account account;
    account.user = std::to_string(id);
    passwd entry{};
    passwd* found = nullptr;
    std::vector<char> buffer(1024);
    while (::getpwuid_r(id, &entry, buffer.data(), buffer.size(), &found) == ERANGE && buffer.size() < kMaxBuffer)
        buffer.resize(buffer.size() * 2);
    if (found == nullptr) return account;
    account.user = found->pw_name;
    if (*found->pw_dir != '\0') account.home = found->pw_dir;
    if (*found->pw_shell != '\0') account.shell = found->pw_shell;
    return account;
}

} // namespace

void setVariable(std::vector<std::string>& environment, const std::string& variable)
{
    const std::string start = variable.substr(0, variable.find('=') + 1);
    const auto found = std::find_if(environment.begin(), environment.end(),
                                    [&start](const std::string& entry) { return entry.rfind(start, 0) == 0; });
    if (found == environment.end()) {
        environment.push_back(variable);
    } else {
        *found = variable;
    }
}

std::vector<std::string> commandEnvironment(const std::string& term, const std::vector<std::string>& more)
{
    const Account account = currentAccount();
    std::vector<std::string> environment{
        "TERM=" + term,         "HOME=" + account.home,   std::string("PATH=") + kPath,
        "USER=" + account.user, "SHELL=" + account.shell, std::string("LANG=") + kLanguage};
    for (const std::string& variable : more)
        setVariable(environment, variable);
    return environment;
}

} // namespace qel::protocol
