#pragma once

#include <qel/common/QelMessageRegistry.hpp>

namespace qel::tool {

/// The messages that consoles and hypervisors exchange; one registry for the whole process.
/// Thread safety: any thread.
inline QelMessageRegistry& messageRegistry()
{
    static QelMessageRegistry registry;
    return registry;
}

} // namespace qel::tool
