#pragma once

#include <qel/common/security/SSLTypes.hpp>

#include <stdexcept>
#include <string>

namespace qel::test {

/// @param write  called with a BIO to write to; returns 1 when that succeeded, as OpenSSL's functions do
/// @return the bytes written
template <typename Write>
std::string writtenBy(const Write& write)
{
    const BIO_PTR bio(BIO_new(BIO_s_mem()));
    if (bio == nullptr || write(bio.get()) != 1) throw std::runtime_error("could not write into memory");
    char* data = nullptr;
    const long length = BIO_get_mem_data(bio.get(), &data);
    return std::string(data, static_cast<std::size_t>(length));
}

} // namespace qel::test
