#include <qel/common/util/CustomDeleter.hpp>

#include <gtest/gtest.h>
#include <memory>
#include <type_traits>
#include <vector>

namespace qel {
namespace {

struct Handle {
    int number;
};

std::vector<int> sReleased; // the numbers of the handles, in the order of their release

void releaseHandle(Handle* handle) { sReleased.push_back(handle->number); }

int releaseHandleWithResult(Handle* handle) noexcept
{
    sReleased.push_back(-handle->number);
    return 1;
}

using HandlePtr = std::unique_ptr<Handle, CustomDeleter<Handle, void, releaseHandle>>;
using OtherHandlePtr = std::unique_ptr<Handle, CustomDeleter<Handle, int, &releaseHandleWithResult>>;

class CustomDeleterTest : public testing::Test {
protected:
    void SetUp() override { sReleased.clear(); }
};

TEST_F(CustomDeleterTest, ReleasesThroughTheGivenFunction)
{
    Handle first{1};
    Handle second{2};
    {
        const HandlePtr pointer(&first);
        const OtherHandlePtr other(&second);
        EXPECT_TRUE(sReleased.empty());
    }
    EXPECT_EQ(sReleased, (std::vector<int>{-2, 1}));
}

TEST_F(CustomDeleterTest, ReleasesTheOldHandleOnReset)
{
    Handle first{1};
    Handle second{2};
    HandlePtr pointer(&first);
    pointer.reset(&second);
    EXPECT_EQ(sReleased, (std::vector<int>{1}));
    pointer.reset();
    EXPECT_EQ(sReleased, (std::vector<int>{1, 2}));
}

TEST_F(CustomDeleterTest, ReleasesNothingForAnEmptyOrMovedFromPointer)
{
    Handle handle{1};
    {
        HandlePtr from(&handle);
        const HandlePtr empty;
        const HandlePtr to(std::move(from));
        EXPECT_EQ(to.get(), &handle);
    }
    EXPECT_EQ(sReleased, (std::vector<int>{1}));
}

TEST_F(CustomDeleterTest, TakesNoSpaceAndDoesNotThrow)
{
    using Deleter = CustomDeleter<Handle, void, releaseHandle>;
    EXPECT_TRUE(std::is_empty<Deleter>::value);
    EXPECT_EQ(sizeof(HandlePtr), sizeof(Handle*));
    EXPECT_TRUE(noexcept(Deleter()(nullptr)));
}

} // namespace
} // namespace qel
