#pragma once

#include <cstddef>
#include <cstring>
#include <initializer_list>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

/// @file
/// Bytes in tests: written as numbers, printed as hexadecimal digits, copied to heap blocks of exactly their size.

namespace qel::test {

/// @param values each from 0 to 255: bytes({0xDE, 0xCA, 0xFF})
/// @throws std::invalid_argument "value": one is above 255
inline std::vector<char> bytes(std::initializer_list<unsigned int> values)
{
    std::vector<char> result;
    result.reserve(values.size());
    for (const unsigned int value : values) {
        if (value > 0xFF) throw std::invalid_argument("value");
        result.push_back(static_cast<char>(static_cast<unsigned char>(value)));
    }
    return result;
}

/// @return `count` letters: "abc...z", repeated
inline std::vector<char> letters(std::size_t count)
{
    std::vector<char> text;
    for (std::size_t i = 0; i < count; ++i)
        text.push_back(static_cast<char>('a' + i % 26));
    return text;
}

/// @return two upper-case digits for each byte, without separators: "DECAFF20"
inline std::string hex(const void* data, std::size_t length)
{
    static constexpr char kDigits[] = "0123456789ABCDEF";
    const auto* first = static_cast<const unsigned char*>(data);
    std::string text;
    text.reserve(2 * length);
    for (std::size_t i = 0; i < length; ++i) {
        text += kDigits[first[i] >> 4];
        text += kDigits[first[i] & 0xF];
    }
    return text;
}

inline std::string hex(const std::vector<char>& data) { return hex(data.data(), data.size()); }
inline std::string hex(const std::string& data) { return hex(data.data(), data.size()); }

/// @return a copy in a heap block of exactly `length` bytes, so that the address sanitizer reports a read past the end
inline std::unique_ptr<char[]> heapCopy(const void* data, std::size_t length)
{
    std::unique_ptr<char[]> copy(new char[length]);
    if (length != 0) std::memcpy(copy.get(), data, length);
    return copy;
}

inline std::unique_ptr<char[]> heapCopy(const std::vector<char>& data) { return heapCopy(data.data(), data.size()); }
inline std::unique_ptr<char[]> heapCopy(const std::string& data) { return heapCopy(data.data(), data.size()); }

} // namespace qel::test
