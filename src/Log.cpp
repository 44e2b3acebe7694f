// The system log at priority error. Relies on the one maker of log lines, a header that needs no platform.
// Promises: see Log.h.
#include "Log.h"

#include "ground/LogLine.h"

namespace tavo::lib {

void LogError(const char* szFormat, ...) {
    va_list arguments;
    va_start(arguments, szFormat);
    LogErrorV(szFormat, arguments);
    va_end(arguments);
}

bool Refuse(const char* szFormat, ...) {
    va_list arguments;
    va_start(arguments, szFormat);
    LogErrorV(szFormat, arguments);
    va_end(arguments);
    return false;
}

void LogErrorV(const char* szFormat, va_list arguments) {
    WriteLogLine(LOG_ERR, szFormat, arguments);
}

}  // namespace tavo::lib
