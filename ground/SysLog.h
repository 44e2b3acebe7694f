// Lines of the platform for the system log. Relies on syslog. Promises: a line stays one line and can do nothing to a
// terminal, whatever the values in it hold (a control character stands as \xHH); needs no memory; errno is kept.
#pragma once

#include <syslog.h>

namespace tavo {

void SysLog(int nPriority, const char* szFormat, ...) __attribute__((format(printf, 2, 3)));

}  // namespace tavo
