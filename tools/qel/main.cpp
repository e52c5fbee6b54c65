#include "base/Program.hpp"
#include "bench/BenchCommand.hpp"
#include "certificates/CaCommand.hpp"
#include "client/CallCommand.hpp"
#include "console/ConsoleCommand.hpp"
#include "decode/DecodeCommand.hpp"
#include "serve/ServeCommand.hpp"

int main(int argc, char** argv)
{
    CLI::App app("Server and console of the QEL management protocol", "qel");
    qel::tool::Action action;
    qel::tool::addStandardFlags(app);
    app.require_subcommand(1);

    // In the order in which --help lists them.
    qel::tool::addServeCommand(app, action);
    qel::tool::addCallCommand(app, action);
    qel::tool::addConsoleCommand(app, action);
    qel::tool::addBenchCommand(app, action);
    qel::tool::addDecodeCommand(app, action);
    qel::tool::addCaCommand(app, action);

    return qel::tool::runProgram(app, action, argc, argv);
}
