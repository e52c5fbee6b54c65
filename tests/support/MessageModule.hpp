#pragma once

/// @file
/// The functions of the loadable modules of the tests. The tests look the names up at run time.

namespace qel {
class QelMessage;
}

#define QEL_TEST_MODULE_EXPORT __attribute__((visibility("default")))

extern "C" {

/// Draws the next caller id. @return that id
QEL_TEST_MODULE_EXPORT unsigned int nextCallerId();

/// Default-constructs a typed message. @return its caller id
QEL_TEST_MODULE_EXPORT unsigned int callerIdOfNewMessage();

/// @return the address of the one internal registry of the process
QEL_TEST_MODULE_EXPORT const void* internalRegistry();

/// @return a QelMessageAbortHandshakeAsync, which the caller owns
QEL_TEST_MODULE_EXPORT qel::QelMessage* newMessage();

/// @throws qel::QelMessageStatusException
QEL_TEST_MODULE_EXPORT void throwStatus();

} // extern "C"
