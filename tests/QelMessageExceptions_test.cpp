#include <qel/common/QelMessageExceptions.hpp>

#include "support/MessageProbe.hpp"
#include "support/RawFrame.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdexcept>
#include <string>
#include <type_traits>

namespace qel {
namespace {

using test::MessageProbe;
using test::RawFrame;
using testing::StrEq;
using testing::Throws;
using testing::ThrowsMessage;

const MessageProbe& failedResponse()
{
    static const MessageProbe message(RawFrame::newForm()
                                          .callerId(0x10)
                                          .function(0x6003)
                                          .operation(0x0102)
                                          .flags(0x40)
                                          .status(23)
                                          .statusDetail(0x00AB)
                                          .bytes());
    return message;
}

TEST(QelMessageExceptions, AreValidationExceptions)
{
    static_assert(std::is_base_of<std::runtime_error, QelMessageValidationException>::value, "");
    static_assert(std::is_base_of<QelMessageValidationException, QelMessageStatusException>::value, "");
    static_assert(std::is_base_of<QelMessageValidationException, QelMessageCastException>::value, "");
}

TEST(QelMessageExceptions, CarryTheTextTheyAreGiven)
{
    EXPECT_STREQ(QelMessageValidationException("i_buffer").what(), "i_buffer");
    EXPECT_STREQ(QelMessageValidationException(std::string("bad operation")).what(), "bad operation");
}

TEST(QelMessageExceptions, OfAStatusNameTheMessage)
{
    EXPECT_STREQ(QelMessageStatusException(failedResponse()).what(),
                 "QEL message [CID: 0x00000010, FN: 0x6003, OP: 0x0102, FL: 0x40, DL: 0, ST: 0x00000017:00AB] contains "
                 "a bad status code");
}

TEST(QelMessageExceptions, OfACastNameTheMessageAndTheType)
{
    EXPECT_STREQ(QelMessageCastException(failedResponse(), "qel::Example").what(),
                 "Failed to cast message [CID: 0x00000010, FN: 0x6003, OP: 0x0102, FL: 0x40, DL: 0, ST: "
                 "0x00000017:00AB] to type qel::Example");
}

TEST(QelMessageExceptions, KeepTheirTextWhenCopied)
{
    const QelMessageStatusException original(failedResponse());
    const QelMessageStatusException copy(original);
    EXPECT_STREQ(copy.what(), original.what());
}

// The library throws, this program catches: by the class itself, by its base, and by the standard base.

TEST(QelMessageExceptions, AreCaughtByClassWhenTheLibraryThrows)
{
    EXPECT_THAT([] { failedResponse().checkStatus(); }, Throws<QelMessageStatusException>());
    EXPECT_THAT([] { QelMessage message(nullptr, 0); }, Throws<QelMessageValidationException>());
}

TEST(QelMessageExceptions, AreCaughtByBaseWhenTheLibraryThrows)
{
    EXPECT_THAT([] { failedResponse().checkStatus(); }, ThrowsMessage<QelMessageValidationException>(
                                                            StrEq(QelMessageStatusException(failedResponse()).what())));
    EXPECT_THAT([] { QelMessage message(nullptr, 0); }, ThrowsMessage<std::runtime_error>(StrEq("i_buffer")));
}

} // namespace
} // namespace qel
