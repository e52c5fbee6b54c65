#include <qel/common/StreamFormatters.hpp>
#include <qel/common/stats/QelMessageStatisticsTypes.hpp>

#include <ostream>

namespace qel {

std::ostream& operator<<(std::ostream& os, const QelMessageCount& count)
{
    return os << decFormat(count.mCount) << " (" << decFormat(count.mBytes) << " B)";
}

std::ostream& operator<<(std::ostream& os, const QelMessageThroughput& throughput)
{
    const QelMessageCount& rate = throughput.mPerSecond;
    return os << decFormat(rate.mCount) << " m/s (" << decFormat(rate.mBytes) << " B/s)";
}

std::ostream& operator<<(std::ostream& os, const QelMessageLatency& latency)
{
    const auto microseconds = std::chrono::duration_cast<std::chrono::microseconds>(latency.mLatency).count();
    return os << "[CID=" << hexFormat(latency.mCallerID) << " FN=" << hexFormat(latency.mFunction)
              << " OP=" << hexFormat(latency.mOperation) << " T=" << decFormat(microseconds) << "us]";
}

} // namespace qel
