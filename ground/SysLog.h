// Lines of the platform for the system log. Relies on syslog. Promises: see LogLine.h.
#pragma once

#include <syslog.h>

namespace tavo {

void SysLog(int nPriority, const char* szFormat, ...) __attribute__((format(printf, 2, 3)));

}  // namespace tavo
