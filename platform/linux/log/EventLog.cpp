// The event log: what the user must see, one line an event. Relies on LogFile.
// Promises: control characters are dropped.
#include <sys/stat.h>

#include <string>

#include "ground/Border.h"
#include "ground/Catalogue.h"
#include "ground/Fail.h"
#include "ground/LogFile.h"
#include "ground/TextFile.h"
#include "tavo/log.h"

namespace {

using tavo::Fail;

constexpr char kDirectory[] = "/var/log/tavo";
constexpr char kEventLog[] = "/var/log/tavo/event.log";
constexpr size_t kTextSize = 4096;
constexpr int kSystemEvents = 1;

const char* LevelName(int nLevel) {
    switch (nLevel) {
        case 1:
            return "info";
        case 2:
            return "warning";
        default:
            return "error";
    }
}

}  // namespace

int TAVOLogSet1(int nKind, int nLevel, unsigned nEvent, const char* szText1, const char* szText2, const char* szText3,
                const char* szText4) {
    return tavo::AtBorder(-1, [&] {
        if (nKind != kSystemEvents || nLevel < 1 || nLevel > 3) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        char szEvent[16];
        std::snprintf(szEvent, sizeof(szEvent), "0x%08X", nEvent);
        std::string szLine =
            tavo::LogTime() + " " + LevelName(nLevel) + " " + szEvent + " " + tavo::EventMessage(nEvent);
        for (const char* szText : {szText1, szText2, szText3, szText4}) {
            if (szText != nullptr && *szText != '\0') {
                szLine += (szLine.ends_with(": ") ? "" : " ") + tavo::PrintableText(szText, kTextSize);
            }
        }
        mkdir(kDirectory, 0755);
        return tavo::AppendLogLine(kEventLog, std::move(szLine)) ? 0 : Fail(TLIBC_ERR_WRITE);
    });
}
