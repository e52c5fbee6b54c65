#include "ModelledQueue.hpp"

// The private headers of the queue, as they are.
#include "LogLine.hpp"
#include "util/Timeout.hpp"

namespace qel::modelled {

#include "QelMessageQueue.cpp"

} // namespace qel::modelled
