#include "Commands.hpp"

#include "bench/BenchCommand.hpp"
#include "certificates/CaCommand.hpp"
#include "check/CheckCommand.hpp"
#include "client/CallCommand.hpp"
#include "console/ConsoleCommand.hpp"
#include "console/ListCommand.hpp"
#include "decode/DecodeCommand.hpp"
#include "proxy/ProxyCommand.hpp"
#include "serve/ServeCommand.hpp"
#include "status/StatusCommand.hpp"

namespace qel::tool {

void addCommands(CLI::App& app, Action& action)
{
    addServeCommand(app, action);
    addCallCommand(app, action);
    addConsoleCommand(app, action);
    addListCommand(app, action);
    addStatusCommand(app, action);
    addBenchCommand(app, action);
    addDecodeCommand(app, action);
    addProxyCommand(app, action);
    addCheckCommand(app, action);
    addCaCommand(app, action);
}

} // namespace qel::tool
