#include "check/Case.hpp"

#include <utility>

namespace qel::tool::check {

const char* levelName(Level level)
{
    switch (level) {
    case Level::Wire:
        return "wire";
    case Level::Rule:
        return "rule";
    case Level::Robust:
        break;
    }
    return "robust";
}

Failure::Failure(std::string expected, std::string seen)
    : std::runtime_error("expected " + expected + ", seen " + seen), mExpected(std::move(expected)),
      mSeen(std::move(seen))
{}

Failure::~Failure() = default;

Skip::Skip(const std::string& reason) : std::runtime_error(reason) {}

Skip::~Skip() = default;

} // namespace qel::tool::check
