// Questions and complaints that several commands share. Relies on the library's public header.
// Promises: see Box.h.
#include "Box.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <utility>

namespace tavo::cli {

namespace {

constexpr char kLockFile[] = "/tmp/routerconf.lock";
constexpr char kLockDirectory[] = "/tmp";

// Why the router lock can be held by nobody: an error number; 0 when it can.
int WhyLockless() {
    const int fd = open(kLockFile, O_RDWR | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK);
    const int nFault = fd < 0 ? errno : 0;
    if (fd >= 0) {
        close(fd);
    }
    return nFault == ENOENT && access(kLockDirectory, W_OK) == 0 ? 0 : nFault;  // it is made where it is missing
}

}  // namespace

std::optional<std::string> Gateway() {
    std::string szGateway;
    return GetGatewayIP(szGateway) != 0 ? std::optional(szGateway) : std::nullopt;
}

Reply NoGateway() {
    return {.enExit = kFailed,
            .szMessage =
                "this box has no default gateway, so there is no router to talk to: plug the cable in or see to the "
                "network settings ('ip route' shows the routes), then run 'sudo tavoportmap setup'"};
}

std::optional<Reply> NeedsRoot() {
    return geteuid() == 0
               ? std::nullopt
               : std::optional(Reply{.enExit = kFailed, .szMessage = "this command needs root: run it with sudo"});
}

Reply Busy() {
    if (const auto reply = NeedsRoot()) {
        return *reply;
    }
    if (const int nFault = WhyLockless(); nFault != 0) {
        return {.enExit = kFailed,
                .szMessage = fmt::format("nothing was begun: {} cannot be opened ({}), and it is what keeps two "
                                         "operations apart; is /tmp missing or read-only?",
                                         kLockFile, std::strerror(nFault))};
    }
    return {.enExit = kBusy, .szMessage = "another port-forwarding operation is running; try again when it has ended"};
}

Reply Failure(const std::string& szMessage) {
    return {.enExit = kFailed,
            .szMessage = szMessage + (geteuid() != 0 ? "\n(this needs root: try it with sudo)" : "")};
}

Way WayOf(const std::string& szUpnp, const std::string& szNatpmp) {
    if (szNatpmp == "yes") {
        return Way::kNatpmp;
    }
    if (szUpnp == "yes") {
        return Way::kUpnp;
    }
    return szUpnp == "no" && szNatpmp == "no" ? Way::kManual : Way::kUnknown;
}

std::string ToWords(Way enWay) {
    switch (enWay) {
        case Way::kNatpmp:
            return "NAT-PMP";
        case Way::kUpnp:
            return "UPnP";
        case Way::kManual:
            return "manual (through its own administration pages)";
        default:
            return "unknown";
    }
}

std::string RouterName(const std::string& szBrand, const std::string& szModel, const std::string& szVersion) {
    std::string szName = Clean(szBrand);
    szName += (szName.empty() || szModel.empty() ? "" : " ") + Clean(szModel);
    szName += szVersion.empty() ? "" : fmt::format("{}({})", szName.empty() ? "" : " ", Clean(szVersion));
    return szName;
}

std::optional<std::string> OtherLimit(const std::string& szBrand, const std::string& szModel,
                                      const std::string& szVersion, int nMaxRules) {
    int nKnown = -1;
    if (!RouterUpnpDB(szBrand, szModel, szVersion).GetMaxRule(nKnown) || nKnown < 0) {
        return "the number of rules that it holds could not be read back; the system log says why";
    }
    return nKnown == nMaxRules
               ? std::nullopt
               : std::optional(fmt::format("the downloaded database says that this router holds {}; its word comes "
                                           "before what is recorded here",
                                           nKnown == 0 ? "any number of rules" : fmt::format("{} rules", nKnown)));
}

std::optional<std::string> RecordMaxRules(const __tag_TAVO_ROUTER_CONF& conf, int nMaxRules) {
    __tag_TAVO_ROUTER_RECORD record = {"", "", "", "yes", nMaxRules};
    for (const auto& [szField, szValue] : {std::pair{record.szBrand, conf.szBrand},
                                           {record.szModel, conf.szModel},
                                           {record.szVersion, conf.szVersion}}) {
        std::snprintf(szField, TAVO_TEXT_SIZE, "%s", szValue);
    }
    if (TLibWriteRecordIntoUpnpDB(&record) != 0) {
        return "the number of rules could not be recorded in /etc/portforward/router_upnp.db.user";
    }
    return OtherLimit(conf.szBrand, conf.szModel, conf.szVersion, nMaxRules);
}

}  // namespace tavo::cli
