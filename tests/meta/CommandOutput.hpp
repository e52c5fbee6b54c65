// The output of a command, for tests that ask other programs about our files.
#pragma once

#include <array>
#include <cstdio>
#include <stdexcept>
#include <string>

namespace qel::test {

/// Runs a command in a shell.
/// @return what it printed on standard output
/// @throws std::runtime_error  it cannot be started, or its exit status is not 0
inline std::string outputOf(const std::string& command)
{
    FILE* const pipe = ::popen(command.c_str(), "r");
    if (pipe == nullptr) throw std::runtime_error("cannot run: " + command);
    std::string output;
    std::array<char, 4096> buffer;
    while (const std::size_t count = std::fread(buffer.data(), 1, buffer.size(), pipe))
        output.append(buffer.data(), count);
    if (::pclose(pipe) != 0) throw std::runtime_error("failed: " + command);
    return output;
}

} // namespace qel::test
