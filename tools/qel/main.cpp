#include "Commands.hpp"
#include "base/Program.hpp"

int main(int argc, char** argv) { return qel::tool::runProgram(qel::tool::addCommands, argc, argv); }
