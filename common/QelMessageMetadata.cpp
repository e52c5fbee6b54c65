#include <qel/common/QelMessageMetadata.hpp>

namespace qel::detail {

void throwBadOperation() { throw QelMessageValidationException("bad operation"); }

} // namespace qel::detail
