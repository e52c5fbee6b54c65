#include <qel/common/net/SocketIF.hpp>

namespace qel {

SocketIF::~SocketIF() = default;

} // namespace qel
