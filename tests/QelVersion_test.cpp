#include <qel/common/QelVersion.hpp>

#include <gtest/gtest.h>
#include <string>

namespace qel {
namespace {

TEST(QelVersion, ConsistsOfItsThreeNumbers)
{
    EXPECT_EQ(QEL_VERSION_STRING, std::to_string(QEL_VERSION_MAJOR) + "." + std::to_string(QEL_VERSION_MINOR) + "." +
                                      std::to_string(QEL_VERSION_PATCH));
}

TEST(QelVersion, OfTheLibraryIsThatOfItsHeaders) { EXPECT_STREQ(version(), QEL_VERSION_STRING); }

} // namespace
} // namespace qel
