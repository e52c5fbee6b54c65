#pragma once

#include <qel/protocol/Error.hpp>

#include <gmock/gmock.h>
#include <string>

namespace qel::test {

/// Matches a callable that throws an error of exactly this class, and its text.
template <typename T>
auto failsWith(const ::testing::Matcher<std::string>& text)
{
    using ::testing::Property;
    return ::testing::Throws<T>(Property("text", &T::what, text));
}

} // namespace qel::test
