#pragma once

#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLTypes.hpp>

namespace qel {

/// Appends the fields to a name, in the order of the map's keys.
/// @throws SSLException  a field or value is not accepted
void addFields(X509_NAME* name, const SSLSubject& fields);

/// @return the fields of a name, as SSLCertificate::getSubject() describes
/// @throws SSLException  a value cannot be read
SSLSubject readFields(const X509_NAME* name);

} // namespace qel
