#include <qel/common/util/Poll.hpp>
#include <qel/protocol/SerialLine.hpp>
#include <qel/protocol/SerialTap.hpp>

namespace qel::protocol {

SerialLine::~SerialLine() = default;

bool SerialLine::hasHungUp() const { return PollSet(PollFd(descriptor(), PollEvents::Error)).poll().anyReady(); }

std::optional<CommandEnd> SerialLine::commandEnd() { return CommandEnd(); }

bool SerialLine::advance() { return true; }

bool SerialLine::wantsToWrite() const { return false; }

PollDeadline SerialLine::advanceAt() const { return {}; }

std::string SerialLine::endReason() const { return {}; }

bool SerialLine::sendBreak() { return false; }

SerialTap::~SerialTap() = default;

} // namespace qel::protocol
