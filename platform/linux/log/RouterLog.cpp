// The router log: what the tests of a router did and met, one line each. Relies on LogFile.
// Promises: see tavo/log.h.
#include <string>

#include "ground/Border.h"
#include "ground/Fail.h"
#include "ground/LogFile.h"
#include "ground/TextFile.h"
#include "tavo/log.h"

namespace {

using tavo::Fail;

constexpr char kRouterLog[] = "/var/log/router.log";
constexpr size_t kTextSize = 1024;
constexpr int kRouterLogKind = 1;

}  // namespace

int TAVOWriteLog(const char* szText, int nKind, int nLevel) {
    return tavo::AtBorder(-1, [&] {
        if (szText == nullptr || nKind != kRouterLogKind || nLevel < 1) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const std::string szLine = tavo::LogTime() + " " + tavo::PrintableText(szText, kTextSize);
        return tavo::AppendLogLine(kRouterLog, szLine) ? 0 : Fail(TLIBC_ERR_WRITE);
    });
}
