#include <qel/common/QelDebug.hpp>
#include <qel/common/QelLogger.hpp>

#include <stdexcept>
#include <utility>

namespace qel {

std::atomic<QelLogger*> QelLogger::sRoot{nullptr};

QelLogger::QelLogger(CtorPasskey, QelDebug& owner)
    : mOwner(owner), mParent(nullptr), mThreshold(pInitialLevel()), mPropagate(false)
{}

QelLogger::QelLogger(CtorPasskey, QelDebug& owner, const std::string& name, QelLogger* parent)
    : mName(name), mOwner(owner), mParent(parent), mThreshold(pInitialLevel()), mPropagate(true)
{}

QelLogger::~QelLogger() = default;

QelLogger& QelLogger::get(const std::string& name) { return QelDebug::globals().getLogger(name); }

QelLogger& QelLogger::pFirstGet()
{
    QelLogger& root = QelDebug::globals().getLogger();
    sRoot.store(&root, std::memory_order_release);
    return root;
}

QelLogger& QelLogger::setLevel(LogLevel::Level level) noexcept
{
    if (!LogLevel::isValid(level)) return *this;
    if (isRoot() && level == LogLevel::Inherit) level = LogLevel::Warn;
    mThreshold.store(level, std::memory_order_relaxed);
    return *this;
}

QelLogger& QelLogger::propagate(bool enable) noexcept
{
    if (!isRoot()) mPropagate.store(enable, std::memory_order_relaxed);
    return *this;
}

void QelLogger::addBackend(std::shared_ptr<LogBackend> backend)
{
    if (backend == nullptr) throw std::invalid_argument("backend");
    const MutexLock lock(pLock());
    mBackends.push_back(std::move(backend));
}

std::vector<std::shared_ptr<const LogBackend>> QelLogger::getBackends() const
{
    const MutexLock lock(pLock());
    return {mBackends.begin(), mBackends.end()};
}

void QelLogger::send(LogLevel::Level level, const std::string& line)
{
    const MutexLock lock(pLock());
    pSendLocked(level, line);
}

void QelLogger::pSendLocked(LogLevel::Level level, const std::string& line)
{
    for (const std::shared_ptr<LogBackend>& backend : mBackends)
        backend->log(level, line);
    if (!mPropagate.load(std::memory_order_relaxed)) return;
    mParent->pAssertLocked();
    mParent->pSendLocked(level, line);
}

std::vector<std::shared_ptr<LogBackend>> QelLogger::pResetLocked()
{
    mThreshold.store(pInitialLevel(), std::memory_order_relaxed);
    mPropagate.store(!isRoot(), std::memory_order_relaxed);
    return std::exchange(mBackends, {});
}

Mutex& QelLogger::pLock() const noexcept { return mOwner.mLock; }

} // namespace qel
