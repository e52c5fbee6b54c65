#pragma once

#include <qel/common/LogBackendFiltered.hpp>
#include <qel/common/QelExport.hpp>

#include <string>

namespace qel {

/// Writes lines to standard output, through the buffer of the C library's stdout. It never flushes that buffer and
/// ignores output errors. A line that holds a null byte ends there, since it is written with puts.
class QEL_EXPORT LogBackendStdout : public LogBackendFiltered {
public:
    using LogBackendFiltered::LogBackendFiltered;
    ~LogBackendStdout() override;

private:
    void pLog(const std::string& line) override;
};

} // namespace qel
