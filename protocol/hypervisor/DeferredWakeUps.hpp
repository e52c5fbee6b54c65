#pragma once

#include <array>
#include <cstddef>
#include <memory>
#include <vector>

namespace qel::protocol {

/// What sends the messages of a link. It is shared with those who are about to call it, so that it may outlive the
/// link. Thread safety: any thread may call it, without the hypervisor's lock and those of links.
class LinkWriter {
public:
    virtual ~LinkWriter() = default;

    /// There is something to send: wakes the thread that sends it. Does nothing if the link does not exist any more.
    virtual void wake() noexcept = 0;

    /// There is something to send: sends it on this thread, as far as that needs no waiting, and wakes the other one if
    /// anything is left. That saves waking it, and takes time of this thread.
    virtual void send() noexcept = 0;
};

/// Puts off the waking of writers on this thread for as long as it exists. Declare it before a lock: then the writers
/// are woken after the lock is released. A writer that is woken earlier may have to wait for the lock at once, and the
/// lock is held for longer.
///
/// Inside another one it does nothing: the outermost one collects.
/// Thread safety: belongs to the thread that made it.
class DeferredWakeUps {
public:
    enum class How {
        Wake,       ///< wakes all writers
        SendForOne, ///< if there is one writer only, sends on this thread; otherwise wakes them
    };

    explicit DeferredWakeUps(How how = How::Wake) noexcept;

    /// Wakes the writers, each once.
    ~DeferredWakeUps();

    DeferredWakeUps(const DeferredWakeUps&) = delete;
    DeferredWakeUps& operator=(const DeferredWakeUps&) = delete;

    /// From here on it is done so at the end. Does nothing inside another one.
    void change(How how) noexcept { mHow = how; }

    /// Wakes a writer: at the end of the object of this thread, or at once if there is none, or no memory to remember
    /// the writer.
    static void wake(const std::shared_ptr<LinkWriter>& writer) noexcept;

private:
    void pAdd(const std::shared_ptr<LinkWriter>& writer);

    How mHow;
    const bool mIsOutermost;
    std::array<std::shared_ptr<LinkWriter>, 2> mFirst; // more are rare: a broadcast to all
    std::size_t mCount = 0;                            // of mFirst
    std::vector<std::shared_ptr<LinkWriter>> mOthers;
};

} // namespace qel::protocol
