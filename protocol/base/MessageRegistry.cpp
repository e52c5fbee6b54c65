#include <qel/protocol/MessageRegistry.hpp>

namespace qel::protocol {

QelMessageRegistry& messageRegistry()
{
    static QelMessageRegistry registry;
    return registry;
}

} // namespace qel::protocol
