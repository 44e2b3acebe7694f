// See SysLog.h.
#include "ground/SysLog.h"

#include "ground/LogLine.h"

namespace tavo {

void SysLog(int nPriority, const char* szFormat, ...) {
    va_list arguments;
    va_start(arguments, szFormat);
    WriteLogLine(nPriority, szFormat, arguments);
    va_end(arguments);
}

}  // namespace tavo
