#pragma once

#include <qel/common/security/SSLCertificate.hpp>

#include "certificates/CertificateView.hpp"

#include <string>

/// @file
/// Names of certificates as text: "CN=console,O=Example". Fields are separated by commas; a comma in a value is written
/// "\,", a backslash "\\".

namespace qel::tool {

/// Reads the text of a subject. Fields are named by their short name (CN), their long name (commonName) or their
/// number in dots; blanks around name and value are removed. Values are printable ASCII: the library would store other
/// bytes as different characters.
/// @return the fields, named by their short names if they have one
/// @throws std::invalid_argument  says what is wrong: no field, a field that is unknown, given twice or without value,
///                                or a value that the field cannot have
SSLSubject parseSubject(const std::string& text);

/// The text of a name, as parseSubject() takes it; empty for an empty name. What is not printable ASCII is written as
/// "\xHH", a byte each, so that the text is safe to print on a terminal.
std::string nameText(const NameFields& fields);

} // namespace qel::tool
