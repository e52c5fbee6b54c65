#pragma once

#include <arpa/inet.h>
#include <array>
#include <cstddef>
#include <cstring>
#include <stdexcept>
#include <string>

/// @file
/// What the two address families do alike with their bytes.

namespace qel {

/// Reads a text form of inet_pton(3).
/// @param family  AF_INET or AF_INET6, whose addresses have Size bytes
/// @param name    the family in the text of the error: "IPv4" or "IPv6"
/// @return the address in network order
/// @throws std::invalid_argument  "'TEXT' is not a valid NAME address"
template <std::size_t Size>
std::array<unsigned char, Size> parseAddress(int family, const char* name, const std::string& text)
{
    std::array<unsigned char, Size> bytes;
    // inet_pton stops at a NUL byte and would accept whatever follows it.
    const bool hasNul = text.find('\0') != std::string::npos;
    if (hasNul || ::inet_pton(family, text.c_str(), bytes.data()) != 1) {
        throw std::invalid_argument("'" + text + "' is not a valid " + name + " address");
    }
    return bytes;
}

/// @return -1, 0 or 1: a is less than, equal to or greater than b, compared from the first byte on
template <std::size_t Size>
int compareBytes(const std::array<unsigned char, Size>& a, const std::array<unsigned char, Size>& b) noexcept
{
    const int order = std::memcmp(a.data(), b.data(), Size);
    return (order > 0) - (order < 0);
}

} // namespace qel
