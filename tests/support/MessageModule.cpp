// A loadable module, built separately and linked with the library. The tests load two copies and check the state that
// the process must have only once.

#include "support/MessageModule.hpp"

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessage.hpp>

extern "C" {

unsigned int nextCallerId() { return qel::QelMessage::generateNextUint32(); }

unsigned int callerIdOfNewMessage() { return qel::QelMessageUpgradeConnectionAsync().getCallerId(); }

const void* internalRegistry() { return &qel::QelInternalMessageRegistry::getInstance(); }

qel::QelMessage* newMessage() { return new qel::QelMessageAbortHandshakeAsync(9U); }

void throwStatus() { throw qel::QelMessageStatusException(qel::QelMessage(9, 0x6001, 0x0002, qel::NoFlagSet)); }

} // extern "C"
