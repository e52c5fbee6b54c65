#include "base/Guard.hpp"
#include "support/CapturedLog.hpp"

#include <gmock/gmock.h>
#include <stdexcept>

namespace qel::test {

namespace {

using protocol::explainCurrent;
using protocol::runGuarded;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

template <typename Thrown>
std::string explanationOf(const Thrown& thrown)
{
    try {
        throw thrown;
    } catch (...) {
        return explainCurrent();
    }
}

TEST(Guard, ExplainsAnyException)
{
    EXPECT_EQ(explanationOf(std::runtime_error("no power")), "no power");
    EXPECT_EQ(explanationOf(42), "an exception that is not a std::exception");
    try {
        try {
            throw std::runtime_error("no power");
        } catch (...) {
            std::throw_with_nested(std::runtime_error("cannot start"));
        }
    } catch (...) {
        EXPECT_EQ(explainCurrent(), "cannot start: no power");
    }
}

TEST(Guard, AnOperationThatReturnsIsNotLogged)
{
    const CapturedLog log;
    bool ran = false;
    EXPECT_TRUE(runGuarded([&] { ran = true; }, "part"));
    EXPECT_TRUE(ran);
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(Guard, WhateverAnOperationThrowsIsLoggedAfterTheParts)
{
    const CapturedLog log;
    EXPECT_FALSE(runGuarded([] { throw std::runtime_error("no power"); }, "part ", 1));
    EXPECT_FALSE(runGuarded([] { throw 42; }, "part ", 2));
    EXPECT_THAT(log.lines(),
                ElementsAre("E: [qel] part 1: no power", "E: [qel] part 2: an exception that is not a std::exception"));
}

} // namespace

} // namespace qel::test
