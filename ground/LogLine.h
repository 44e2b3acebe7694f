// One line of the system log, as the platform and the library write it. Relies on syslog and on nothing of ours: of
// what lies beneath the seam, this alone is the library's too. Promises: a line stays one line and can do nothing to a
// terminal, whatever the values in it hold (a control character stands as \xHH; a line feed that ends the format
// stays); where memory has run out a long one is cut, and none is lost; errno is kept.
#pragma once

#include <syslog.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>

namespace tavo {

namespace logline {

inline constexpr size_t kLineSize = 4096;  // what is longer needs memory
inline constexpr size_t kEscapeSize = 4;   // "\xHH"

// Whether a control character begins there: one of ASCII, or one of Unicode, which has the byte 0xC2 before it.
inline bool IsControl(unsigned char nByte, unsigned char nNext) {
    return nByte < 0x20 || nByte == 0x7F || (nByte == 0xC2 && nNext >= 0x80 && nNext < 0xA0);
}

// szShown has kEscapeSize bytes for each of szLine, its NUL included. The end of what stands there then.
inline char* Show(const char* szLine, char* szShown) {
    for (const char* p = szLine; *p != '\0'; ++p) {
        const auto nByte = static_cast<unsigned char>(*p);
        const auto nNext = static_cast<unsigned char>(p[1]);
        if (!IsControl(nByte, nNext)) {
            *szShown++ = *p;
            continue;
        }
        const bool blUnicode = nByte == 0xC2;
        p += blUnicode ? 1 : 0;
        szShown += std::snprintf(szShown, kEscapeSize + 1, "\\x%02x", blUnicode ? nNext : nByte);
    }
    *szShown = '\0';
    return szShown;
}

inline void Write(int nPriority, const char* szFormat, char* szLine, char* szShown) {
    const size_t nFormat = std::strlen(szFormat);
    const size_t nLine = std::strlen(szLine);
    const bool blEnd = nFormat != 0 && szFormat[nFormat - 1] == '\n' && nLine != 0 && szLine[nLine - 1] == '\n';
    szLine[nLine - (blEnd ? 1 : 0)] = '\0';
    char* pEnd = Show(szLine, szShown);
    if (blEnd) {
        *pEnd++ = '\n';
        *pEnd = '\0';
    }
    syslog(nPriority, "%s", szShown);
}

}  // namespace logline

inline void WriteLogLine(int nPriority, const char* szFormat, va_list arguments) {
    using namespace logline;
    const int nErrno = errno;
    char szLine[kLineSize] = {};
    char szShown[kEscapeSize * kLineSize] = {};
    va_list again;
    va_copy(again, arguments);
    const int nLength = std::vsnprintf(szLine, sizeof(szLine), szFormat, arguments);
    const size_t nWhole = nLength < 0 ? 0 : static_cast<size_t>(nLength) + 1;
    const std::unique_ptr<char, decltype([](char* szText) { std::free(szText); })> pWhole(
        nWhole > sizeof(szLine) ? static_cast<char*>(std::malloc((1 + kEscapeSize) * nWhole)) : nullptr);
    errno = nErrno;
    if (pWhole && std::vsnprintf(pWhole.get(), nWhole, szFormat, again) >= 0) {
        Write(nPriority, szFormat, pWhole.get(), pWhole.get() + nWhole);
    } else {
        Write(nPriority, szFormat, szLine, szShown);
    }
    va_end(again);
    errno = nErrno;
}

}  // namespace tavo
