// A module that the tests load at run time, to check that every part of a process finds the same loggers.

#include <qel/common/QelDebug.hpp>
#include <qel/common/QelLogger.hpp>

extern "C" {

__attribute__((visibility("default"))) qel::QelLogger* rootLoggerOfModule() { return &qel::QelLogger::get(); }

__attribute__((visibility("default"))) qel::QelLogger* namedLoggerOfModule(const char* name)
{
    return &qel::QelLogger::get(name);
}

__attribute__((visibility("default"))) qel::QelDebug* registryOfModule() { return &qel::QelDebug::globals(); }

} // extern "C"
