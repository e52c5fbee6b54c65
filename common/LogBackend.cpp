#include <qel/common/LogBackend.hpp>
#include <qel/common/QelLogger.hpp>

#include <utility>

namespace qel {

LogBackend::~LogBackend() = default;

void LogBackend::registerBackend(std::shared_ptr<LogBackend> backend)
{
    QelLogger::get().addBackend(std::move(backend));
}

} // namespace qel
