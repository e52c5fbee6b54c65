#include <qel/common/io/StreamIOException.hpp>

namespace qel {

// Out of line, so that there is one type information of this class in the whole program and catching by type works.
StreamIOException::~StreamIOException() = default;

} // namespace qel
