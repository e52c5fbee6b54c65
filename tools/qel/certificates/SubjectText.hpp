#pragma once

#include <qel/common/security/CertificateFacts.hpp>
#include <qel/common/security/SSLCertificate.hpp>

#include <string>

/// @file
/// Names of certificates from text: "CN=console,O=Example", as qel::protocol::nameText() writes them. Fields are
/// separated by commas; a comma in a value is written "\,", a backslash "\\".

namespace qel::tool {

/// Reads the text of a subject. Fields are named by their short name (CN), their long name (commonName) or their
/// number in dots; blanks around name and value are removed. Values are printable ASCII: the library would store other
/// bytes as different characters.
/// @return the fields, named by their short names if they have one
/// @throws std::invalid_argument  says what is wrong: no field, a field that is unknown, given twice or without value,
///                                or a value that the field cannot have
SSLSubject parseSubject(const std::string& text);

} // namespace qel::tool
