// Starts, signals and reads back the NAT-PMP port-mapping daemon. Relies on the platform's processes
// and on its query for remapped ports. Promises: bounded waits; the text is passed on as it stands.
#include <unistd.h>

#include <cstdlib>
#include <cstring>

#include "Border.h"
#include "DaemonStart.h"
#include "Log.h"
#include "Sections.h"
#include "libtavoportmap.h"
#include "tavo/natpmp.h"

namespace {

constexpr char kFile[] = "src/NatpmpDaemon.cpp";
constexpr int kRemapSize = 1024;
constexpr int kRemapCalls = 22;
constexpr unsigned kCallRetrySeconds = 1;

using tavo::lib::AtBorder;
using tavo::lib::Refuse;

constexpr tavo::lib::DaemonControl kControl{kFile, tavo::lib::kNatpmpd, tavo::lib::kUpnpd, "/var/run/natpmpd.pid"};

using Buffer = std::unique_ptr<char, tavo::lib::FreeDeleter>;

// The platform may move the block while it grows it.
int AskRemap(Buffer& szRemap, int& nSize) {
    char* pBlock = szRemap.release();
    const int nAnswer = NetpmpRemapGet(&pBlock, &nSize);
    szRemap.reset(pBlock);
    return nAnswer;
}

}  // namespace

bool NatpmpDaemon::IsAlive() {
    return TLIBCIsProcAlive(tavo::lib::kNatpmpd) != 0;
}

bool NatpmpDaemon::Start() {
    return tavo::lib::StartDaemonOf(kControl);
}

bool NatpmpDaemon::CheckDaemon(bool& blRemap, std::string& strRemap) {
    return AtBorder(false, [&] {
        int nSize = kRemapSize;
        Buffer szRemap(static_cast<char*>(std::malloc(kRemapSize)));
        if (!szRemap) {
            return Refuse("%s:%d malloc fail: szRemap", kFile, __LINE__);
        }
        std::memset(szRemap.get(), 0, kRemapSize);
        for (int nCall = 1; AskRemap(szRemap, nSize) < 0; ++nCall) {
            if (nCall == kRemapCalls) {
                return false;
            }
            sleep(kCallRetrySeconds);
        }
        blRemap = szRemap && szRemap.get()[0] != '\0';
        if (blRemap) {
            strRemap = szRemap.get();
        }
        return true;
    });
}
