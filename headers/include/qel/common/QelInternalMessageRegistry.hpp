#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessageMetadata.hpp>
#include <qel/common/QelMessageRegistry.hpp>

namespace qel {

/// Part of the connection handshake: go over to the protected connection. No payload.
class QEL_EXPORT QelMessageUpgradeConnectionAsync
    : public QelMessageMetadata<QelMessageUpgradeConnectionAsync, QelMessageFunctionQel, QelMessageOpUpgradeConnection,
                                QelMessageClassification::Async> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageUpgradeConnectionAsync() override;
};

/// Part of the connection handshake: give it up. No payload.
class QEL_EXPORT QelMessageAbortHandshakeAsync
    : public QelMessageMetadata<QelMessageAbortHandshakeAsync, QelMessageFunctionQel, QelMessageOpAbortHandshake,
                                QelMessageClassification::Async> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageAbortHandshakeAsync() override;
};

/// A registry that knows only the two messages of the connection handshake; everything else becomes a plain QelMessage.
/// Thread safety: as QelMessageRegistry.
class QEL_EXPORT QelInternalMessageRegistry : public QelMessageRegistry {
public:
    QelInternalMessageRegistry();
    ~QelInternalMessageRegistry() override;

    /// The one instance that the whole process shares, built on first use; lives until the process ends.
    /// Thread safety: may be called from any thread.
    static QelInternalMessageRegistry& getInstance();
};

} // namespace qel
