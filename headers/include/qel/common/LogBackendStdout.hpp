#pragma once

#include <qel/common/LogBackendFiltered.hpp>
#include <qel/common/QelExport.hpp>

#include <string>

namespace qel {

/// Writes lines to standard output, through the buffer of the C library's stdout. It never flushes that buffer, ignores
/// output errors and does not throw. It writes with puts, which cuts a line at its first null byte.
/// Thread safety: as LogBackendFiltered; the C library locks stdout against the program's own output.
class QEL_EXPORT LogBackendStdout : public LogBackendFiltered {
public:
    using LogBackendFiltered::LogBackendFiltered;
    ~LogBackendStdout() override;

private:
    void pLog(const std::string& line) override;
};

} // namespace qel
