// The kernel's header knows more fields of its answer than that of the C library, and cannot be included beside it.
#include "TcpSegments.hpp"

#include <linux/tcp.h>
#include <netinet/in.h>
#include <stdexcept>
#include <sys/socket.h>

namespace qel::bench {

std::uint32_t dataSegmentsSent(int descriptor)
{
    tcp_info info = {};
    socklen_t length = sizeof(info);
    if (::getsockopt(descriptor, IPPROTO_TCP, TCP_INFO, &info, &length) != 0) throw std::runtime_error("TCP_INFO");
    return info.tcpi_data_segs_out;
}

} // namespace qel::bench
