#include "base/HomePath.hpp"

#include <gtest/gtest.h>
#include <string>

namespace qel::test {

namespace {

TEST(HomePath, ATildeAndASlashAreTheHomeDirectory)
{
    const std::string home = tool::environmentValue("HOME");
    ASSERT_NE(home, "");
    EXPECT_EQ(tool::expandHome("~/a/~/b"), home + "/a/~/b");
    EXPECT_EQ(tool::expandHome("~/"), home + "/");
}

TEST(HomePath, AllElseIsAsItIs)
{
    for (const char* const path : {"", "~", "~user/a", "/a/~/b", "a", "\\~/a"})
        EXPECT_EQ(tool::expandHome(path), path);
}

TEST(HomePath, AVariableThatIsNotSetIsEmpty) { EXPECT_EQ(tool::environmentValue("QEL_NO_SUCH_VARIABLE"), ""); }

} // namespace

} // namespace qel::test
