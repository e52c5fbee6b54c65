#include <qel/common/util/RefcountFile.hpp>

#include <unistd.h>

namespace qel {

RefcountFile::RefcountFile(int fd) : mControl(std::make_shared<ControlBlock>(fd)) {}

void RefcountFile::close() noexcept { mControl->close(); }

RefcountFile::ControlBlock::ControlBlock(int fd) noexcept : mRefcount(fd < 0 ? 0 : kOpen), mFd(fd) {}

RefcountFile::ControlBlock::~ControlBlock() { close(); }

int RefcountFile::ControlBlock::getFd() noexcept
{
    std::uint64_t word = mRefcount.load();
    do {
        if ((word & kOpen) == 0) return -1;
    } while (!mRefcount.compare_exchange_weak(word, word + 1));
    return mFd;
}

void RefcountFile::ControlBlock::putFd() noexcept
{
    std::uint64_t word = mRefcount.load();
    while (!mRefcount.compare_exchange_weak(word, word - 1)) {
    }
    if (word - 1 == 0) ::close(mFd);
}

void RefcountFile::ControlBlock::close() noexcept
{
    std::uint64_t word = mRefcount.load();
    do {
        if ((word & kOpen) == 0) return;
    } while (!mRefcount.compare_exchange_weak(word, word & ~kOpen));
    if ((word & ~kOpen) == 0) ::close(mFd);
}

RefcountFile::Guard::Guard(RefcountFile& file) noexcept : mControl(file.mControl.get()), mFd(mControl->getFd()) {}

RefcountFile::Guard::~Guard()
{
    if (isValid()) mControl->putFd();
}

} // namespace qel
