// The event log: what the user must see, one line an event. Relies on LogFile.
// Promises: control characters are dropped.
#include <sys/stat.h>

#include <string>
#include <utility>

#include "core/Border.h"
#include "core/TextFile.h"
#include "log/Catalogue.h"
#include "log/LogFile.h"
#include "tavo/log.h"

namespace {

constexpr char kFile[] = "platform/linux/log/EventLog.cpp";
constexpr char kDirectory[] = "/var/log/tavo";
constexpr char kEventLog[] = "/var/log/tavo/event.log";
constexpr size_t kTextSize = 4096;
constexpr int kSystemEvents = 1;

int Fail(int nErr, int nLine) {
    TLIBCErrSet(nErr, kFile, nLine);
    return -1;
}

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

constexpr std::pair<unsigned, const char*> kCatalogue[] = {
    {TAVO_EVENT_PF_CONFLICT, "The router already uses these ports for something else: "},
    {TAVO_EVENT_PF_ADD_FAILED, "The router refused to forward these ports: "},
    {TAVO_EVENT_PF_PORT_LOST, "Lost on the router: "},
    {TAVO_EVENT_PF_PORT_REFUSED, "Refused by the router: "},
    {TAVO_EVENT_PF_PORT_BACK, "Open on the router now: "},
    {TAVO_EVENT_PF_ROUTER_GONE, "The router is gone: "},
    {TAVO_EVENT_PF_ROUTER_BACK, "The router is back: "},
    {TAVO_EVENT_PF_ROUTER_REPLACED, "The router is another one: "},
    {TAVO_EVENT_PF_ADDRESS_CHANGED, "The outside address has changed: "},
    {TAVO_EVENT_PF_RENEWED, "The router had lost these ports, and has them again: "}};

}  // namespace

namespace tavo {

const char* EventMessage(unsigned nEvent) {
    for (const auto& [nKnown, szMessage] : kCatalogue) {
        if (nKnown == nEvent) {
            return szMessage;
        }
    }
    return "Event: ";
}

}  // namespace tavo

int TAVOLogSet1(int nKind, int nLevel, unsigned nEvent, const char* szText1, const char* szText2, const char* szText3,
                const char* szText4) {
    return tavo::AtBorder(-1, [&] {
        if (nKind != kSystemEvents || nLevel < 1 || nLevel > 3) {
            return Fail(TLIBC_ERR_BAD_PARAMETER, __LINE__);
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
        return tavo::AppendLogLine(kEventLog, std::move(szLine)) ? 0 : Fail(TLIBC_ERR_WRITE, __LINE__);
    });
}
