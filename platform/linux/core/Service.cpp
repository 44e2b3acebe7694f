// System services by the platform's names: through systemd where it runs, else through /etc/init.d.
// Relies on systemctl or the init script, started without a shell. Promises: names that are no plain
// service name are refused; every call ends within half a minute.
#include <algorithm>
#include <string>
#include <string_view>

#include "ground/Border.h"
#include "ground/Fail.h"
#include "ground/Unit.h"
#include "tavo/core.h"

namespace {

using tavo::Fail;

constexpr int kNameSize = 128;
constexpr char kTimeout[] = "timeout -k 2 28 ";  // for who does not heed the first signal, a second one

constexpr char kSystemd[] = "/run/systemd/system";  // there while systemd is the service manager
constexpr std::string_view kDaemons = "/usr/tavo/sbin/";
constexpr const char* kUnitDirs[] = {"/etc/systemd/system/", "/run/systemd/system/", "/usr/local/lib/systemd/system/",
                                     "/usr/lib/systemd/system/", "/lib/systemd/system/"};

// Where the system's name differs from the platform's.
struct Alias {
    std::string_view szPlatform;
    const char* szSystem;
};
constexpr Alias kAliases[] = {{"avahi", "avahi-daemon"}, {"tavorelayd", "tavorelayd"}};

bool IsServiceName(std::string_view szName) {
    constexpr std::string_view kAllowed = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789_.@-";
    return !szName.empty() && szName.size() < kNameSize && szName.front() != '-' && szName.front() != '.' &&
           szName.find_first_not_of(kAllowed) == std::string_view::npos;
}

// The system's name of a service; empty for a bad one.
std::string SystemName(const char* szName) {
    if (szName == nullptr || !IsServiceName(szName)) {
        return "";
    }
    const char* szDefault = szName;
    for (const Alias& alias : kAliases) {
        if (alias.szPlatform == szName) {
            szDefault = alias.szSystem;
        }
    }
    char szSystem[kNameSize];
    TLIBPlatformSettingGet("services", szName, szDefault, szSystem, sizeof(szSystem));
    return IsServiceName(szSystem) ? szSystem : "";
}

// Exit status of the service manager's verb; -1 for a bad name or no manager.
int Control(const char* szName, const char* szSystemdVerb, const char* szInitVerb) {
    return tavo::AtBorder(-1, [&] {
        const std::string szSystem = SystemName(szName);
        if (szSystem.empty()) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        if (TLIBCFileExist(kSystemd) == 1) {
            return TLIBCSystem((std::string(kTimeout) + "systemctl " + szSystemdVerb + " " + szSystem +
                                ".service >/dev/null 2>&1 </dev/null")
                                   .c_str());
        }
        const std::string szScript = "/etc/init.d/" + szSystem;
        if (TLIBCFileExist(szScript.c_str()) != 1) {
            return Fail(TLIBC_ERR_NOT_FOUND);
        }
        return TLIBCSystem((kTimeout + szScript + " " + szInitVerb + " >/dev/null 2>&1 </dev/null").c_str());
    });
}

}  // namespace

std::optional<bool> tavo::StartUnitOf(std::string_view szProgram) {
    const bool blOurs = szProgram.starts_with(kDaemons) && IsServiceName(szProgram.substr(kDaemons.size()));
    if (!blOurs || TLIBCFileExist(kSystemd) != 1) {
        return std::nullopt;
    }
    const std::string szUnit = std::string(szProgram.substr(kDaemons.size())) + ".service";
    if (std::none_of(std::begin(kUnitDirs), std::end(kUnitDirs),
                     [&](const char* szDir) { return TLIBCFileExist((szDir + szUnit).c_str()) == 1; })) {
        return std::nullopt;
    }
    // A unit that has crashed too often stays down until somebody asks for it: that is now.
    const std::string szQuiet = " " + szUnit + " >/dev/null 2>&1 </dev/null";
    return TLIBCSystem(
               (std::string(kTimeout) + "sh -c 'systemctl reset-failed" + szQuiet + "; systemctl start" + szQuiet + "'")
                   .c_str()) == 0;
}

int TLIBServiceIsRunning(const char* szName) {
    const int nStatus = Control(szName, "is-active", "status");
    return nStatus < 0 ? -1 : (nStatus == 0 ? 1 : 0);
}

int TLIBServiceReload(const char* szName) {
    return Control(szName, "reload", "reload") == 0 ? 0 : -1;
}

int TLIBServiceRestart(const char* szName) {
    return Control(szName, "restart", "restart") == 0 ? 0 : -1;
}
