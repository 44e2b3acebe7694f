// Reads and stores the settings of the router behind a gateway. Relies on the reader and writer of
// router.conf, the two databases and the rule syntax of the port-forward tool.
// Promises: arguments are checked before any work; a manual router's old settings come back after a failure.
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>

#include "Border.h"
#include "Entry.h"
#include "Log.h"
#include "ReplaceFile.h"
#include "Sections.h"
#include "Text.h"

namespace {

constexpr char kRouterConfBak[] = "/etc/portforward/router.conf.bak";

using tavo::lib::AtBorder;
using tavo::lib::FillText;
using tavo::lib::GetRouterLock;
using tavo::lib::kEntryFile;
using tavo::lib::kRouterConf;
using tavo::lib::LogError;
using tavo::lib::Refuse;
using tavo::lib::RouterLock;

using RouterConf = __tag_TAVO_ROUTER_CONF;
using ErrorReason = __tag_TAVO_LIBTAVOPORTMAP_ERR;

// UPnP or NAT-PMP drives this router; any other one is driven by its model's script.
bool IsDaemonRouter(const RouterConf& conf) {
    return std::strcmp(conf.szSupportUpnp, "yes") == 0 || std::strcmp(conf.szSupportNatpmp, "yes") == 0;
}

bool IsGatewayArgument(const char* szGwRouterIP, const RouterConf* pConf) {
    if (pConf == nullptr) {
        return Refuse("%s:%d routerConf is NULL", kEntryFile, __LINE__);
    }
    return tavo::lib::IsGatewayAddress(szGwRouterIP);
}

bool FillIdentity(RouterConfReader& reader, RouterConf& conf) {
    using Getter = int (RouterConfReader::*)(std::string&);
    const struct {
        Getter fnGet;
        char (*pSzField)[TAVO_TEXT_SIZE];
        const char* szNotRead;
        const char* szNotCopied;
    } rgFields[] = {
        {&RouterConfReader::GetBrand, &conf.szBrand, "%s:%d get brand failed", "%s:%d snprintf brand failed"},
        {&RouterConfReader::GetModel, &conf.szModel, "%s:%d get model failed", "%s:%d snprintf model failed"},
        {&RouterConfReader::GetVersion, &conf.szVersion, "%s:%d get version failed", "%s:%d snprintf version failed"},
        {&RouterConfReader::GetSupportUpnp, &conf.szSupportUpnp, "%s:%d get support upnp failed",
         "%s:%d snprintf szSupportUpnp failed"},
        {&RouterConfReader::GetSupportNatpmp, &conf.szSupportNatpmp, "%s:%d get support natpmp failed",
         "%s:%d snprintf szSupportNatpmp failed"},
    };
    for (const auto& field : rgFields) {
        std::string szText;
        if ((reader.*field.fnGet)(szText) == 0) {
            return Refuse(field.szNotRead, kEntryFile, __LINE__);
        }
        if (!FillText(*field.pSzField, szText)) {
            return Refuse(field.szNotCopied, kEntryFile, __LINE__);
        }
    }
    return true;
}

// What a manual router needs beyond its identity; what is not stored is left out.
bool FillAccount(RouterConfReader& reader, RouterConf& conf) {
    using Getter = int (RouterConfReader::*)(std::string&);
    const struct {
        Getter fnGet;
        char (*pSzField)[TAVO_TEXT_SIZE];
        const char* szNotCopied;
    } rgFields[] = {
        {&RouterConfReader::GetConnType, &conf.szConnType, "%s:%d snprintf szConnType failed"},
        {&RouterConfReader::GetConnPort, &conf.szConnPort, "%s:%d snprintf szConnPort failed"},
        {&RouterConfReader::GetUser, &conf.szUser, "%s:%d snprintf szUser failed"},
        {&RouterConfReader::GetPass, &conf.szPass, "%s:%d snprintf szPass failed"},
    };
    for (const auto& field : rgFields) {
        std::string szText;
        if ((reader.*field.fnGet)(szText) != 0 && !FillText(*field.pSzField, szText)) {
            return Refuse(field.szNotCopied, kEntryFile, __LINE__);
        }
    }
    return true;
}

bool FillMaxRule(RouterConf& conf) {
    int nMaxRule = 0;
    if (!RouterUpnpDB(conf.szBrand, conf.szModel, conf.szVersion).GetMaxRule(nMaxRule)) {
        return Refuse("%s:%d get max rule fail", kEntryFile, __LINE__);
    }
    return std::snprintf(conf.szMaxRule, sizeof(conf.szMaxRule), "%d", nMaxRule) >= 0 ||
           Refuse("%s:%d snprintf szMaxRule failed", kEntryFile, __LINE__);
}

constexpr int kNothingStored = 1;

// The file may be in order: what failed is the box, which has no memory or no descriptor left, or its disk.
bool IsReadFailure(int nErr) {
    return nErr == TLIBC_ERR_NO_MEMORY || nErr == TLIBC_ERR_OPEN || nErr == TLIBC_ERR_READ;
}

// A link that leads nowhere: there is something, and it is no file.
bool IsDanglingLink(const char* szPath) {
    struct stat status = {};
    return lstat(szPath, &status) == 0 && S_ISLNK(status.st_mode) && stat(szPath, &status) != 0;
}

// Whether there are settings. The platform's reader brings back what a killed writer left, and waits for one of pages
// that lives and has them aside for a moment: "nothing" must not be said before it has looked.
bool IsStored() {
    if (TLIBCFileExist(kRouterConf) == 1) {
        return true;
    }
    const tavo::lib::ConfList pList(TAVOPFGwRouterConfGet());
    return pList != nullptr || TLIBCFileExist(kRouterConf) == 1;
}

// What a reader found; kUnlinked: what cannot be parsed, and is gone.
enum class Look { kSection, kNothing, kFailed, kUnlinked };

Look LookAt(RouterConfReader& reader) {
    bool blExist = false;
    if (reader.IsSectionExist(blExist) != 0) {
        return blExist ? Look::kSection : Look::kNothing;
    }
    if (IsReadFailure(TLIBCErrGet())) {
        return Look::kFailed;
    }
    if (TLIBCErrGet() == TLIBC_ERR_NOT_FOUND && !IsDanglingLink(kRouterConf)) {
        // A writer has it aside, and may have put it back by now.
        LogError("%s:%d file=%s not exists", kEntryFile, __LINE__, kRouterConf);
        return Look::kNothing;
    }
    LogError("%s:%d file=%s has wrong format, try to unlink it", kEntryFile, __LINE__, kRouterConf);
    return unlink(kRouterConf) == 0 ? Look::kUnlinked : Look::kNothing;
}

constexpr int kMostCopies = 8;  // that cannot be parsed either, before there are said to be none

int FillRouterConf(const char* szGwRouterIP, RouterConf& conf) {
    if (!IsStored()) {
        LogError("%s:%d file=%s not exists", kEntryFile, __LINE__, kRouterConf);
        return kNothingStored;
    }
    // Settings that a killed writer left come back in the place of what cannot be parsed, and at once: not "nothing"
    // first, and old settings at the next call.
    for (int i = 0; i < kMostCopies && (i == 0 || IsStored()); ++i) {
        TLIBCErrSet(TLIBC_ERR_NONE, kEntryFile, __LINE__);
        RouterConfReader reader{std::string(szGwRouterIP)};
        switch (LookAt(reader)) {
            case Look::kSection:
                return FillIdentity(reader, conf) &&
                               (IsDaemonRouter(conf) ? FillMaxRule(conf) : FillAccount(reader, conf))
                           ? 0
                           : -1;
            case Look::kFailed:
                return -1;
            case Look::kNothing:
                return kNothingStored;
            case Look::kUnlinked:
                break;
        }
    }
    return kNothingStored;
}

// Storing goes through three outcomes: done, refused before anything was touched, or to be undone.
enum class Stored { kDone, kRefused, kUndo };

bool SetIdentity(RouterConfWriter& writer, const RouterConf& conf) {
    if (conf.szSupportUpnp[0] == '\0') {
        return Refuse("%s:%d support_upnp shall not be empty", kEntryFile, __LINE__);
    }
    if (conf.szSupportNatpmp[0] == '\0') {
        return Refuse("%s:%d support_natpmp shall not be empty", kEntryFile, __LINE__);
    }
    if (writer.SetBrandModelVersion(conf.szBrand, conf.szModel, conf.szVersion) == 0) {
        return Refuse("%s:%d save config failed", kEntryFile, __LINE__);
    }
    if (writer.SetSupportUpnp(conf.szSupportUpnp) == 0) {
        return Refuse("%s:%d save support upnp failed", kEntryFile, __LINE__);
    }
    return writer.SetSupportNatpmp(conf.szSupportNatpmp) != 0 ||
           Refuse("%s:%d save support natpmp failed", kEntryFile, __LINE__);
}

bool SetAccount(RouterConfWriter& writer, const RouterConf& conf) {
    const bool blAccount = conf.szUser[0] != '\0';
    if (writer.SetUserPass(blAccount ? conf.szUser : "", blAccount ? conf.szPass : "") == 0) {
        return Refuse("%s:%d save user/pass failed", kEntryFile, __LINE__);
    }
    if (conf.szConnType[0] == '\0') {
        return Refuse("%s:%d conntype shall not be empty", kEntryFile, __LINE__);
    }
    if (conf.szConnPort[0] == '\0') {
        return Refuse("%s:%d connport shall not be empty", kEntryFile, __LINE__);
    }
    if (writer.SetConnType(conf.szConnType) == 0 || writer.SetConnPort(conf.szConnPort) == 0) {
        return Refuse("%s:%d save config failed", kEntryFile, __LINE__);
    }
    return true;
}

bool RenameOrLog(const char* szFrom, const char* szTo, int nLine) {
    if (rename(szFrom, szTo) == 0) {
        return true;
    }
    return Refuse("%s:%d can not save backup file of '%s'", kEntryFile, nLine, kRouterConfBak);
}

Stored StoreManual(RouterConfWriter& writer, const char* szGwRouterIP, const RouterConf& conf, bool blHeld,
                   ErrorReason* pErr) {
    RouterDB db(szGwRouterIP);
    if (!SetAccount(writer, conf)) {
        return Stored::kRefused;
    }
    if (!blHeld) {  // what is moved aside could come back while the new settings are tried
        LogError("%s:%d can not save backup file of '%s'", kEntryFile, __LINE__, kRouterConfBak);
        return Stored::kRefused;
    }
    tavo::lib::OwnerAndMode old(kRouterConf);
    old.HideFromOthers();
    if (TLIBCFileExist(kRouterConf) == 1 && !RenameOrLog(kRouterConf, kRouterConfBak, __LINE__)) {
        return Stored::kRefused;
    }
    if (writer.Sync() == 0) {
        LogError("%s:%d sync config failed", kEntryFile, __LINE__);
        return Stored::kUndo;
    }
    old.GiveTo(kRouterConf);
    int nDescribed = 0;
    if (!db.GetSyntaxVersion(nDescribed)) {
        LogError("%s:%d can not get router syntax version", kEntryFile, __LINE__);
        return Stored::kUndo;
    }
    if (IGetCurrSyntaxVersion() < nDescribed) {
        if (pErr != nullptr) {
            *pErr = TAVO_LIBTAVOPORTMAP_ERR_SYNTAX_VERSION;
        }
        LogError("%s:%d syntax version and routerdb version is mis-mtached", kEntryFile, __LINE__);
        return Stored::kUndo;
    }
    return Stored::kDone;
}

Stored StoreDaemonRouter(RouterConfWriter& writer) {
    if (writer.Sync() == 0) {
        LogError("%s:%d sync config failed", kEntryFile, __LINE__);
        return Stored::kUndo;
    }
    return Stored::kDone;
}

int FinishStoring(Stored enStored) {
    switch (enStored) {
        case Stored::kDone:
            if (TLIBCFileExist(kRouterConfBak) == 1) {
                unlink(kRouterConfBak);
            }
            return 0;
        case Stored::kUndo:
            unlink(kRouterConf);
            if (TLIBCFileExist(kRouterConfBak) == 1) {
                RenameOrLog(kRouterConfBak, kRouterConf, __LINE__);
            }
            tavo::lib::FlushDirectoryOf(kRouterConf);  // what was refused must not be in force after a power cut
            return -1;
        case Stored::kRefused:
            break;
    }
    return -1;
}

}  // namespace

int TLibGetRouterConf(const char* szGwRouterIP, __tag_TAVO_ROUTER_CONF* routerConf, __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr,
                      bool blLock) {
    return AtBorder(-1, [&] {
        if (pErr != nullptr) {
            *pErr = TAVO_LIBTAVOPORTMAP_ERR_NONE;
        }
        RouterLock lock;
        if (!IsGatewayArgument(szGwRouterIP, routerConf) || (blLock && !GetRouterLock(lock, pErr))) {
            return -1;
        }
        return FillRouterConf(szGwRouterIP, *routerConf);
    });
}

int TLibSetRouterConf(const char* szGwRouterIP, __tag_TAVO_ROUTER_CONF* routerConf, __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr,
                      bool blLock) {
    return AtBorder(-1, [&] {
        RouterConfWriter writer(false);  // the other gateways' sections go
        if (pErr != nullptr) {
            *pErr = TAVO_LIBTAVOPORTMAP_ERR_FAILED;
        }
        RouterLock lock;
        if (!IsGatewayArgument(szGwRouterIP, routerConf) || (blLock && !GetRouterLock(lock, pErr)) ||
            !SetIdentity(writer, *routerConf)) {
            return -1;
        }
        // What FinishStoring() may bring back is left to it: what one before left as ".bak", and what is moved aside.
        const tavo::lib::HeldFile heldBefore(kRouterConfBak);
        if (IsDaemonRouter(*routerConf)) {
            return FinishStoring(StoreDaemonRouter(writer));
        }
        const tavo::lib::HeldFile held(kRouterConf);
        return FinishStoring(StoreManual(writer, szGwRouterIP, *routerConf, held.IsHeld(), pErr));
    });
}
