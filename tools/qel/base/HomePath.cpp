#include "base/HomePath.hpp"

#include <cstdlib>

namespace qel::tool {

std::string environmentValue(const char* name)
{
    const char* const value = std::getenv(name);
    return value == nullptr ? std::string() : value;
}

std::string expandHome(const std::string& path)
{
    const std::string home = environmentValue("HOME");
    return home.empty() || path.compare(0, 2, "~/") != 0 ? path : home + path.substr(1);
}

} // namespace qel::tool
