#include <qel/common/QelVersion.hpp>

namespace qel {

const char* version() noexcept { return QEL_VERSION_STRING; }

} // namespace qel
