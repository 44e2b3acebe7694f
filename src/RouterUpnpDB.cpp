// Which routers honour UPnP, how many rules they hold and which description fits them. Relies on the
// platform's section files and the download tool. Promises: the downloaded file's word comes first,
// the user's own record second; a lookup never changes a file, but for fetching a lost database.

#include <strings.h>

#include <cstdio>
#include <cstring>

#include "Border.h"
#include "Log.h"
#include "Paths.h"
#include "Text.h"
#include "libtavoportmap.h"
#include "tavo/core.h"
#include "tavo/portforward.h"

namespace {

constexpr char kFile[] = "src/RouterUpnpDB.cpp";
constexpr char kDb[] = "/etc/portforward/router_upnp.db";
constexpr char kVersionFile[] = "/etc/portforward/routersdk_version";
constexpr char kDir[] = "/etc/portforward";
constexpr int kValueSize = 1024;
constexpr int kVersionSize = 8;

using tavo::lib::AtBorder;
using tavo::lib::kUpnpUserDb;
using tavo::lib::LogError;
using tavo::lib::Refuse;

bool Lookup(const char* szPath, const std::string& szSection, const char* szKey, char (&szValue)[kValueSize]) {
    return TLIBCFileGetSectionValue(szPath, szSection.c_str(), szKey, szValue, kValueSize) == 0;
}

// The downloaded file first, then the user's own.
bool LookupBoth(const std::string& szSection, const char* szKey, char (&szValue)[kValueSize]) {
    return Lookup(kDb, szSection, szKey, szValue) || Lookup(kUpnpUserDb, szSection, szKey, szValue);
}

// A location that is too long for the command is refused: a cut command is another command.
bool Download(const char* szName) {
    const char* szLocation = GetRouterDBPath();
    const std::string szQuoted = tavo::lib::InQuotes(szLocation == nullptr ? "" : szLocation);
    char szCommand[tavo::lib::kCommandSize] = {};
    const int nLength =
        std::snprintf(szCommand, sizeof(szCommand), "/usr/tavo/bin/wget '%s/%s' -O %s/%s >/dev/null 2>&1",
                      szQuoted.c_str(), szName, kDir, szName);
    if (nLength < 0 || static_cast<size_t>(nLength) >= sizeof(szCommand) || TLIBCSystem(szCommand) != 0) {
        return Refuse("%s:%d update upnp router info failed", kFile, __LINE__);
    }
    return true;
}

}  // namespace

RouterUpnpDB::RouterUpnpDB(const std::string& brand, const std::string& model, const std::string& version)
    : mSzKey(tavo::lib::RouterKey(brand, model, version)) {}

RouterUpnpDB::~RouterUpnpDB() = default;

bool RouterUpnpDB::IsValid() {
    if (TLIBCFileExist(kDb) != 1) {
        LogError("%s:%d %s is lost, try to recover ...", kFile, __LINE__, kDb);
        int nVersion = 0;
        if (!Update(nVersion)) {
            LogError("%s:%d %s recover failed", kFile, __LINE__, kDb);
        }
    }
    return mSzKey != "//" || Refuse("%s:%d query brand, model, version shall not empty", kFile, __LINE__);
}

bool RouterUpnpDB::GetSupport(std::string& support) {
    return AtBorder(false, [&] {
        if (!IsValid()) {
            return false;
        }
        // The maker's "no" is a verdict; the user's own failed test may have had other reasons.
        char szValue[kValueSize] = {};
        support = "unknown";
        if (Lookup(kDb, mSzKey, "support", szValue)) {
            support = strcasecmp(szValue, "yes") == 0 ? "yes" : "no";
        } else if (Lookup(kUpnpUserDb, mSzKey, "support", szValue) && strcasecmp(szValue, "yes") == 0) {
            support = "yes";
        }
        return true;
    });
}

bool RouterUpnpDB::GetMaxRule(int& nMaxRule) {
    return AtBorder(false, [&] {
        nMaxRule = -1;
        char szValue[kValueSize] = {};
        if (!IsValid() || !LookupBoth(mSzKey, "max", szValue)) {
            return false;
        }
        nMaxRule = tavo::lib::ToInt(szValue);
        return true;
    });
}

bool RouterUpnpDB::GetPfpath(std::string& pfpath) {
    return AtBorder(false, [&] {
        char szValue[kValueSize] = {};
        if (!IsValid() || !LookupBoth(mSzKey, "pfpath", szValue)) {
            return false;
        }
        pfpath = szValue;
        return true;
    });
}

bool RouterUpnpDB::Update(int& nVersion) {
    return AtBorder(false, [&] {
        if (!Download("routersdk_version")) {
            return false;
        }
        const int nCurrent = IGetCurrSyntaxVersion();
        char szVersion[kVersionSize] = {};
        if (TLIBCFileGetKeyValue(kVersionFile, "version", szVersion, sizeof(szVersion), 0) < 0) {
            return Refuse("%s:%d can not read router sdk version", kFile, __LINE__);
        }
        const int nServer = tavo::lib::ToInt(szVersion);
        // A database of another version is left alone: this tool could not read it.
        if (nCurrent == nServer && !Download("router_upnp.db")) {
            return false;
        }
        nVersion = nServer;
        return true;
    });
}
