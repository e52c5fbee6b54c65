#pragma once

#include <qel/common/QelMessageRegistry.hpp>

namespace qel::tool {

/// The registry of the messages between consoles and hypervisors; one for the process.
/// Thread safety: any thread.
inline QelMessageRegistry& messageRegistry()
{
    static QelMessageRegistry registry;
    return registry;
}

} // namespace qel::tool
