#include <qel/common/util/Mutex.hpp>
#include <qel/protocol/CommandLine.hpp>

#include "hypervisor/CommandEnvironment.hpp"
#include "hypervisor/PtyPort.hpp"

#include <stdexcept>
#include <utility>

namespace qel::protocol {

namespace {

/// The reaper that all lines of the process share, for as long as there is a line.
std::shared_ptr<ChildReaper> sharedReaper()
{
    static Mutex sMutex; // guards the next one
    static std::weak_ptr<ChildReaper> sReaper;
    const MutexLock lock(sMutex);
    std::shared_ptr<ChildReaper> reaper = sReaper.lock();
    if (reaper == nullptr) sReaper = reaper = std::make_shared<ChildReaper>();
    return reaper;
}

bool hasNull(const std::string& text) { return text.find('\0') != std::string::npos; }

bool isVariable(const std::string& text)
{
    const std::size_t equals = text.find('=');
    return equals != std::string::npos && equals != 0 && !hasNull(text);
}

void check(const std::string& command, const CommandLineOptions& options)
{
    if (command.empty() || hasNull(command)) throw std::invalid_argument("command");
    if (options.term.empty() || hasNull(options.term)) throw std::invalid_argument("term");
    for (const std::string& variable : options.environment) {
        if (!isVariable(variable)) throw std::invalid_argument("environment");
    }
}

} // namespace

std::unique_ptr<SerialLine> commandLine(std::string command, const CommandLineOptions& options)
{
    check(command, options);
    return std::make_unique<PtyPort>(std::move(command), sharedReaper(),
                                     commandEnvironment(options.term, options.environment));
}

} // namespace qel::protocol
