// The system log at priority error. Relies on syslog. Promises: a line that cannot be made is left out.
#include "Log.h"

#include <syslog.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>

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
    const int nErrno = errno;
    char* szLine = nullptr;
    const int nLength = vasprintf(&szLine, szFormat, arguments);
    if (nLength >= 0) {
        syslog(LOG_ERR, "%s", szLine);
        std::free(szLine);
    }
    errno = nErrno;
}

}  // namespace tavo::lib
