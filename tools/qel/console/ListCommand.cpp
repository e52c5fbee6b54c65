#include "console/ListCommand.hpp"

#include <qel/protocol/ServerAddress.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Answer.hpp"
#include "base/Failures.hpp"
#include "base/Library.hpp"
#include "base/OptionChecks.hpp"
#include "console/Profiles.hpp"
#include "status/StatusClient.hpp"
#include "status/StatusText.hpp"

#include <algorithm>
#include <array>
#include <chrono>
#include <iomanip>
#include <iostream>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <stdexcept>
#include <string>
#include <unistd.h>
#include <vector>

namespace qel::tool {

namespace {

constexpr const char* kFooter = R"(
Profiles are in $XDG_CONFIG_HOME/qel/config.toml, or ~/.config/qel/config.toml:

    [profile.lab]
    connect = "hypervisor.example:4711"    # the options of "qel console", without their dashes
    credentials = "/etc/qel/authority"
    name = "operator"
    partitions = { web1 = 1, db = 2 }

"qel console lab/web1" then connects to partition 1, and "qel console lab/7" to one without a name.

Who is on is known of a server on this machine whose status socket can be reached: see qel status --help.

Exit status: 0 done; 2 the file is wrong; 4 it cannot be read.)";

struct Row {
    std::string target;
    std::uint16_t partition;
    std::string server;
    const PartitionState* state = nullptr; ///< null: its server is not the one that has been asked
};

bool isLoopback(const std::string& host) { return host == "localhost" || host == "127.0.0.1" || host == "::1"; }

bool isThisMachine(const std::string& host)
{
    std::array<char, 256> name{};
    return isLoopback(host) || (::gethostname(name.data(), name.size() - 1) == 0 && host == name.data());
}

/// Whether a server that listens at an endpoint is the one that a profile means.
bool isSame(const ServerAddress& meant, const std::string& endpoint)
{
    const ServerAddress listens = ServerAddress::parse(endpoint);
    if (listens.getPort() != meant.getPort()) return false;
    const std::string& host = listens.getHost();
    if (host == "0.0.0.0" || host == "::") return isThisMachine(meant.getHost());
    return host == meant.getHost() || (isLoopback(host) && isLoopback(meant.getHost()));
}

bool isServerOf(const StatusReport& report, const std::string& connect)
{
    try {
        const CLI::Validator withPort = defaultPort();
        std::string address = connect;
        static_cast<void>(withPort(address));
        const ServerAddress meant = ServerAddress::parse(address);
        return std::any_of(report.listen.begin(), report.listen.end(),
                           [&](const std::string& endpoint) { return isSame(meant, endpoint); });
    } catch (const std::invalid_argument&) { // "qel console" says what is wrong with the profile
        return false;
    }
}

/// Asks the server of this machine, if there is one.
std::optional<StatusReport> askWhoIsOn(const std::string& option)
{
    constexpr std::chrono::seconds kTimeout(2);
    const std::string socket = statusSocketFor(option);
    try {
        if (!socket.empty()) return askStatus(socket, kTimeout);
    } catch (const CommandFailure&) {
        if (!option.empty()) throw; // otherwise nobody has said that there is one
    }
    return std::nullopt;
}

/// @param report  borrowed by the rows
void addStates(std::vector<Row>& rows, const StatusReport& report)
{
    for (Row& row : rows) {
        if (!isServerOf(report, row.server)) continue;
        const auto found = std::find_if(report.partitions.begin(), report.partitions.end(),
                                        [&](const PartitionState& partition) { return partition.id == row.partition; });
        if (found != report.partitions.end()) row.state = &*found;
    }
}

std::vector<Row> rowsOf(const std::vector<Profile>& profiles)
{
    std::vector<Row> rows;
    for (const Profile& profile : profiles) {
        for (const auto& partition : profile.partitions)
            rows.push_back({profile.name + "/" + partition.first, partition.second, profile.option("connect")});
    }
    return rows;
}

void printText(const std::vector<Row>& rows, const std::optional<StatusReport>& report)
{
    std::size_t width = 0;
    for (const Row& row : rows)
        width = std::max(width, printable(row.target).size());
    for (const Row& row : rows) {
        std::cout << std::left << std::setw(static_cast<int>(width)) << printable(row.target) << "  partition "
                  << row.partition << " of " << printable(row.server);
        if (row.state != nullptr)
            std::cout << ", line " << lineWord(row.state->line) << ": " << sessionsText(*report, *row.state);
        std::cout << "\n";
    }
}

nlohmann::ordered_json sessionsJson(const PartitionState& partition, const StatusReport& report)
{
    auto sessions = nlohmann::ordered_json::array();
    for (const SessionState& session : partition.sessions) {
        const ConnectedConsole* const console = report.consoleOf(session);
        sessions.push_back({{"connection", session.number},
                            {"console", session.console},
                            {"name", console == nullptr ? "?" : consoleName(*console)}});
    }
    return sessions;
}

void printList(const std::vector<Row>& rows, const std::optional<StatusReport>& report)
{
    auto list = nlohmann::ordered_json::array();
    for (const Row& row : rows) {
        list.push_back({{"name", row.target}, {"partition", row.partition}, {"server", row.server}});
        if (row.state == nullptr) continue;
        list.back()["line"] = lineWord(row.state->line);
        list.back()["sessions"] = sessionsJson(*row.state, *report);
    }
    printJson(std::cout, {{"partitions", list}});
}

ExitStatus runList(bool json, const std::string& socket)
{
    const std::string path = profilesPath();
    std::vector<Row> rows = rowsOf(readProfiles(path));
    const std::optional<StatusReport> report = rows.empty() ? std::nullopt : askWhoIsOn(socket);
    if (report) addStates(rows, *report);
    if (json) {
        printList(rows, report);
    } else if (rows.empty()) {
        std::cerr << "qel: no profile names a partition; see qel list --help about " << printable(path) << std::endl;
    } else {
        printText(rows, report);
    }
    return ExitStatus::Done;
}

} // namespace

CLI::App& addListCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "list", "List the partitions that the profiles name, and who is on");
    const auto json = std::make_shared<bool>(false);
    addJsonOption(command, *json);
    const auto socket = std::make_shared<std::string>();
    command.add_option("--socket", *socket, "The status socket of the server on this machine")->type_name("PATH");
    command.footer(kFooter);
    command.callback([&action, json, socket] { action = [json, socket] { return runList(*json, *socket); }; });
    return command;
}

} // namespace qel::tool
