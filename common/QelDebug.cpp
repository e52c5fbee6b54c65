#include <qel/common/QelDebug.hpp>

#include <memory>
#include <utility>
#include <vector>

namespace qel {

QelDebug& QelDebug::globals()
{
    static QelDebug sInstance;
    return sInstance;
}

QelDebug::QelDebug() : mRootLogger(QelLogger::CtorPasskey(), *this) {}

// Back-ends are destroyed before the loggers, since the destructor of a back-end may log.
QelDebug::~QelDebug() { resetLoggers(); }

QelLogger& QelDebug::getLogger(const std::string& name)
{
    const MutexLock lock(mLock);
    QelLogger* parent = &mRootLogger;
    for (std::size_t dot = name.find('.'); dot != std::string::npos; dot = name.find('.', dot + 1)) {
        parent = &pGetOrCreateLoggerLocked(name.substr(0, dot), *parent);
    }
    return pGetOrCreateLoggerLocked(name, *parent);
}

QelLogger& QelDebug::pGetOrCreateLoggerLocked(const std::string& name, QelLogger& parent)
{
    return mLoggers.try_emplace(name, QelLogger::CtorPasskey(), *this, name, &parent).first->second;
}

QelLogger* QelDebug::tryGetLogger(const std::string& name)
{
    const MutexLock lock(mLock);
    const auto found = mLoggers.find(name);
    return found != mLoggers.end() ? &found->second : nullptr;
}

void QelDebug::resetLoggers()
{
    // Declared before the lock, so destroyed after its release: the destructor of a back-end may be slow, or log.
    std::vector<std::vector<std::shared_ptr<LogBackend>>> released;
    const MutexLock lock(mLock);
    released.reserve(mLoggers.size() + 1);
    mRootLogger.pAssertLocked();
    released.push_back(mRootLogger.pResetLocked());
    for (auto& [name, logger] : mLoggers) {
        logger.pAssertLocked();
        released.push_back(logger.pResetLocked());
    }
}

} // namespace qel
