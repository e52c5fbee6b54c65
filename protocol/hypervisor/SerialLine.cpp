#include <qel/common/util/Poll.hpp>
#include <qel/protocol/SerialLine.hpp>

namespace qel::protocol {

SerialLine::~SerialLine() = default;

bool SerialLine::hasHungUp() const { return PollSet(PollFd(descriptor(), PollEvents::Error)).poll().anyReady(); }

std::optional<CommandEnd> SerialLine::commandEnd() { return CommandEnd(); }

} // namespace qel::protocol
