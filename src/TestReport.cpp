// What a compatibility test leaves behind: the user's own entry in the database, and the report of a failure.
// Relies on the database's writer, the last detection, the settings of the router, tar and curl.
// Promises: the user's settings are back in their place whatever happens, also where a signal ends the caller; no
// text from the router leaves /tmp or reaches a shell as anything but a name.
#include <signal.h>

#include <cstdio>
#include <ctime>
#include <optional>
#include <string_view>

#include "Border.h"
#include "Log.h"
#include "Paths.h"
#include "ReplaceFile.h"
#include "Sections.h"
#include "Text.h"
#include "libtavoportmap.h"
#include "tavo/upnptest.h"

namespace {

using tavo::lib::AtBorder;
using tavo::lib::FillText;
using tavo::lib::kEntryFile;
using tavo::lib::kPortTestMarker;
using tavo::lib::kRouterConf;
using tavo::lib::kRouterLog;
using tavo::lib::kTestProgress;
using tavo::lib::kUpnpStatus;
using tavo::lib::kUpnpUserDb;
using tavo::lib::LogError;
using tavo::lib::Refuse;
using RouterConf = __tag_TAVO_ROUTER_CONF;
using DetectResult = __tag_TAVO_ROUTER_DETECT_RESULT;

constexpr char kReportUser[] = "tavoreportuser";
constexpr char kReportPassword[] = "rtrsubmit417";

// The brand as a part of a file name and of a command: whatever could leave either becomes "_".
std::string ArchiveBrand(const char* szBrand) {
    constexpr std::string_view kPlain = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789 ._-+()";
    std::string szName = szBrand;
    for (char& c : szName) {
        c = kPlain.find(c) == std::string_view::npos ? '_' : c;
    }
    return szName.find_first_not_of('.') == std::string::npos ? "" : szName;
}

// Holds back the signals that would end this thread's process with the settings aside; they come when the object
// goes. The commands run meanwhile have them, so that Ctrl-C still ends an upload.
class SignalsHeld {
public:
    SignalsHeld() {
        sigset_t held;
        sigemptyset(&held);
        for (const int nSignal : {SIGHUP, SIGINT, SIGQUIT, SIGTERM}) {
            sigaddset(&held, nSignal);
        }
        pthread_sigmask(SIG_BLOCK, &held, &mBefore);
    }
    ~SignalsHeld() { pthread_sigmask(SIG_SETMASK, &mBefore, nullptr); }
    SignalsHeld(const SignalsHeld&) = delete;
    SignalsHeld& operator=(const SignalsHeld&) = delete;

private:
    sigset_t mBefore;
};

// The router settings, moved aside until they are put back, or for as long as the object lives.
class SettingsAside {
public:
    SettingsAside() : mSzAside(tavo::lib::UniqueName(kRouterConf, tavo::lib::AsideFor::kReport)) {}
    ~SettingsAside() { PutBack(); }
    SettingsAside(const SettingsAside&) = delete;
    SettingsAside& operator=(const SettingsAside&) = delete;

    void PutBack() {
        if (TLIBCFileExist(mSzAside.c_str()) == 1 && rename(mSzAside.c_str(), kRouterConf) != 0) {
            LogError("%s:%d rename(%s, %s) failed ", kEntryFile, __LINE__, mSzAside.c_str(), kRouterConf);
            return;
        }
        mSettings.reset();
    }

    bool Move() {
        if (TLIBCFileExist(kRouterConf) != 1) {  // what a killed writer left takes its place before ours would
            const tavo::lib::ConfList pList(TAVOPFGwRouterConfGet());
        }
        mSettings.emplace(kRouterConf);
        // What cannot be held could be brought back too soon, and be packed with the password in it.
        if (TLIBCFileExist(kRouterConf) != 1 || (mSettings->IsHeld() && rename(kRouterConf, mSzAside.c_str()) == 0)) {
            return true;
        }
        return Refuse("%s:%d rename(%s, %s) failed ", kEntryFile, __LINE__, kRouterConf, mSzAside.c_str());
    }

private:
    SignalsHeld mHeld;
    std::optional<tavo::lib::HeldFile> mSettings;
    std::string mSzAside;
};

bool DescribeDetected(RouterConf& conf, std::string& szBrand) {
    DetectResult detected = {};
    if (TLibGetRouterDetectResult(&detected) != 0) {
        return Refuse("%s:%d TLibGetRouterDetectResult() failed", kEntryFile, __LINE__);
    }
    szBrand = detected.szBrand;
    FillText(conf.szBrand, detected.szBrand);
    FillText(conf.szModel, detected.szModel);
    FillText(conf.szVersion, detected.szVersion);
    if (TLibSupportEnumToString(conf.szSupportUpnp, sizeof(conf.szSupportUpnp),
                                static_cast<__tag_TAVO_ROUTER_SUPPORT>(detected.enSupportUpnp)) != 0) {
        return Refuse("%s:%d TLibSupportEnumToString(enSupportUpnp) failed", kEntryFile, __LINE__);
    }
    if (TLibSupportEnumToString(conf.szSupportNatpmp, sizeof(conf.szSupportNatpmp),
                                static_cast<__tag_TAVO_ROUTER_SUPPORT>(detected.enSupportNatpmp)) != 0) {
        return Refuse("%s:%d TLibSupportEnumToString(enSupportNatpmp) failed", kEntryFile, __LINE__);
    }
    return true;
}

bool PackReport(const std::string& szArchive) {
    char szCommand[tavo::lib::kCommandSize] = {};
    std::snprintf(szCommand, sizeof(szCommand), "/bin/tar -zcvf '%s' %s %s %s %s %s >/dev/null 2>&1", szArchive.c_str(),
                  kRouterConf, kTestProgress, kUpnpStatus, kRouterLog, kPortTestMarker);
    if (TLIBCSystem(szCommand) != 0) {
        return Refuse("%s:%d failed to tar test upnp router result![0x%04X %s:%d]", kEntryFile, __LINE__,
                      static_cast<unsigned>(TLIBCErrGet()), TLIBCErrorGetFile(), TLIBCErrorGetLine());
    }
    return TLIBCFileExist(szArchive.c_str()) == 1 ||
           Refuse("%s:%d can't found result file [%s]", kEntryFile, __LINE__, szArchive.c_str());
}

// A server's name that is too long for the command is refused: a cut command is another command.
bool SendReport(const std::string& szArchive) {
    const char* szServer = GetUPnPReportServer();
    const std::string szQuoted = tavo::lib::InQuotes(szServer == nullptr ? "" : szServer);
    char szCommand[tavo::lib::kCommandSize] = {};
    const int nLength = std::snprintf(
        szCommand, sizeof(szCommand), "%s --digest -u '%s:%s' -F 'uploadedfile=@%s;filename=%s' '%s' >/dev/null 2>&1",
        "/usr/tavo/bin/curl", kReportUser, kReportPassword, szArchive.c_str(), szArchive.c_str(), szQuoted.c_str());
    if (nLength < 0 || static_cast<size_t>(nLength) >= sizeof(szCommand) || TLIBCSystem(szCommand) != 0) {
        return Refuse("%s:%d update upnp router info failed", kEntryFile, __LINE__);
    }
    return true;
}

std::string ArchiveName(const std::string& szBrand) {
    char szArchive[2 * TAVO_TEXT_SIZE] = {};
    const auto nNow = static_cast<long>(std::time(nullptr));
    if (szBrand.empty()) {
        std::snprintf(szArchive, sizeof(szArchive), "/tmp/upnpresult_%ld.tgz", nNow);
    } else {
        std::snprintf(szArchive, sizeof(szArchive), "/tmp/%s_%ld.tgz", szBrand.c_str(), nNow);
    }
    return szArchive;
}

}  // namespace

int TLibWriteRecordIntoUpnpDB(const __tag_TAVO_ROUTER_RECORD* record) {
    return AtBorder(-1, [&] {
        if (record == nullptr) {
            LogError("%s:%d record is NULL", kEntryFile, __LINE__);
            return -1;
        }
        RouterUpnpDBUserWriter writer(tavo::lib::RouterKey(record->szBrand, record->szModel, record->szVersion));
        if (!writer.SetSupport(record->szSupport)) {
            LogError("%s:%d set support failed", kEntryFile, __LINE__);
            return -1;
        }
        if (!writer.SetMaxRule(record->nMaxRule)) {
            LogError("%s:%d set max rule failed", kEntryFile, __LINE__);
            return -1;
        }
        if (!writer.Sync()) {
            LogError("%s:%d fail add section into [%s][0x%04X %s:%d]", kEntryFile, __LINE__, kUpnpUserDb,
                     static_cast<unsigned>(TLIBCErrGet()), TLIBCErrorGetFile(), TLIBCErrorGetLine());
            return -1;
        }
        return 0;
    });
}

int TLibUploadTestUpnpCompatibilityFailResult() {
    return AtBorder(-1, [&] {
        RouterConf conf = {};
        std::string szBrand;
        if (!DescribeDetected(conf, szBrand)) {
            return -1;
        }
        SettingsAside aside;
        if (!aside.Move()) {
            return -1;
        }
        char szGateway[TAVO_TEXT_SIZE] = {};
        if (TLibGetGatewayIP(szGateway, sizeof(szGateway)) != 0) {
            LogError("%s:%d TLibGetGatewayIP() failed", kEntryFile, __LINE__);
            return -1;
        }
        if (TLibSetRouterConf(szGateway, &conf, nullptr, true) != 0) {
            LogError("%s:%d set router.conf failed", kEntryFile, __LINE__);
            return -1;
        }
        const std::string szArchive = ArchiveName(ArchiveBrand(szBrand.c_str()));
        if (!PackReport(szArchive)) {
            return -1;
        }
        aside.PutBack();  // an upload may take minutes
        return SendReport(szArchive) ? 0 : -1;
    });
}
