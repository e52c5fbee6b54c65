// A test program that links this file fails every test that leaves an entry in OpenSSL's error queue: no operation of
// the library may leave one, whether it succeeds or fails.

#include <gtest/gtest.h>
#include <openssl/err.h>

namespace {

class EmptyErrorQueue : public testing::EmptyTestEventListener {
    void OnTestEnd(const testing::TestInfo&) override
    {
        EXPECT_EQ(ERR_peek_error(), 0UL) << "left in the error queue: " << ERR_error_string(ERR_peek_error(), nullptr);
        ERR_clear_error(); // for the next test
    }
};

[[maybe_unused]] const bool sRegistered = [] {
    testing::UnitTest::GetInstance()->listeners().Append(new EmptyErrorQueue); // which owns it
    return true;
}();

} // namespace
