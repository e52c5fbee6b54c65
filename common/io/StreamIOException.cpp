#include <qel/common/io/StreamIOException.hpp>

namespace qel {

// Out of line, so that the whole program shares one type information and catches by type work across libraries.
StreamIOException::~StreamIOException() = default;

} // namespace qel
