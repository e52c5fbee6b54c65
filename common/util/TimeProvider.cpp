#include <qel/common/util/TimeProvider.hpp>

namespace qel {

namespace {

// Static initialisers and static destructors may write log lines. So the default provider exists before the first of
// them runs (both objects are constant-initialised) and is never destroyed (a union does not destroy its member).
union DefaultProviderStorage {
    constexpr DefaultProviderStorage() noexcept : provider() {}
    ~DefaultProviderStorage() {} // NOLINT(modernize-use-equals-default): a defaulted one would be deleted
    DefaultTimeProvider provider;
};

DefaultProviderStorage sDefault;
TimeProvider* sCurrent = &sDefault.provider;

} // namespace

std::chrono::system_clock::time_point TimeProvider::system() { return sCurrent->pSystem(); }

std::chrono::steady_clock::time_point TimeProvider::steady() { return sCurrent->pSteady(); }

TimeProvider::~TimeProvider() { pUnregister(); }

void TimeProvider::pRegister() noexcept { sCurrent = this; }

void TimeProvider::pUnregister() noexcept
{
    if (sCurrent == this) sCurrent = &sDefault.provider;
}

DefaultTimeProvider::~DefaultTimeProvider() = default;

std::chrono::system_clock::time_point DefaultTimeProvider::pSystem() { return std::chrono::system_clock::now(); }

std::chrono::steady_clock::time_point DefaultTimeProvider::pSteady() { return std::chrono::steady_clock::now(); }

} // namespace qel
