#pragma once

#include <qel/common/QelCapabilities.hpp>
#include <qel/protocol/Hypervisor.hpp>
#include <qel/protocol/PartitionOptions.hpp>
#include <qel/protocol/ServerOptions.hpp>

#include "base/Library.hpp"
#include "base/Logging.hpp"
#include "serve/OptionSources.hpp"
#include "serve/ServeConfig.hpp"
#include "serve/ServeMachine.hpp"
#include "transport/TransportOptions.hpp"

#include <CLI/CLI.hpp>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <ostream>
#include <string>
#include <vector>

namespace qel::tool {

struct PlannedPartition {
    std::string line;
    PartitionOptions options;
    std::string logDirectory; ///< of the line's log; empty: there is none
};

/// What "qel serve" shall do: the options, parsed, whatever they come from.
struct ServePlan {
    ServerOptions server; ///< without the credentials, which are loaded when it starts
    std::map<std::uint16_t, PlannedPartition> partitions;
    ServePolicy policy;
    std::chrono::hours warnExpiry{0}; ///< so long before its end a certificate is warned about
    std::string term;
    std::uint64_t lineLogBytes = 0; ///< of one file of a line's log
    std::string statusSocket;       ///< "none": none; empty: the default one
    MachineInfo machine;
    QelCapabilities capabilities;
    TransportOptions transport;
    LogOptions log;

    bool checkOnly = false;
    bool printOnly = false;
    std::string file;               ///< the configuration file; empty: none
    ServeConfig config;             ///< what it says besides the options
    std::vector<Setting> settings;  ///< the values of all options
    std::vector<std::string> words; ///< the command line, for planAgain()
};

/// The options of "qel serve" on a command, and the values that they get.
/// Lifetime: borrows the command, whose options write to this object.
class ServeInput {
public:
    struct Options;

    /// Adds the options.
    explicit ServeInput(CLI::App& command);
    ~ServeInput();
    ServeInput(const ServeInput&) = delete;
    ServeInput& operator=(const ServeInput&) = delete;

    /// The plan, when the command line has been parsed.
    /// @throws CLI::ValidationError, CommandFailure  the options contradict each other
    ServePlan plan() const;

private:
    void pAddConfigOptions(CLI::App& command);
    void pApplySources(const CLI::App& command, const std::string& path);

    const std::unique_ptr<Options> mOptions;
    OptionSources mSources;
    std::string mFile;
    ServeConfig mConfig;
};

/// Makes the plan anew, with the environment and the file as they are now.
/// @param words  ServePlan::words
/// @throws CLI::ParseError, CommandFailure, FileIOError  something is wrong
ServePlan planAgain(const std::vector<std::string>& words);

/// Prints the plan as a configuration file, with the origin of each value.
void printPlan(std::ostream& os, const ServePlan& plan);

} // namespace qel::tool
