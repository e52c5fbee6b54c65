// clang-format off: Utilities.hpp comes after <libgen.h>, whose macro basename must not harm it.
#include <qel/common/Utilities.hpp>

#include <libgen.h>
// clang-format on

#include <gtest/gtest.h>
#include <string>

namespace qel {
namespace {

TEST(UtilitiesAfterLibgen, BasenameIsTheOneOfTheLibrary)
{
    EXPECT_EQ(Utilities::basename("a/b/"), "b");
    std::string (*const function)(const std::string&) = &Utilities::basename;
    EXPECT_EQ(function("///"), "/");
    EXPECT_EQ(Utilities::dirname("a/b/"), "a");
}

TEST(UtilitiesAfterLibgen, BasenameOfTheCLibraryStaysUsable)
{
    char path[] = "/usr/lib/";
    EXPECT_STREQ(::basename(path), "lib");
    EXPECT_EQ(std::string(path), "/usr/lib") << "libgen.h's function changes its argument, unlike string.h's";
}

} // namespace
} // namespace qel
