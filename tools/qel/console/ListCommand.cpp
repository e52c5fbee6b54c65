#include "console/ListCommand.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"
#include "console/Profiles.hpp"

#include <algorithm>
#include <iomanip>
#include <iostream>
#include <memory>
#include <nlohmann/json.hpp>
#include <string>
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

Exit status: 0 done; 2 the file is wrong; 4 it cannot be read.)";

struct Row {
    std::string target;
    std::uint16_t partition;
    std::string server;
};

std::vector<Row> rowsOf(const std::vector<Profile>& profiles)
{
    std::vector<Row> rows;
    for (const Profile& profile : profiles) {
        for (const auto& partition : profile.partitions)
            rows.push_back({profile.name + "/" + partition.first, partition.second, profile.option("connect")});
    }
    return rows;
}

void printText(const std::vector<Row>& rows)
{
    std::size_t width = 0;
    for (const Row& row : rows)
        width = std::max(width, printable(row.target).size());
    for (const Row& row : rows) {
        std::cout << std::left << std::setw(static_cast<int>(width)) << printable(row.target) << "  partition "
                  << row.partition << " of " << printable(row.server) << "\n";
    }
}

void printJson(const std::vector<Row>& rows)
{
    auto list = nlohmann::ordered_json::array();
    for (const Row& row : rows)
        list.push_back({{"name", row.target}, {"partition", row.partition}, {"server", row.server}});
    std::cout << nlohmann::ordered_json{{"partitions", list}}.dump(2) << "\n";
}

ExitStatus runList(bool json)
{
    const std::string path = profilesPath();
    const std::vector<Row> rows = rowsOf(readProfiles(path));
    if (json) {
        printJson(rows);
    } else if (rows.empty()) {
        std::cerr << "qel: no profile names a partition; see qel list --help about " << printable(path) << std::endl;
    } else {
        printText(rows);
    }
    return ExitStatus::Done;
}

} // namespace

CLI::App& addListCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "list", "List the partitions that the profiles name");
    const auto json = std::make_shared<bool>(false);
    addJsonOption(command, *json);
    command.footer(kFooter);
    command.callback([&action, json] { action = [json] { return runList(*json); }; });
    return command;
}

} // namespace qel::tool
