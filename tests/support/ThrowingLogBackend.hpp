#pragma once

#include <qel/common/LogBackend.hpp>
#include <qel/common/LogLevel.hpp>

#include <stdexcept>
#include <string>

namespace qel::test {

/// A back-end that breaks the rule not to throw: every line throws std::runtime_error("back-end").
class ThrowingLogBackend : public LogBackend {
public:
    void log(LogLevel::Level, const std::string&) override { throw std::runtime_error("back-end"); }
};

} // namespace qel::test
