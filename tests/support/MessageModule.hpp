#pragma once

/// @file
/// What the loadable modules of the tests offer. The names are looked up at run time.

namespace qel {
class QelMessage;
}

#define QEL_TEST_MODULE_EXPORT __attribute__((visibility("default")))

extern "C" {

/// Takes the next caller id. @return that id
QEL_TEST_MODULE_EXPORT unsigned int nextCallerId();

/// Builds a typed message by default. @return the caller id it took
QEL_TEST_MODULE_EXPORT unsigned int callerIdOfNewMessage();

/// @return the address of the one internal registry of the process
QEL_TEST_MODULE_EXPORT const void* internalRegistry();

/// @return a QelMessageAbortHandshakeAsync, which the caller owns
QEL_TEST_MODULE_EXPORT qel::QelMessage* newMessage();

/// @throws qel::QelMessageStatusException
QEL_TEST_MODULE_EXPORT void throwStatus();

} // extern "C"
