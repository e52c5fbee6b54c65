#pragma once

#include <qel/common/LogBackend.hpp>
#include <qel/common/LogLevel.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <memory>
#include <string>

namespace qel::protocol {

/// A log back-end that keeps the peers of a Server from pushing everything else out of the log. It filters lines for
/// another back-end:
///
///     LogBackend::registerBackend(std::make_shared<LogBackendThrottled>(std::make_shared<LogBackendRotating>(...)));
///
/// The lines that a Server's threads log about one peer, and those of the libraries below, pass as long as they are not
/// too many of one kind; lines that differ in words with digits only, such as addresses and identifiers, are of one
/// kind. Ten lines of a kind pass at once, and one more for each second. The rest is counted, and summed up once a
/// second: "192.0.2.7: 2989 more lines like this one: ...". A connection counts by its address, and inside TLS by its
/// address and the console's certificate, so connecting again renews nothing. Lines at Debug, and lines of all other
/// threads, always pass.
///
/// The sums come while Server::run() runs, and in Server::finish().
/// Thread safety: that of LogBackend.
class QEL_PROTOCOL_EXPORT LogBackendThrottled final : public LogBackend {
public:
    /// @param to  where the lines go; not null
    /// @throws std::invalid_argument  "to"
    explicit LogBackendThrottled(std::shared_ptr<LogBackend> to);
    ~LogBackendThrottled() override;

    /// Passes the line on, or counts it. Throws what the other back-end throws.
    void log(LogLevel::Level level, const std::string& line) override;

private:
    const std::shared_ptr<LogBackend> mTo;
};

} // namespace qel::protocol
