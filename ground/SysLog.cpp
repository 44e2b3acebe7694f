// See SysLog.h.
#include "ground/SysLog.h"

#include <cerrno>
#include <cstdarg>
#include <cstdio>

namespace tavo {

namespace {

constexpr size_t kLineSize = 4096;  // what is longer is cut
constexpr size_t kEscapeSize = 4;   // "\xHH"

// Whether a control character begins there: one of ASCII, or one of Unicode, which has the byte 0xC2 before it.
bool IsControl(unsigned char nByte, unsigned char nNext) {
    return nByte < 0x20 || nByte == 0x7F || (nByte == 0xC2 && nNext >= 0x80 && nNext < 0xA0);
}

}  // namespace

void SysLog(int nPriority, const char* szFormat, ...) {
    const int nErrno = errno;
    char szLine[kLineSize] = {};
    va_list args;
    va_start(args, szFormat);
    std::vsnprintf(szLine, sizeof(szLine), szFormat, args);
    va_end(args);
    char szShown[kEscapeSize * kLineSize + 1] = {};
    char* pEnd = szShown;
    for (const char* p = szLine; *p != '\0'; ++p) {
        const auto nByte = static_cast<unsigned char>(*p);
        const auto nNext = static_cast<unsigned char>(p[1]);
        if (!IsControl(nByte, nNext)) {
            *pEnd++ = *p;
        } else if (nByte == 0xC2) {
            ++p;
            pEnd += std::snprintf(pEnd, kEscapeSize + 1, "\\x%02x", nNext);
        } else {
            pEnd += std::snprintf(pEnd, kEscapeSize + 1, "\\x%02x", nByte);
        }
    }
    syslog(nPriority, "%s", szShown);
    errno = nErrno;
}

}  // namespace tavo
