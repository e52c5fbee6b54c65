#include <qel/common/LogBackendStdout.hpp>

#include <cstdio>

namespace qel {

LogBackendStdout::~LogBackendStdout() = default;

void LogBackendStdout::pLog(const std::string& line)
{
    std::puts(line.c_str()); // output errors are ignored
}

} // namespace qel
