#pragma once

#include <qel/common/io/Stream.hpp>

#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>
#include <utility>

namespace qel::test {

/// Wraps a stream and calls functions of the test right before and right after each call of it, on the calling thread.
/// Thread safety: that of the wrapped stream; set the hooks while no thread reads or writes.
class HookedStream : public Stream {
public:
    struct Hooks {
        std::function<void()> beforeRead;
        std::function<void()> afterRead;
        std::function<void()> beforeWrite;
        std::function<void()> afterWrite;
        std::function<void()> onClose;
    };

    /// @param hooks  borrowed; must outlive the stream
    HookedStream(std::unique_ptr<Stream> inner, const Hooks& hooks) : mInner(std::move(inner)), mHooks(hooks) {}

    void close() override
    {
        run(mHooks.onClose);
        mInner->close();
    }
    void setReadDeadline(std::chrono::milliseconds timeout) override { mInner->setReadDeadline(timeout); }
    void setWriteDeadline(std::chrono::milliseconds timeout) override { mInner->setWriteDeadline(timeout); }

    std::size_t read(char* buffer, std::size_t length) override
    {
        run(mHooks.beforeRead);
        const std::size_t count = mInner->read(buffer, length);
        run(mHooks.afterRead);
        return count;
    }

    void write(const char* buffer, std::size_t length) override
    {
        run(mHooks.beforeWrite);
        mInner->write(buffer, length);
        run(mHooks.afterWrite);
    }

private:
    static void run(const std::function<void()>& hook)
    {
        if (hook) hook();
    }

    const std::unique_ptr<Stream> mInner;
    const Hooks& mHooks;
};

} // namespace qel::test
