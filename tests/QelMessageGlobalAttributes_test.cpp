#include <qel/common/QelMessageInterfaceComponent.hpp>

#include "support/CallerIdScope.hpp"
#include "support/CatalogFrames.hpp"
#include "support/MessageProbe.hpp"

#include <gtest/gtest.h>
#include <string>

namespace qel {
namespace {

using test::CallerIdScope;
using test::detailsOf;
using test::frameOf;
using test::newFrame;
using test::oldFrame;
using test::Payload;
using test::payloadOf;
using test::received;
using test::verdict;

const char* const kTooShort = "dataLength smaller than minimum acceptable size";

// --- global mode attribute ------------------------------------------------------------------------------------------

template <typename T>
class GlobalMode : public testing::Test {};
using GlobalModeMessages = testing::Types<QelMessageSetGlobalModeAttributeReq, QelMessageGetGlobalModeAttributeRsp>;
TYPED_TEST_SUITE(GlobalMode, GlobalModeMessages, test::ClassNames);

TYPED_TEST(GlobalMode, IsBuiltWithItsText)
{
    EXPECT_EQ(payloadOf(TypeParam(0x7F, "9119*02C4E1")), "7F"   // mode
                                                         "00"   // reserved
                                                         "000B" // text length
                                                         "393131392A303243344531");
    EXPECT_EQ(payloadOf(TypeParam(1, "")), "01000000");
}

TYPED_TEST(GlobalMode, KeepsEmbeddedNuls)
{
    const std::string text("a\0b\0", 4);
    EXPECT_EQ(payloadOf(TypeParam(0, text)), "0000000461006200");
    EXPECT_EQ(TypeParam(0, text).getMTMS(), text);
}

TYPED_TEST(GlobalMode, SendsALongTextWholeWithItsLengthModulo65536)
{
    const TypeParam longest(1, std::string(65535, 'x'));
    EXPECT_EQ(longest.getMTMSLen(), 65535);
    EXPECT_EQ(longest.getMTMS(), std::string(65535, 'x'));

    const std::string text = "abc" + std::string(65536, 'x');
    const TypeParam wrapped(1, text);
    EXPECT_EQ(wrapped.dataLength(), 65543U);
    EXPECT_EQ(wrapped.getMTMSLen(), 3);
    EXPECT_EQ(wrapped.getMTMS(), "abc");
    EXPECT_EQ(std::string(wrapped.getData() + 4, text.size()), text);
    EXPECT_EQ(verdict<TypeParam>(newFrame<TypeParam>(Payload().text({wrapped.getData(), wrapped.dataLength()}))),
              "accepted");
}

TYPED_TEST(GlobalMode, NeedsItsFixedPart)
{
    EXPECT_EQ(verdict<TypeParam>(Payload()), kTooShort);
    EXPECT_EQ(verdict<TypeParam>(Payload().zeros(3)), kTooShort);
    EXPECT_EQ(verdict<TypeParam>(Payload().zeros(4)), "accepted");
}

TYPED_TEST(GlobalMode, NeedsItsWholeText)
{
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(0).u16(1)), "mtmsLen larger than acceptable");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(0).u16(5).text("abcd")), "mtmsLen larger than acceptable");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(0).u16(4).text("abcd")), "accepted");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(0).u16(3).text("abcd")), "accepted");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(0).u16(0xFFFF).text("abcd")), "mtmsLen larger than acceptable");
}

TYPED_TEST(GlobalMode, ReadsItsFieldsFromEitherForm)
{
    const Payload payload = Payload().u8(200).u8(0xEE).u16(4).text("abcdtail");
    for (const auto& frame : {newFrame<TypeParam>(payload), oldFrame<TypeParam>(payload)}) {
        const auto message = received<TypeParam>(frame);
        SCOPED_TRACE(frameOf(message));
        EXPECT_EQ(message.getMode(), 200);
        EXPECT_EQ(message.getMTMSLen(), 4);
        EXPECT_EQ(message.getMTMS(), "abcd");
        EXPECT_EQ(detailsOf(message), " mMode      200\n"
                                      " mMTMSLen   4\n"
                                      " mMTMS      abcd\n");
    }
}

TYPED_TEST(GlobalMode, ReadsAnEmptyText)
{
    for (const auto& frame : {newFrame<TypeParam>(Payload().zeros(4)), oldFrame<TypeParam>(Payload().zeros(4))}) {
        const auto message = received<TypeParam>(frame);
        EXPECT_EQ(message.getMTMS(), "");
        EXPECT_EQ(detailsOf(message), " mMode      0\n"
                                      " mMTMSLen   0\n"
                                      " mMTMS      \n");
    }
}

TEST(SetGlobalModeReq, HasItsHeader)
{
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(QelMessageSetGlobalModeAttributeReq(1, "x")), "DECAFF20"
                                                                    "00000025"
                                                                    "00000007"
                                                                    "6003"
                                                                    "80"
                                                                    "00"
                                                                    "00000005"
                                                                    "0108"
                                                                    "0000"
                                                                    "0000"
                                                                    "0000"
                                                                    "00000000"
                                                                    "0100000178");
}

TEST(GetGlobalModeRsp, HasItsHeader)
{
    const std::string afterCallerId = "6003"
                                      "40"
                                      "00"
                                      "00000005"
                                      "0109"
                                      "0000"
                                      "0000"
                                      "0000"
                                      "00000000"
                                      "0100000178";
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(QelMessageGetGlobalModeAttributeRsp(1, "x")), "DECAFF200000002500000007" + afterCallerId);
    EXPECT_EQ(frameOf(QelMessageGetGlobalModeAttributeRsp(0xAABBCCDD, 1, "x")),
              "DECAFF2000000025AABBCCDD" + afterCallerId);
}

// --- global save-area metadata --------------------------------------------------------------------------------------

template <typename T>
class GlobalMetadata : public testing::Test {};
using GlobalMetadataMessages =
    testing::Types<QelMessageSetGlobalSaveAreaMetadataReq, QelMessageGetGlobalSaveAreaMetadataRsp>;
TYPED_TEST_SUITE(GlobalMetadata, GlobalMetadataMessages, test::ClassNames);

TYPED_TEST(GlobalMetadata, IsBuiltWithItsBytes)
{
    EXPECT_EQ(payloadOf(TypeParam("meta")), "00046D657461");
    EXPECT_EQ(payloadOf(TypeParam("")), "0000");
}

TYPED_TEST(GlobalMetadata, KeepsEmbeddedNuls)
{
    const std::string metadata("\0\xFF\0", 3);
    EXPECT_EQ(payloadOf(TypeParam(metadata)), "000300FF00");
    EXPECT_EQ(TypeParam(metadata).getMetadata(), metadata);
}

TYPED_TEST(GlobalMetadata, SendsManyBytesWholeWithTheirLengthModulo65536)
{
    const TypeParam longest(std::string(65535, 'x'));
    EXPECT_EQ(longest.getMetadataLen(), 65535);
    EXPECT_EQ(longest.getMetadata(), std::string(65535, 'x'));

    const std::string metadata = "abc" + std::string(65536, 'x');
    const TypeParam wrapped(metadata);
    EXPECT_EQ(wrapped.dataLength(), 65541U);
    EXPECT_EQ(wrapped.getMetadataLen(), 3);
    EXPECT_EQ(wrapped.getMetadata(), "abc");
    EXPECT_EQ(std::string(wrapped.getData() + 2, metadata.size()), metadata);
}

TYPED_TEST(GlobalMetadata, NeedsItsFixedPart)
{
    EXPECT_EQ(verdict<TypeParam>(Payload()), kTooShort);
    EXPECT_EQ(verdict<TypeParam>(Payload().zeros(1)), kTooShort);
    EXPECT_EQ(verdict<TypeParam>(Payload().zeros(2)), "accepted");
}

TYPED_TEST(GlobalMetadata, NeedsAllItsBytes)
{
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(1)), "metadataLen larger than acceptable");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(5).text("abcd")), "metadataLen larger than acceptable");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(4).text("abcd")), "accepted");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(3).text("abcd")), "accepted");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(0xFFFF).text("abcd")), "metadataLen larger than acceptable");
}

TYPED_TEST(GlobalMetadata, ReadsItsFieldsFromEitherForm)
{
    const Payload payload = Payload().u16(12).text("twelve bytes and a tail");
    for (const auto& frame : {newFrame<TypeParam>(payload), oldFrame<TypeParam>(payload)}) {
        const auto message = received<TypeParam>(frame);
        SCOPED_TRACE(frameOf(message));
        EXPECT_EQ(message.getMetadataLen(), 12);
        EXPECT_EQ(message.getMetadata(), "twelve bytes");
        EXPECT_EQ(detailsOf(message), " mMetadataLen 12\n"
                                      " mMetadata    twelve bytes\n");
    }
}

TYPED_TEST(GlobalMetadata, ReadsAnEmptyText)
{
    for (const auto& frame : {newFrame<TypeParam>(Payload().zeros(2)), oldFrame<TypeParam>(Payload().zeros(2))}) {
        const auto message = received<TypeParam>(frame);
        EXPECT_EQ(message.getMetadata(), "");
        EXPECT_EQ(detailsOf(message), " mMetadataLen 0\n"
                                      " mMetadata    \n");
    }
}

TEST(SetGlobalMetadataReq, HasItsHeader)
{
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(QelMessageSetGlobalSaveAreaMetadataReq("x")), "DECAFF20"
                                                                    "00000023"
                                                                    "00000007"
                                                                    "6003"
                                                                    "80"
                                                                    "00"
                                                                    "00000003"
                                                                    "010A"
                                                                    "0000"
                                                                    "0000"
                                                                    "0000"
                                                                    "00000000"
                                                                    "000178");
}

TEST(GetGlobalMetadataRsp, HasItsHeader)
{
    const std::string afterCallerId = "6003"
                                      "40"
                                      "00"
                                      "00000003"
                                      "010B"
                                      "0000"
                                      "0000"
                                      "0000"
                                      "00000000"
                                      "000178";
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(QelMessageGetGlobalSaveAreaMetadataRsp("x")), "DECAFF200000002300000007" + afterCallerId);
    EXPECT_EQ(frameOf(QelMessageGetGlobalSaveAreaMetadataRsp(0xAABBCCDD, "x")),
              "DECAFF2000000023AABBCCDD" + afterCallerId);
}

} // namespace
} // namespace qel
