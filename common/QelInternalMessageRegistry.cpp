#include <qel/common/QelInternalMessageRegistry.hpp>

namespace qel {

QelMessageUpgradeConnectionAsync::~QelMessageUpgradeConnectionAsync() = default;

QelMessageAbortHandshakeAsync::~QelMessageAbortHandshakeAsync() = default;

QelInternalMessageRegistry::QelInternalMessageRegistry()
    : QelMessageRegistry({
          Entry<QelMessageUpgradeConnectionAsync>(),
          Entry<QelMessageAbortHandshakeAsync>(),
      })
{}

QelInternalMessageRegistry::~QelInternalMessageRegistry() = default;

QelInternalMessageRegistry& QelInternalMessageRegistry::getInstance()
{
    static QelInternalMessageRegistry instance;
    return instance;
}

} // namespace qel
