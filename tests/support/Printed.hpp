#pragma once

#include <sstream>
#include <string>

namespace qel::test {

/// @return what a value prints onto a fresh stream
template <typename T>
std::string printed(const T& value)
{
    std::ostringstream os;
    os << value;
    return os.str();
}

} // namespace qel::test
