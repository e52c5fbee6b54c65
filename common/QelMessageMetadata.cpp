#include <qel/common/QelMessageMetadata.hpp>

namespace qel {
namespace detail {

void throwBadOperation() { throw QelMessageValidationException("bad operation"); }

} // namespace detail
} // namespace qel
