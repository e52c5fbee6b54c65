#include "hypervisor/DeferredWakeUps.hpp"

#include <algorithm>
#include <exception>

namespace qel::protocol {

namespace {

thread_local DeferredWakeUps* tCollector = nullptr;

} // namespace

DeferredWakeUps::DeferredWakeUps(How how) noexcept : mHow(how), mIsOutermost(tCollector == nullptr)
{
    if (mIsOutermost) tCollector = this;
}

DeferredWakeUps::~DeferredWakeUps()
{
    if (!mIsOutermost) return;
    tCollector = nullptr;
    if (mHow == How::SendForOne && mCount == 1) {
        mFirst[0]->send();
        return;
    }
    for (std::size_t i = 0; i < mCount; ++i)
        mFirst[i]->wake();
    for (const auto& writer : mOthers)
        writer->wake();
}

void DeferredWakeUps::wake(const std::shared_ptr<LinkWriter>& writer) noexcept
{
    if (tCollector == nullptr) return writer->wake();
    try {
        tCollector->pAdd(writer);
    } catch (const std::exception&) {
        writer->wake();
    }
}

void DeferredWakeUps::pAdd(const std::shared_ptr<LinkWriter>& writer)
{
    if (std::find(mFirst.begin(), mFirst.begin() + mCount, writer) != mFirst.begin() + mCount) return;
    if (mCount < mFirst.size()) {
        mFirst[mCount] = writer;
        ++mCount;
    } else if (mOthers.empty() || mOthers.back() != writer) {
        mOthers.push_back(writer);
    }
}

} // namespace qel::protocol
