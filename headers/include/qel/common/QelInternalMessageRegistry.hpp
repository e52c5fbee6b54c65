#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessageMetadata.hpp>
#include <qel/common/QelMessageRegistry.hpp>

namespace qel {

/// Connection handshake: asks the peer to switch to the protected connection. No payload.
class QEL_EXPORT QelMessageUpgradeConnectionAsync
    : public QelMessageMetadata<QelMessageUpgradeConnectionAsync, QelMessageFunctionQel, QelMessageOpUpgradeConnection,
                                QelMessageClassification::Async> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageUpgradeConnectionAsync() override;
};

/// Connection handshake: aborts the handshake. No payload.
class QEL_EXPORT QelMessageAbortHandshakeAsync
    : public QelMessageMetadata<QelMessageAbortHandshakeAsync, QelMessageFunctionQel, QelMessageOpAbortHandshake,
                                QelMessageClassification::Async> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageAbortHandshakeAsync() override;
};

/// A registry of the two messages of the connection handshake; every other frame becomes a plain QelMessage.
/// Ownership and thread safety: as QelMessageRegistry.
class QEL_EXPORT QelInternalMessageRegistry : public QelMessageRegistry {
public:
    QelInternalMessageRegistry();
    ~QelInternalMessageRegistry() override;

    /// @return the one instance of the process; built on first use, destroyed when the process exits
    /// Thread safety: any thread.
    static QelInternalMessageRegistry& getInstance();
};

} // namespace qel
