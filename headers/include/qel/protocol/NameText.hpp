#pragma once

#include <qel/common/security/CertificateFacts.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <string>

namespace qel::protocol {

/// The text of a name in a certificate: "CN=console,O=Example"; empty for an empty name. A comma in a value is written
/// "\,", a backslash "\\". What is not printable ASCII is written as "\xHH", a byte each, so that the text is safe to
/// print on a terminal.
/// Thread safety: any thread.
QEL_PROTOCOL_EXPORT std::string nameText(const NameFields& fields);

} // namespace qel::protocol
