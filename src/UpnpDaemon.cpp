// Starts, signals and reads back the UPnP port-mapping daemon. Relies on the platform's processes and
// key files, and on the daemon's status file. Promises: bounded waits, texts only appended to.
#include <strings.h>
#include <unistd.h>

#include "Border.h"
#include "DaemonStart.h"
#include "Log.h"
#include "Sections.h"
#include "libtavoportmap.h"

namespace {

constexpr char kFile[] = "src/UpnpDaemon.cpp";
constexpr char kAdded[] = "1";
constexpr char kConflict[] = "718";  // the protocol's ConflictInMappingEntry
constexpr int kStatusReads = 22;
constexpr unsigned kReadRetrySeconds = 1;

using tavo::lib::AtBorder;
using tavo::lib::Hash;
using tavo::lib::Refuse;

constexpr tavo::lib::DaemonControl kControl{kFile, tavo::lib::kUpnpd, tavo::lib::kNatpmpd, "/var/run/upnpd.pid"};

void Append(std::string& szList, const char* szItem) {
    if (szList.empty()) {
        szList = szItem;
    } else {
        szList += ", ";
        szList += szItem;
    }
}

bool ReadStatus(Hash& pHash) {
    for (int nRead = 0; nRead < kStatusReads; ++nRead) {
        TLIBCSzHash* pRaw = pHash.release();
        const int nPairs = TLIBCFileGetKeys(tavo::lib::kUpnpStatus, nullptr, &pRaw, "=");
        pHash.reset(pRaw);
        if (nPairs != -1) {
            return true;
        }
        sleep(kReadRetrySeconds);
    }
    return Refuse("%s:%d failed to read key-value pairs from %s", kFile, __LINE__, tavo::lib::kUpnpStatus);
}

}  // namespace

bool UpnpDaemon::IsAlive() {
    return TLIBCIsProcAlive(tavo::lib::kUpnpTestDaemon) == 0 && TLIBCIsProcAlive(tavo::lib::kUpnpd) == 1;
}

bool UpnpDaemon::Start() {
    return tavo::lib::StartDaemonOf(kControl);
}

bool UpnpDaemon::CheckDaemon(bool& blConflict, bool& blError, std::string& strConflict, std::string& strError) {
    return AtBorder(false, [&] {
        if (TLIBCIsProcAlive(tavo::lib::kUpnpd) != 1) {
            return Refuse("%s:%d upnpd is not ready", kFile, __LINE__);
        }
        Hash pHash(TLIBCSzHashAlloc(tavo::lib::kHashSize));
        if (!pHash) {
            return Refuse("%s:%d failed to allocate list", kFile, __LINE__);
        }
        if (!ReadStatus(pHash)) {
            return false;
        }
        const char* szMapping = nullptr;
        const char* szResult = nullptr;
        for (int i = 0; TLIBCSzHashGetAt(pHash.get(), i, &szMapping, &szResult) == 1; ++i) {
            if (szResult == nullptr) {
                continue;
            }
            if (strcasecmp(szResult, kConflict) == 0) {
                Append(strConflict, szMapping);
            } else if (strcasecmp(szResult, kAdded) != 0) {
                Append(strError, szMapping);
            }
        }
        blConflict = !strConflict.empty();
        blError = !strError.empty();
        return true;
    });
}
