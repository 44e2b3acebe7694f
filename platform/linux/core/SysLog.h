// Lines of the platform for the system log. Relies on syslog. Promises: a line stays one line and can do nothing to a
// terminal, whatever the values in it hold (a control character stands as \xHH); needs no memory; errno is kept.
#pragma once

#include <syslog.h>

#include "core/Export.h"

namespace tavo {

TAVO_PLATFORM_API void SysLog(int nPriority, const char* szFormat, ...) __attribute__((format(printf, 2, 3)));

}  // namespace tavo
