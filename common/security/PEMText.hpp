#pragma once

#include <qel/common/security/SSLTypes.hpp>

#include "security/SSLCheck.hpp"

#include <climits>
#include <memory>
#include <openssl/pem.h>
#include <string>

namespace qel {

/// Loads an object from a PEM text.
/// @param read   one of OpenSSL's PEM_read_bio_... functions
/// @param error  the text of the exception when the text cannot be read
/// @return the object, owned by the caller, never null
template <typename Object, typename User>
Object* readPEM(const std::string& pem, Object* (*read)(BIO*, Object**, pem_password_cb*, User*), const char* error)
{
    if (pem.size() > INT_MAX) throw SSLException(error); // OpenSSL takes the length as an int
    const BIO_PTR bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
    checkSSL(bio != nullptr);
    // Without a callback, the last argument is the pass phrase. With null, OpenSSL would prompt at the terminal.
    char noPassPhrase[] = "";
    Object* const object = read(bio.get(), nullptr, nullptr, noPassPhrase);
    if (object == nullptr) {
        SSLException::flushErrorQueue();
        throw SSLException(error);
    }
    return object;
}

/// @param write  called with a BIO to write to; throws when it fails
/// @return the bytes written
template <typename Write>
std::string writePEM(const Write& write)
{
    const BIO_PTR bio(BIO_new(BIO_s_mem()));
    checkSSL(bio != nullptr);
    write(bio.get());
    char* data = nullptr; // not terminated
    const long length = BIO_get_mem_data(bio.get(), &data);
    checkSSL(length > 0);
    return std::string(data, static_cast<std::size_t>(length));
}

} // namespace qel
