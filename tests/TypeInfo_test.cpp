#include <qel/common/TypeInfo.hpp>
#include <qel/common/util/PosixError.hpp>

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdexcept>

namespace qel {

struct TypeInfoPolymorphic {
    virtual ~TypeInfoPolymorphic() = default;
};
struct TypeInfoDerived : TypeInfoPolymorphic {};
template <typename T>
struct TypeInfoTemplate {};

namespace {

using testing::StrEq;
using testing::ThrowsMessage;

TEST(TypeInfo, DemanglesTypeNames)
{
    EXPECT_EQ(TypeInfo::demangleSymbol(typeid(TypeInfoDerived).name()), "qel::TypeInfoDerived");
    EXPECT_EQ(TypeInfo::demangleSymbol(typeid(int).name()), "int");
}

TEST(TypeInfo, DemanglesFunctionSymbols)
{
    EXPECT_EQ(TypeInfo::demangleSymbol("_ZN3qel8TypeInfo11getTypeNameERKSt9type_info"),
              "qel::TypeInfo::getTypeName(std::type_info const&)");
}

TEST(TypeInfo, ReturnsATextThatIsNotASymbolUnchanged)
{
    EXPECT_EQ(TypeInfo::demangleSymbol("no symbol at all"), "no symbol at all");
    EXPECT_EQ(TypeInfo::demangleSymbol("_Znonsense!"), "_Znonsense!");
    EXPECT_EQ(TypeInfo::demangleSymbol(""), "");
}

TEST(TypeInfo, RefusesANullSymbol)
{
    EXPECT_THAT([] { TypeInfo::demangleSymbol(nullptr); }, ThrowsMessage<std::invalid_argument>(StrEq("symbol")));
}

TEST(TypeInfo, NamesATypeByItsTypeInfo)
{
    EXPECT_EQ(TypeInfo::getTypeName(typeid(PosixError)), "qel::PosixError");
    EXPECT_EQ(TypeInfo::getTypeName(typeid(TypeInfoTemplate<int>)), "qel::TypeInfoTemplate<int>");
}

TEST(TypeInfo, NamesTheDynamicTypeOfAnObject)
{
    const TypeInfoDerived derived;
    const TypeInfoPolymorphic& base = derived;
    EXPECT_EQ(TypeInfo::getTypeName(base), "qel::TypeInfoDerived");
    EXPECT_EQ(TypeInfo::getTypeName(TypeInfoTemplate<char>()), "qel::TypeInfoTemplate<char>");
    EXPECT_EQ(TypeInfo::getTypeName(5), "int");
}

} // namespace
} // namespace qel
